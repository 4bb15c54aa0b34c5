# The parser of /proc/<pid>/limits, the module's keyword reader and the ranking of processes.
tarn_fuzz_target(extra_descriptors extra_descriptors.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/descriptors.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/extra_support.cpp)
target_include_directories(fuzz_extra_descriptors PRIVATE ${PROJECT_SOURCE_DIR}/src/extra)
target_compile_options(fuzz_extra_descriptors PRIVATE -fno-exceptions -fno-rtti)
