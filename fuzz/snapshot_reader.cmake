# The reader of the snapshot file for tarnmon: any bytes in, blocks that stay inside the text and a
# terminal text without control characters out.
add_executable(fuzz_snapshot_reader snapshot_reader.cpp
               ${PROJECT_SOURCE_DIR}/src/host/snapshot_reader.cpp)
target_include_directories(fuzz_snapshot_reader PRIVATE ${PROJECT_SOURCE_DIR}/src/host
                                                        ${PROJECT_SOURCE_DIR}/src/telvzmnd)
target_link_options(fuzz_snapshot_reader PRIVATE -fsanitize=fuzzer,address,undefined)
