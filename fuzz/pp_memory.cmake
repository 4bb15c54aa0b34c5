# The line handler of the per-process memory check over any line. The check, the split and the
# tables it reads are compiled here, so that they carry the fuzzer's coverage, over the platform that
# records nothing; the control file parser builds the tables once.
set(TARN_PP_MEMORY_FUZZ_SOURCES
    memory/pp_memory.cpp memory/name_matching.cpp core/words.cpp command_runner.cpp data_blocks.cpp core/control_file.cpp
    core/expression_budget.cpp core/settings.cpp core/validation.cpp core/problem_reporting.cpp
    core/control_block.cpp)
list(TRANSFORM TARN_PP_MEMORY_FUZZ_SOURCES PREPEND ${PROJECT_SOURCE_DIR}/src/telvzmnd/)
tarn_fuzz_target(pp_memory_line pp_memory_line.cpp support/quiet_platform.cpp
                 ${TARN_PP_MEMORY_FUZZ_SOURCES})
target_compile_options(fuzz_pp_memory_line PRIVATE -fno-exceptions -fno-rtti)
