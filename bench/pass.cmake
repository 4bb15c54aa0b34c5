# A whole pass of the five checks on this host against its commands alone, and the monitor's memory.
tarn_benchmark(pass pass.cpp)
target_compile_definitions(bench_pass PRIVATE TARN_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>"
                                              TARN_MODULE_DIR="$<TARGET_FILE_DIR:telvzmnd>")
add_dependencies(bench_pass runAsRoot telvzmnd)
