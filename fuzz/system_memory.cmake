# The line handlers of the system memory check over any output of free and /proc/meminfo, over the
# platform that records nothing.
set(TARN_SYSTEM_MEMORY_FUZZ_SOURCES
    memory/system_memory.cpp core/words.cpp command_runner.cpp data_blocks.cpp core/settings.cpp
    core/pass_figures.cpp)
list(TRANSFORM TARN_SYSTEM_MEMORY_FUZZ_SOURCES PREPEND ${PROJECT_SOURCE_DIR}/src/telvzmnd/)
tarn_fuzz_target(system_memory_output system_memory_output.cpp support/quiet_platform.cpp
                 ${TARN_SYSTEM_MEMORY_FUZZ_SOURCES})
target_compile_options(fuzz_system_memory_output PRIVATE -fno-exceptions -fno-rtti)
