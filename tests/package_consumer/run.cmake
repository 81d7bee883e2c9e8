# Run by CTest: configure, build and run a consumer project outside this tree,
# as an application would. Given LIBRARY_SOURCE_DIR, the project adds the
# library's sources to its own build; otherwise the built library is first
# installed into a fresh prefix and the project finds it there only. A cross
# build configures the project with its toolchain file and runs the program
# in its emulator.
file(REMOVE_RECURSE ${WORK_DIR})
set(prefix ${WORK_DIR}/prefix)

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE result)
  if(NOT result EQUAL 0)
    message(FATAL_ERROR "failed (${result}): ${ARGN}")
  endif()
endfunction()

set(options)
if(TOOLCHAIN_FILE)
  list(APPEND options -DCMAKE_TOOLCHAIN_FILE=${TOOLCHAIN_FILE})
endif()
if(SQLITE_LIBRARY)
  list(APPEND options -DSQLite3_LIBRARY=${SQLITE_LIBRARY})
endif()
if(LAUNCHER)
  list(APPEND options -DCMAKE_CXX_COMPILER_LAUNCHER=${LAUNCHER})
endif()
if(LIBRARY_SOURCE_DIR)
  list(APPEND options -DTESSARINE_SOURCE_DIR=${LIBRARY_SOURCE_DIR})
else()
  run(${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix})
  list(APPEND options -DCMAKE_PREFIX_PATH=${prefix} -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF)
endif()
separate_arguments(emulator UNIX_COMMAND "${EMULATOR}")

run(${CMAKE_COMMAND} -S ${SOURCE_DIR} -B ${WORK_DIR}/build -G ${GENERATOR} ${options})
run(${CMAKE_COMMAND} --build ${WORK_DIR}/build)
run(${emulator} ${WORK_DIR}/build/consumer ${WORK_DIR}/consumer.db)
