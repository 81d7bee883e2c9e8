# cmake -DREADELF=<readelf> -DFILES=<lib;lib...> -P CheckPageAlignment.cmake
#
# Fails unless every LOAD segment of every library in FILES is aligned to at
# least 16 KB (0x4000), as Android devices with 16 KB memory pages require of
# 64-bit native libraries. Reads the program headers with readelf -lW, whose
# last column of a LOAD line is the segment's alignment.
set(required 16384)
foreach(file IN LISTS FILES)
  execute_process(COMMAND ${READELF} -lW ${file} OUTPUT_VARIABLE headers RESULT_VARIABLE result)
  if(NOT result EQUAL 0)
    message(FATAL_ERROR "${READELF} cannot read ${file}")
  endif()
  string(REGEX MATCHALL "\n *LOAD[^\n]*" loads "${headers}")
  if(NOT loads)
    message(FATAL_ERROR "${file}: no LOAD segment found")
  endif()
  foreach(load IN LISTS loads)
    string(REGEX MATCH "0x[0-9a-fA-F]+$" align "${load}")
    math(EXPR value "${align}")
    if(value LESS required)
      message(FATAL_ERROR "${file}: a LOAD segment is aligned to ${align}, less than 16 KB:${load}")
    endif()
  endforeach()
  list(LENGTH loads count)
  message(STATUS "${file}: ${count} LOAD segments, all aligned to 16 KB or more")
endforeach()
