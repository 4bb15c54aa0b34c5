# One trace line of the default platform: written to its trace file, and dropped as a detail line.
tarn_benchmark(trace trace.cpp)
