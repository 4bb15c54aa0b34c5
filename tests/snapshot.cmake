# The snapshot file writer over the recording platform.
tarn_library_test(snapshot_file_test snapshot_file_test.cpp)

# Reading the snapshot file for tarnmon: a pure function of the text.
add_executable(snapshot_reader_test snapshot_reader_test.cpp
               ${PROJECT_SOURCE_DIR}/src/host/snapshot_reader.cpp)
target_include_directories(snapshot_reader_test PRIVATE ${PROJECT_SOURCE_DIR}/src/host
                                                        ${PROJECT_SOURCE_DIR}/src/telvzmnd)
target_link_libraries(snapshot_reader_test PRIVATE GTest::gtest_main)
gtest_discover_tests(snapshot_reader_test DISCOVERY_MODE PRE_TEST)

# The writer over the default platform's real files, and tarnmon reading what it wrote. The
# library's objects are linked in so that the test reaches the bound and the staging buffer.
if(TARGET telvplatform)
  tarn_platform_test(snapshot_platform_test
    SOURCES snapshot_platform_test.cpp $<TARGET_OBJECTS:telvzmnd_objects>
    LIBRARIES telvplatform)
  target_include_directories(snapshot_platform_test PRIVATE ${PROJECT_SOURCE_DIR}/src/host)
  add_dependencies(snapshot_platform_test tarnmon)
endif()

# The gathering of the appliance's trace beside the snapshots, over a fake runAsRoot.
tarn_library_test(trace_data_test trace_data_test.cpp support/fake_commands.cpp)
