# The alert switches and the logging type: each entry point over a control block of the test's
# own, and the monitoring loop that sees them, over fake commands, a fake /proc and a stepped clock.
tarn_library_test(alert_switches_test alert_switches_test.cpp support/fake_proc.cpp
                  support/fake_commands.cpp support/private_ipc.cpp CONTROL_BLOCK)
