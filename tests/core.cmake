tarn_library_test(problem_reporting_test problem_reporting_test.cpp)
tarn_library_test(control_block_test control_block_test.cpp support/private_ipc.cpp CONTROL_BLOCK)
# The monitoring loop end to end: fake commands for every check, a fake /proc, a stepped clock.
tarn_library_test(monitor_loop_test monitor_loop_test.cpp support/fake_proc.cpp
                  support/fake_commands.cpp support/private_ipc.cpp CONTROL_BLOCK)
# One test stops the loop with tarnmon stop.
add_dependencies(monitor_loop_test tarnmon)
