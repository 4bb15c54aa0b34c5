# The resident memory of tarnmon run over thousands of passes, in its own process, with time made
# to fly there by a library preloaded into it (support/fast_time.cpp). The library goes without
# the sanitizers: a preloaded library cannot bring their runtime.
add_library(tarn_fast_time SHARED support/fast_time.cpp)
target_compile_options(tarn_fast_time PRIVATE -fno-sanitize=all)
target_link_options(tarn_fast_time PRIVATE -fno-sanitize=all)
target_link_libraries(tarn_fast_time PRIVATE ${CMAKE_DL_LIBS})
tarn_benchmark(tarnmon_resident tarnmon_resident.cpp)
target_compile_definitions(bench_tarnmon_resident PRIVATE
  TARN_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>" TARN_MODULE_DIR="$<TARGET_FILE_DIR:telvzmnd>"
  TARN_TARNMON="$<TARGET_FILE:tarnmon>" TARN_FAST_TIME="$<TARGET_FILE:tarn_fast_time>")
add_dependencies(bench_tarnmon_resident runAsRoot telvzmnd tarnmon tarn_fast_time)
