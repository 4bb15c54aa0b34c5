tarn_platform_test(tarnmon_test SOURCES tarnmon_test.cpp support/private_ipc.cpp
                   support/run_command.cpp CONTROL_BLOCK)
add_dependencies(tarnmon_test tarnmon)
