# One update of the process CPU accounting per process, against a bare scan of /proc, over the
# library's own objects and the default platform (the recording one of the tests when the default
# platform is not built).
add_executable(bench_process_listing process_listing.cpp $<TARGET_OBJECTS:telvzmnd_objects>)
target_include_directories(bench_process_listing PRIVATE ${PROJECT_SOURCE_DIR}/src/telvzmnd
                                                         ${PROJECT_SOURCE_DIR}/src/platform)
target_link_libraries(bench_process_listing PRIVATE benchmark::benchmark)
if(TARGET telvplatform)
  target_link_libraries(bench_process_listing PRIVATE telvplatform)
  set_target_properties(bench_process_listing PROPERTIES BUILD_RPATH "$<TARGET_FILE_DIR:telvplatform>")
else()
  target_link_libraries(bench_process_listing PRIVATE recording_platform)
endif()
