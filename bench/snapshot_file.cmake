# One flush of the snapshot file writer, on the append path and on the wrap path, with snapshot
# files of 2, 5 and 20 MB in a temporary data directory of the default platform.
tarn_benchmark(snapshot_file snapshot_file.cpp)
