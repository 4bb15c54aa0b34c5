# One update of the process CPU accounting per process, against a bare scan of /proc.
tarn_benchmark(process_listing process_listing.cpp)
