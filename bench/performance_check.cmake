# The performance check against the update of the process CPU accounting alone.
tarn_benchmark(performance_check performance_check.cpp)
