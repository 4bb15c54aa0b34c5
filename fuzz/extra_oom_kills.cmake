# The parsers of /proc/vmstat's oom_kill line and of the kernel log's records of killed processes.
tarn_fuzz_target(extra_oom_kills extra_oom_kills.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/oom_kills.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/extra_support.cpp)
target_include_directories(fuzz_extra_oom_kills PRIVATE ${PROJECT_SOURCE_DIR}/src/extra)
target_compile_options(fuzz_extra_oom_kills PRIVATE -fno-exceptions -fno-rtti)
