# The system memory check over the recording platform, with a fake free and a fake cat first on
# PATH, and once over the host's own free and /proc/meminfo.
tarn_library_test(system_memory_test system_memory_test.cpp support/fake_commands.cpp
                  support/private_ipc.cpp CONTROL_BLOCK)
