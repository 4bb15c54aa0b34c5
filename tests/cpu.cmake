tarn_library_test(process_listing_test process_listing_test.cpp support/fake_proc.cpp)
# The performance check over a fake /proc, a control block of its own and a fake runAsRoot.
tarn_library_test(performance_test performance_test.cpp support/fake_proc.cpp
                  support/fake_commands.cpp support/private_ipc.cpp CONTROL_BLOCK)
# The check on the real /proc with the default platform and the project's runAsRoot and telvzstba:
# a busy child, found while no other test takes the processors.
if(TARGET telvplatform)
  tarn_platform_test(performance_platform_test
    SOURCES performance_platform_test.cpp support/private_ipc.cpp
            $<TARGET_OBJECTS:telvzmnd_objects>
    LIBRARIES telvplatform CONTROL_BLOCK ALONE)
  target_compile_definitions(performance_platform_test PRIVATE
                             TELV_LIBEXEC_DIR="$<TARGET_FILE_DIR:runAsRoot>")
  add_dependencies(performance_platform_test runAsRoot)
endif()
