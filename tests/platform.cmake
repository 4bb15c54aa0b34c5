# The default platform, tested through the shared library as a host loads it, and its hidden core.

# A module for the module service to resolve, kept in a directory of its own.
add_library(telvtestmodule SHARED platform_module/test_module.cpp)
set_target_properties(telvtestmodule PROPERTIES
  LIBRARY_OUTPUT_DIRECTORY ${CMAKE_CURRENT_BINARY_DIR}/platform_module)

# A process that leaves blocks live at exit, for the leak report.
add_executable(platform_leaker platform_module/leaker.cpp)
target_include_directories(platform_leaker PRIVATE ${PROJECT_SOURCE_DIR}/src/platform)
target_link_libraries(platform_leaker PRIVATE telvplatform)

tarn_platform_test(platform_test
  SOURCES platform_files_test.cpp platform_trace_test.cpp platform_event_test.cpp
          platform_memory_test.cpp platform_module_test.cpp platform_boundary_test.cpp
          platform_test_support.cpp
  LIBRARIES telvplatform)
target_compile_definitions(platform_test PRIVATE
  TELV_TEST_MODULE_DIR="$<TARGET_FILE_DIR:telvtestmodule>"
  TELV_TEST_LEAKER="$<TARGET_FILE:platform_leaker>")
add_dependencies(platform_test telvtestmodule platform_leaker)

tarn_platform_test(platform_core_test
  SOURCES platform_core_test.cpp platform_test_support.cpp
  LIBRARIES telvplatform_core)
target_compile_definitions(platform_core_test PRIVATE
  TELV_TEST_MODULE_DIR="$<TARGET_FILE_DIR:telvtestmodule>")
add_dependencies(platform_core_test telvtestmodule)
