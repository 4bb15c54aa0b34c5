# The stat-line parser of the process CPU accounting. The accounting's source is compiled here, so
# that it carries the fuzzer's coverage, over the platform that records nothing.
add_executable(fuzz_process_stat_line process_stat_line.cpp support/quiet_platform.cpp
               ${PROJECT_SOURCE_DIR}/src/telvzmnd/cpu/process_listing.cpp
               ${PROJECT_SOURCE_DIR}/src/telvzmnd/core/pass_figures.cpp)
target_include_directories(fuzz_process_stat_line PRIVATE ${PROJECT_SOURCE_DIR}/src/telvzmnd
                                                          ${PROJECT_SOURCE_DIR}/src/platform)
target_compile_options(fuzz_process_stat_line PRIVATE -fno-exceptions -fno-rtti)
target_link_options(fuzz_process_stat_line PRIVATE -fsanitize=fuzzer,address,undefined)
