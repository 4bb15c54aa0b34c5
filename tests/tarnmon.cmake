# tarnmon's --json output is read back by a strict reader of the tests' own; its string escaper is
# also tested directly.
tarn_platform_test(tarnmon_test SOURCES tarnmon_test.cpp support/private_ipc.cpp
                   support/run_command.cpp support/json_value.cpp platform_test_support.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/json_writer.cpp CONTROL_BLOCK)
target_include_directories(tarnmon_test PRIVATE ${PROJECT_SOURCE_DIR}/src/host)
add_dependencies(tarnmon_test tarnmon)
# tarnmon run: the built program over the built library and the build's appliance programs, with
# a fake ps first on PATH.
tarn_platform_test(tarnmon_run_test SOURCES tarnmon_run_test.cpp support/private_ipc.cpp
                   support/run_command.cpp support/fake_commands.cpp
                   LIBRARIES recording_platform CONTROL_BLOCK)
add_dependencies(tarnmon_run_test tarnmon telvzmnd runAsRoot cleanupPartition)
