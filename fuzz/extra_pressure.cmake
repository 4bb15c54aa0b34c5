# The parser of /proc/pressure files and the line of a resource.
tarn_fuzz_target(extra_pressure extra_pressure.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/pressure.cpp
                 ${PROJECT_SOURCE_DIR}/src/extra/extra_support.cpp)
target_include_directories(fuzz_extra_pressure PRIVATE ${PROJECT_SOURCE_DIR}/src/extra)
target_compile_options(fuzz_extra_pressure PRIVATE -fno-exceptions -fno-rtti)
