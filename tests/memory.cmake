# The memory checks over the recording platform.
tarn_library_test(override_table_test override_table_test.cpp support/private_ipc.cpp CONTROL_BLOCK)
# The command runner every check uses, the output-block rule of primaryDataBlock, and the
# per-process memory check, both line by line and over a fake ps first on PATH.
tarn_library_test(command_runner_test command_runner_test.cpp support/fake_commands.cpp)
tarn_library_test(data_blocks_test data_blocks_test.cpp)
tarn_library_test(pp_memory_test pp_memory_test.cpp support/fake_commands.cpp
                  support/private_ipc.cpp CONTROL_BLOCK)
# One test runs tarnmon limits and checks a listing of the command it ran.
add_dependencies(pp_memory_test tarnmon)
