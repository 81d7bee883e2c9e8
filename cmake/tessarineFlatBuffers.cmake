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
if(NOT TARGET flatbuffers::flatbuffers)
  find_package(FlatBuffers CONFIG QUIET)
endif()
if(NOT TARGET flatbuffers::flatbuffers)
  find_path(TESSARINE_FLATBUFFERS_INCLUDE_DIR flatbuffers/flatbuffers.h
    DOC "Directory holding the FlatBuffers headers (flatbuffers/flatbuffers.h)")
  if(TESSARINE_FLATBUFFERS_INCLUDE_DIR)
    add_library(flatbuffers::flatbuffers INTERFACE IMPORTED)
    set_target_properties(flatbuffers::flatbuffers PROPERTIES
      INTERFACE_INCLUDE_DIRECTORIES "${TESSARINE_FLATBUFFERS_INCLUDE_DIR}")
  endif()
endif()
