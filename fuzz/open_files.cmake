# The line handlers of the open files check over any file-nr output and any descriptor listing,
# over the platform that records nothing.
set(TARN_OPEN_FILES_FUZZ_SOURCES
    storage/open_files.cpp core/words.cpp command_runner.cpp data_blocks.cpp core/settings.cpp
    core/pass_figures.cpp)
list(TRANSFORM TARN_OPEN_FILES_FUZZ_SOURCES PREPEND ${PROJECT_SOURCE_DIR}/src/telvzmnd/)
tarn_fuzz_target(open_files_listing open_files_listing.cpp support/quiet_platform.cpp
                 ${TARN_OPEN_FILES_FUZZ_SOURCES})
target_compile_options(fuzz_open_files_listing PRIVATE -fno-exceptions -fno-rtti)
