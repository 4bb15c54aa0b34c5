# The appliance programs of libexec/, run for real. The tests also build runAsRoot with one more
# script name on its list and cleanupPartition reading the policy file a test names, so that
# neither of these is in the programs that are installed.
add_executable(runAsRoot_for_tests ${PROJECT_SOURCE_DIR}/libexec/run_as_root.cpp)
target_compile_definitions(runAsRoot_for_tests PRIVATE RUN_AS_ROOT_EXTRA_SCRIPT="show-call")
add_executable(cleanupPartition_for_tests ${PROJECT_SOURCE_DIR}/libexec/cleanup_partition.cpp)
target_compile_definitions(cleanupPartition_for_tests PRIVATE
  CLEANUP_POLICY_VARIABLE="TELV_CLEANUP_POLICY")
set_target_properties(runAsRoot_for_tests cleanupPartition_for_tests PROPERTIES
  RUNTIME_OUTPUT_DIRECTORY ${CMAKE_CURRENT_BINARY_DIR}/libexec_for_tests)

tarn_platform_test(libexec_test SOURCES libexec_test.cpp)
target_compile_definitions(libexec_test PRIVATE
  TELV_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>"
  TELV_RUN_AS_ROOT_FOR_TESTS="$<TARGET_FILE:runAsRoot_for_tests>"
  TELV_CLEANUP_PARTITION_FOR_TESTS="$<TARGET_FILE:cleanupPartition_for_tests>")
add_dependencies(libexec_test runAsRoot cleanupPartition runAsRoot_for_tests
                 cleanupPartition_for_tests)
