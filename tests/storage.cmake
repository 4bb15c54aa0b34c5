# The storage checks over the recording platform, with fake appliance programs first on PATH.
tarn_library_test(file_listing_test file_listing_test.cpp support/fake_commands.cpp)
tarn_library_test(file_system_test file_system_test.cpp support/fake_commands.cpp)
tarn_library_test(open_files_test open_files_test.cpp support/fake_commands.cpp)
# The open files check also runs once with the project's own runAsRoot and lsmon.sh.
target_compile_definitions(open_files_test PRIVATE TELV_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>")
add_dependencies(open_files_test runAsRoot)
