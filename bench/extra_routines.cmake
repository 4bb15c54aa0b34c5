# Each routine of libtelvzextra.so against the bare reads of the files it needs, over the module's
# own objects (the library's and the platform's are not needed).
add_executable(bench_extra_routines extra_routines.cpp
               ${CMAKE_CURRENT_SOURCE_DIR}/support/idle_processes.cpp
               $<TARGET_OBJECTS:telvzextra_objects>)
target_include_directories(bench_extra_routines PRIVATE ${CMAKE_CURRENT_SOURCE_DIR}
                                                        ${PROJECT_SOURCE_DIR}/src/extra)
target_link_libraries(bench_extra_routines PRIVATE benchmark::benchmark)
