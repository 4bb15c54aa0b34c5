# The system memory check against its two commands alone.
tarn_benchmark(system_memory system_memory.cpp)
