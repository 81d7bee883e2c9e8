# tessarine_find_jdk(QUIET|REQUIRED): finds the JDK for the Java API, javac
# and jar (FindJava) and the JNI headers (FindJNI), from the same JDK. FindJNI
# only looks in JDK folders it knows, so unless JAVA_HOME says otherwise it is
# pointed at the JDK that javac belongs to. The JNI library links no JVM
# library (the JVM that loads it provides the symbols), so only the headers
# are required: without components FindJNI would also require AWT, which a
# headless JDK lacks, and the JVM library, which a cross build for another
# architecture has no use for. The headers are the same for every Linux
# architecture. Sets Java_Development_FOUND and JNI_FOUND.
macro(tessarine_find_jdk mode)
  find_package(Java 17 ${mode} COMPONENTS Development)
  if(Java_JAVAC_EXECUTABLE AND NOT JAVA_HOME AND NOT DEFINED ENV{JAVA_HOME})
    file(REAL_PATH ${Java_JAVAC_EXECUTABLE} _tessarine_javac)
    get_filename_component(JAVA_HOME ${_tessarine_javac}/../.. ABSOLUTE)
  endif()
  find_package(JNI ${mode} OPTIONAL_COMPONENTS JVM)
endmacro()
