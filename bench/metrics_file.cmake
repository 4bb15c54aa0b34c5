# What tarnmon run --metrics adds to a pass: the exposition of its figures and the file replaced.
tarn_benchmark(metrics_file metrics_file.cpp ${PROJECT_SOURCE_DIR}/src/host/metrics_file.cpp
               ${PROJECT_SOURCE_DIR}/src/host/snapshot_reader.cpp
               ${PROJECT_SOURCE_DIR}/src/host/utf8.cpp)
target_include_directories(bench_metrics_file PRIVATE ${PROJECT_SOURCE_DIR}/src/host)
