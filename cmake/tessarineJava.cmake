# tessarine_find_jdk(QUIET|REQUIRED): finds the JDK for the Java API, javac
# and jar (FindJava) and the JNI headers (FindJNI), from the same JDK. FindJNI
# only looks in JDK folders it knows, so unless JAVA_HOME says otherwise it is
# pointed at the JDK that javac belongs to. The JNI library links no JVM
# library (the JVM that loads it provides the symbols); FindJNI's JVM
# component is asked for because without components it also wants AWT, which
# a headless JDK lacks. Sets Java_Development_FOUND and JNI_FOUND.
macro(tessarine_find_jdk mode)
  find_package(Java 17 ${mode} COMPONENTS Development)
  if(Java_JAVAC_EXECUTABLE AND NOT JAVA_HOME AND NOT DEFINED ENV{JAVA_HOME})
    file(REAL_PATH ${Java_JAVAC_EXECUTABLE} _tessarine_javac)
    get_filename_component(JAVA_HOME ${_tessarine_javac}/../.. ABSOLUTE)
  endif()
  find_package(JNI ${mode} COMPONENTS JVM)
endmacro()
