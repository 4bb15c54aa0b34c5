# The control file: its parser, the settings table, validation and the sample external routines,
# over the recording platform; tarnmon check-config and routine resolution over the real one.
tarn_library_test(control_file_test control_file_test.cpp)
tarn_library_test(expression_budget_test expression_budget_test.cpp)
tarn_library_test(validation_test validation_test.cpp)
tarn_library_test(external_checks_test external_checks_test.cpp)

if(TARGET tarnmon)
  tarn_platform_test(control_file_platform_test
    SOURCES check_config_test.cpp external_checks_platform_test.cpp platform_test_support.cpp
    LIBRARIES telvzmnd telvplatform)
  add_dependencies(control_file_platform_test tarnmon)
endif()
