# The line handler of the file system check over any output of df, over the platform that records
# nothing and counting stand-ins for the listing and clean-up runs, so that no child is started.
set(TARN_FILE_SYSTEM_FUZZ_SOURCES
    storage/file_system.cpp core/words.cpp command_runner.cpp data_blocks.cpp core/settings.cpp
    core/pass_figures.cpp)
list(TRANSFORM TARN_FILE_SYSTEM_FUZZ_SOURCES PREPEND ${PROJECT_SOURCE_DIR}/src/telvzmnd/)
tarn_fuzz_target(df_line df_line.cpp support/quiet_platform.cpp ${TARN_FILE_SYSTEM_FUZZ_SOURCES})
target_compile_options(fuzz_df_line PRIVATE -fno-exceptions -fno-rtti)
