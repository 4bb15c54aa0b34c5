# The manual pages of BUILD/man/. man_page_test walks the settings table and finds each keyword's
# entry in telvzopt.trm(5); man_test.sh renders both pages with groff and man, which must warn of
# nothing, and finds every command, option and exit status of tarnmon's own help in tarnmon(1).
tarn_library_test(man_page_test man_page_test.cpp)
add_dependencies(man_page_test man_page_files)
add_test(NAME man_render COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/man_test.sh render ${PROJECT_BINARY_DIR})
add_test(NAME man_tarnmon_commands
  COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/man_test.sh commands ${PROJECT_BINARY_DIR})
