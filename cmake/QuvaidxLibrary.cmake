# quvaidx_package_library(NAME OBJECTS <object library> MAP <version script>
#                         VERSION <x.y.z> SOVERSION <n>)
#
# Packages one object library twice, compiled once: lib<NAME>.so exports only
# what the version script names (the objects are built with hidden
# visibility), lib<NAME>.a carries every object, internal seams included,
# which is what the tests link. Makes the targets <NAME> and <NAME>_static,
# both with the public include directory, and the ALIAS targets
# <NAME>::<NAME> and <NAME>::<NAME>_static.
function(quvaidx_package_library name)
  cmake_parse_arguments(PARSE_ARGV 1 ARG "" "OBJECTS;MAP;VERSION;SOVERSION" "")
  set_target_properties(${ARG_OBJECTS} PROPERTIES
    POSITION_INDEPENDENT_CODE ON
    CXX_VISIBILITY_PRESET hidden
    VISIBILITY_INLINES_HIDDEN ON)
  quvaidx_fuzz_instrument(${ARG_OBJECTS})

  add_library(${name} SHARED $<TARGET_OBJECTS:${ARG_OBJECTS}>)
  add_library(${name}_static STATIC $<TARGET_OBJECTS:${ARG_OBJECTS}>)
  foreach(t ${name} ${name}_static)
    target_include_directories(${t} PUBLIC
      $<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/include>
      $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
  endforeach()
  # A library finds the libraries installed beside it (libquvaidx.so its
  # libquvahost.so) without the loader's cache or LD_LIBRARY_PATH.
  set_target_properties(${name} PROPERTIES
    INSTALL_RPATH "$ORIGIN"
    VERSION ${ARG_VERSION}
    SOVERSION ${ARG_SOVERSION}
    LINK_DEPENDS ${ARG_MAP})
  # Appended, not set: the sanitizer link options of the build must stay.
  target_link_options(${name} PRIVATE "LINKER:--version-script=${ARG_MAP}")
  if(NOT QUVAIDX_SANITIZE AND NOT QUVAIDX_BUILD_FUZZ)
    # Sanitizer runtimes are linked into executables, not into libraries.
    target_link_options(${name} PRIVATE "LINKER:--no-undefined")
  endif()
  if(QUVAIDX_BUILD_FUZZ)
    # clang links no sanitizer runtime into shared objects: a fuzzing build
    # tree links the static libraries only.
    set_target_properties(${name} PROPERTIES EXCLUDE_FROM_ALL ON)
  endif()
  set_target_properties(${name}_static PROPERTIES OUTPUT_NAME ${name})
  add_library(${name}::${name} ALIAS ${name})
  add_library(${name}::${name}_static ALIAS ${name}_static)
endfunction()

# quvaidx_fuzz_instrument(TARGET): in a fuzzing build (QUVAIDX_BUILD_FUZZ),
# compiles TARGET with coverage instrumentation and the sanitizers, so that
# everything the fuzz targets link is instrumented. Does nothing otherwise.
function(quvaidx_fuzz_instrument target)
  if(QUVAIDX_BUILD_FUZZ)
    target_compile_options(${target} PRIVATE
      -fsanitize=fuzzer-no-link ${QUVAIDX_FUZZ_SANITIZE})
  endif()
endfunction()
