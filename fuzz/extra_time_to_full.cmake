# The parsers of /proc/filesystems and /proc/self/mounts, and the running line of used space.
tarn_fuzz_target(extra_time_to_full extra_time_to_full.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/time_to_full.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/extra_support.cpp)
target_include_directories(fuzz_extra_time_to_full PRIVATE ${PROJECT_SOURCE_DIR}/src/extra)
target_compile_options(fuzz_extra_time_to_full PRIVATE -fno-exceptions -fno-rtti)
