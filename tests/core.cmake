tarn_library_test(problem_reporting_test problem_reporting_test.cpp)
tarn_library_test(control_block_test control_block_test.cpp support/private_ipc.cpp CONTROL_BLOCK)
# The monitoring loop end to end: fake commands for every check, a fake /proc, a stepped clock.
tarn_library_test(monitor_loop_test monitor_loop_test.cpp support/fake_proc.cpp
                  support/fake_commands.cpp support/private_ipc.cpp CONTROL_BLOCK)
# One test stops the loop with tarnmon stop.
add_dependencies(monitor_loop_test tarnmon)
# The loop over the built shared libraries as a host loads them, its external routines resolved by
# the default platform's module service: the library's samples and those of a test module, kept in
# a directory of its own that TELV_MODULE_PATH names before the library's.
if(TARGET telvplatform)
  add_library(tarnchecktest SHARED support/tarnchecktest.cpp)
  target_include_directories(tarnchecktest PRIVATE ${PROJECT_SOURCE_DIR}/src/platform)
  target_link_libraries(tarnchecktest PRIVATE telvplatform)
  set_target_properties(tarnchecktest PROPERTIES
    LIBRARY_OUTPUT_DIRECTORY ${CMAKE_CURRENT_BINARY_DIR}/check_module)
  tarn_platform_test(monitor_loop_platform_test
    SOURCES monitor_loop_platform_test.cpp platform_test_support.cpp support/private_ipc.cpp
            support/fake_commands.cpp
    LIBRARIES telvzmnd telvplatform ${CMAKE_DL_LIBS} CONTROL_BLOCK)
  target_compile_definitions(monitor_loop_platform_test PRIVATE
    TARN_CHECK_MODULE_DIR="$<TARGET_FILE_DIR:tarnchecktest>"
    TARN_LIBRARY_DIR="$<TARGET_FILE_DIR:telvzmnd>")
  # The test stands in front of the platform's module service: the library binds to its
  # definitions, which pass every call on.
  target_link_options(monitor_loop_platform_test PRIVATE
    -Wl,--export-dynamic-symbol=modsvc_get_func_addr2
    -Wl,--export-dynamic-symbol=modsvc_release_func_addr)
  add_dependencies(monitor_loop_platform_test tarnchecktest)
endif()
# The snapshot file of a quiet pass and of a pass with a finding, byte for byte, with the event of
# the finding: fake commands, a fake /proc and a fixed clock make every byte known.
tarn_library_test(monitor_loop_snapshot_test monitor_loop_snapshot_test.cpp support/fake_proc.cpp
                  support/fake_commands.cpp support/private_ipc.cpp CONTROL_BLOCK)
