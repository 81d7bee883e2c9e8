# Provides flatbuffers::flatbuffers for the FlatBuffers headers, the only part
# of FlatBuffers the library uses (its runtime is header-only). Included by the
# build and by the installed package's config.
#
# A native build takes the FlatBuffers CMake package. A cross build (Debian's
# cross toolchains, the Android NDK) has none for its target: there the headers
# are looked up on the target's include path, or taken from
# TESSARINE_FLATBUFFERS_INCLUDE_DIR, a directory holding flatbuffers/ and
# nothing of the build machine's system headers. They must be of the version
# of the flatc that generated the wire tables (the generated header checks it).
#
# The target is made global when it is made here: the library's include
# directories name it, and an application that adds the library with
# add_subdirectory resolves them in its own directory.
if(TARGET flatbuffers::flatbuffers)
  return()
endif()
find_package(FlatBuffers CONFIG QUIET)
if(TARGET flatbuffers::flatbuffers)
  set_target_properties(flatbuffers::flatbuffers PROPERTIES IMPORTED_GLOBAL TRUE)
  return()
endif()
find_path(TESSARINE_FLATBUFFERS_INCLUDE_DIR flatbuffers/flatbuffers.h
  DOC "Directory holding the FlatBuffers headers (flatbuffers/flatbuffers.h)")
if(TESSARINE_FLATBUFFERS_INCLUDE_DIR)
  add_library(flatbuffers::flatbuffers INTERFACE IMPORTED GLOBAL)
  set_target_properties(flatbuffers::flatbuffers PROPERTIES
    INTERFACE_INCLUDE_DIRECTORIES "${TESSARINE_FLATBUFFERS_INCLUDE_DIR}")
endif()
