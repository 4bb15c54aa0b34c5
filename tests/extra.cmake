# The module of extra checking routines (src/extra): each routine over fixture trees of /proc files
# and once on this host, over the module's own objects.
add_executable(extra_routines_test
  extra_support_test.cpp extra_pressure_test.cpp extra_oom_kills_test.cpp
  extra_descriptors_test.cpp extra_time_to_full_test.cpp $<TARGET_OBJECTS:telvzextra_objects>)
target_include_directories(extra_routines_test PRIVATE ${PROJECT_SOURCE_DIR}/src/extra)
tarn_register_test(extra_routines_test "" "")
# The module resolved by the default platform's module service, beside libtelvzmnd.so in the build
# root, and called by the real loop.
if(TARGET telvplatform)
  tarn_platform_test(extra_module_platform_test
    SOURCES extra_module_platform_test.cpp platform_test_support.cpp support/private_ipc.cpp
            support/fake_commands.cpp
    LIBRARIES telvzmnd telvplatform ${CMAKE_DL_LIBS} CONTROL_BLOCK)
  target_compile_definitions(extra_module_platform_test PRIVATE
    TARN_LIBRARY_DIR="$<TARGET_FILE_DIR:telvzmnd>")
  add_dependencies(extra_module_platform_test telvzextra)
endif()
