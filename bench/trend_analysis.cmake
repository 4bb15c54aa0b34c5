# One trend analysis call over full tables, with the record step's index and with the walk it
# stands in for.
tarn_benchmark(trend_analysis trend_analysis.cpp)
