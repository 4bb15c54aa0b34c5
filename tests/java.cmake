# The Java class and the Java bridge in real JVMs, each made inside its test program:
# java_host_test runs the scenarios of the Java test program java/telv/monitor/HostMonitorTest.java
# over the built jar and libraries, java_bridge_test drives the bridge of libtelvplatform.so.
add_jar(telvzmnd_test_jar
  SOURCES java/telv/monitor/HostMonitorTest.java
  INCLUDE_JARS telvzmnd_jar
  OUTPUT_NAME telvzmnd-test)
get_target_property(TARN_JAR telvzmnd_jar JAR_FILE)
get_target_property(TARN_TEST_JAR telvzmnd_test_jar JAR_FILE)

tarn_platform_test(java_host_test
  SOURCES java_host_test.cpp support/java_vm.cpp support/private_ipc.cpp
          support/fake_commands.cpp
  LIBRARIES ${JAVA_JVM_LIBRARY} CONTROL_BLOCK)
target_compile_definitions(java_host_test PRIVATE
  TARN_JAVA_CLASS_PATH="${TARN_JAR}:${TARN_TEST_JAR}"
  TARN_JAVA_NATIVE_LIBRARY="$<TARGET_FILE:telvzjava>")
target_include_directories(java_host_test PRIVATE ${JNI_INCLUDE_DIRS})
add_dependencies(java_host_test telvzjava telvzmnd_jar telvzmnd_test_jar tarnmon telvzextra)
# The example's module telvzextra is found beside the platform, from whose folder the loader
# searches; a sanitizer's runtime makes every dlopen its own, so the loader searches from this
# program instead, which must then name that folder too.
set_target_properties(java_host_test PROPERTIES BUILD_RPATH "$<TARGET_FILE_DIR:telvzextra>")

# The bridge's exported services, with the core's text helpers beside them.
tarn_platform_test(java_bridge_test
  SOURCES java_bridge_test.cpp support/java_vm.cpp
  LIBRARIES telvplatform telvplatform_core ${JAVA_JVM_LIBRARY})
target_include_directories(java_bridge_test PRIVATE ${JNI_INCLUDE_DIRS})
target_compile_definitions(java_bridge_test PRIVATE TARN_JAVA_CLASS_PATH="${TARN_JAR}")
add_dependencies(java_bridge_test telvzmnd_jar telvzjava)
