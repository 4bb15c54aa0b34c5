# The install tree and the Debian package, checked as shell scripts: cmake --install into a
# scratch DESTDIR and the installed programs run from there; the package built by
# tools/package.sh and extracted with dpkg -x; the service unit through systemd-analyze verify.
# A script exits 77 for a test it skips.
add_test(NAME install_tree
  COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/install_test.sh ${PROJECT_BINARY_DIR}
          ${CMAKE_CURRENT_BINARY_DIR}/install_tree)
add_test(NAME service_unit
  COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/unit_test.sh ${PROJECT_BINARY_DIR}
          ${CMAKE_CURRENT_BINARY_DIR}/service_unit)
set_tests_properties(install_tree service_unit PROPERTIES SKIP_RETURN_CODE 77)
# The package is a plain build of its own, whatever this build's options: the plain build alone
# makes it.
if(NOT TARN_SANITIZE AND NOT TARN_SANITIZE_THREAD)
  add_test(NAME debian_package
    COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/package_test.sh ${PROJECT_SOURCE_DIR}
            ${CMAKE_CURRENT_BINARY_DIR}/debian_package)
  set_tests_properties(debian_package PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 1800 PROCESSORS 2)
endif()
