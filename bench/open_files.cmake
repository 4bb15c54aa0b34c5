# The open files check against its two commands alone, with the project's own runAsRoot and
# lsmon.sh, and the clear of lsDataBlock at each directory of the listing.
tarn_benchmark(open_files open_files.cpp)
target_compile_definitions(bench_open_files PRIVATE TARN_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>")
add_dependencies(bench_open_files runAsRoot)
