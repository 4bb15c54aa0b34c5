# One update of the process CPU accounting per process, against a bare scan of /proc. The
# accounting's source is compiled in with the library's flags, over the default platform (the
# recording one of the tests when the default platform is not built).
add_executable(bench_process_listing process_listing.cpp
               ${PROJECT_SOURCE_DIR}/src/telvzmnd/cpu/process_listing.cpp)
target_include_directories(bench_process_listing PRIVATE ${PROJECT_SOURCE_DIR}/src/telvzmnd
                                                         ${PROJECT_SOURCE_DIR}/src/platform)
target_link_libraries(bench_process_listing PRIVATE benchmark::benchmark)
if(TARGET telvplatform)
  target_link_libraries(bench_process_listing PRIVATE telvplatform)
  set_target_properties(bench_process_listing PROPERTIES BUILD_RPATH "$<TARGET_FILE_DIR:telvplatform>")
else()
  target_link_libraries(bench_process_listing PRIVATE recording_platform)
endif()
