tarn_platform_test(tarnmon_test SOURCES tarnmon_test.cpp support/private_ipc.cpp
                   support/run_command.cpp CONTROL_BLOCK)
add_dependencies(tarnmon_test tarnmon)
# tarnmon run: the built program over the built library and the build's appliance programs, with
# a fake ps first on PATH.
tarn_platform_test(tarnmon_run_test SOURCES tarnmon_run_test.cpp support/private_ipc.cpp
                   support/run_command.cpp support/fake_commands.cpp
                   LIBRARIES recording_platform CONTROL_BLOCK)
add_dependencies(tarnmon_run_test tarnmon telvzmnd runAsRoot cleanupPartition)
