# The per-process memory check against its command alone, and the start of a child in a large host.
tarn_benchmark(pp_memory pp_memory.cpp)
