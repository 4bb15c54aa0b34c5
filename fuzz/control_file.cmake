# The control file parser over any text. The parser and what it calls in the library are compiled
# here, so that they carry the fuzzer's coverage, over a platform that records nothing.
set(TARN_CONTROL_FILE_FUZZ_SOURCES
    core/control_file.cpp core/expression_budget.cpp core/words.cpp core/settings.cpp
    core/validation.cpp core/problem_reporting.cpp core/control_block.cpp data_blocks.cpp)
list(TRANSFORM TARN_CONTROL_FILE_FUZZ_SOURCES PREPEND ${PROJECT_SOURCE_DIR}/src/telvzmnd/)
tarn_fuzz_target(control_file control_file.cpp support/quiet_platform.cpp
                 ${TARN_CONTROL_FILE_FUZZ_SOURCES})
target_compile_options(fuzz_control_file PRIVATE -fno-exceptions -fno-rtti)
