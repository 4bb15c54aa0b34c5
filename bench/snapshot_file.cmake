# One flush of the snapshot file writer, on the append path and on the wrap path, with snapshot
# files of 2, 5 and 20 MB in a temporary data directory of the default platform (the recording
# one of the tests when the default platform is not built). The library's objects are linked in so
# that the benchmark sets the bound of the file.
add_executable(bench_snapshot_file snapshot_file.cpp $<TARGET_OBJECTS:telvzmnd_objects>)
target_include_directories(bench_snapshot_file PRIVATE ${PROJECT_SOURCE_DIR}/src/telvzmnd
                                                       ${PROJECT_SOURCE_DIR}/src/platform)
target_link_libraries(bench_snapshot_file PRIVATE benchmark::benchmark)
if(TARGET telvplatform)
  target_link_libraries(bench_snapshot_file PRIVATE telvplatform)
  set_target_properties(bench_snapshot_file PROPERTIES BUILD_RPATH "$<TARGET_FILE_DIR:telvplatform>")
else()
  target_link_libraries(bench_snapshot_file PRIVATE recording_platform)
endif()
