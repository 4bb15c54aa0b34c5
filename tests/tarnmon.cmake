# tarnmon's --json output is read back by a strict reader of the tests' own; its string escaper is
# also tested directly.
tarn_platform_test(tarnmon_test SOURCES tarnmon_test.cpp support/private_ipc.cpp
                   support/run_command.cpp support/json_value.cpp platform_test_support.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/json_writer.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/utf8.cpp CONTROL_BLOCK)
target_include_directories(tarnmon_test PRIVATE ${PROJECT_SOURCE_DIR}/src/host)
add_dependencies(tarnmon_test tarnmon)
# tarnmon run: the built program over the built library and the build's appliance programs, with
# a fake ps first on PATH.
tarn_platform_test(tarnmon_run_test SOURCES tarnmon_run_test.cpp support/private_ipc.cpp
                   support/prometheus_text.cpp
                   support/run_command.cpp support/fake_commands.cpp
                   LIBRARIES recording_platform CONTROL_BLOCK)
add_dependencies(tarnmon_run_test tarnmon telvzmnd runAsRoot cleanupPartition)
# The metrics file of tarnmon run: its text read back by a strict reader of the exposition format
# (support/prometheus_text), its replacement while a reader reads it.
tarn_platform_test(metrics_file_test SOURCES metrics_file_test.cpp support/prometheus_text.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/metrics_file.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/snapshot_reader.cpp
                   ${PROJECT_SOURCE_DIR}/src/host/utf8.cpp)
target_include_directories(metrics_file_test PRIVATE ${PROJECT_SOURCE_DIR}/src/host)
