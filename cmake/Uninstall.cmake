cmake_minimum_required(VERSION 3.25)
# Removes every file listed in MANIFEST (one absolute path a line, as
# `cmake --install` writes install_manifest.txt). Files already gone are
# fine.
if(NOT EXISTS "${MANIFEST}")
  message(FATAL_ERROR "Nothing to uninstall: ${MANIFEST} is missing "
                      "(install from this build tree first)")
endif()
file(STRINGS "${MANIFEST}" _files)
set(_dirs "")
foreach(_file IN LISTS _files)
  if(EXISTS "${_file}" OR IS_SYMLINK "${_file}")
    file(REMOVE "${_file}")
    message(STATUS "Removed ${_file}")
  endif()
  get_filename_component(_dir "${_file}" DIRECTORY)
  list(APPEND _dirs "${_dir}")
endforeach()
# Then the project's own directories (include/quvaidx, lib/cmake/quvaidx,
# ...) that this left empty; shared ones such as bin/ or share/man/man1
# stay, whatever they hold.
list(REMOVE_DUPLICATES _dirs)
list(SORT _dirs ORDER DESCENDING)
foreach(_dir IN LISTS _dirs)
  get_filename_component(_name "${_dir}" NAME)
  if(IS_DIRECTORY "${_dir}" AND _name MATCHES "^quva")
    file(GLOB _left "${_dir}/*" "${_dir}/.*")
    if(NOT _left)
      file(REMOVE_RECURSE "${_dir}")
    endif()
  endif()
endforeach()

# Programs elsewhere may have found the library through the loader's cache.
set(QUVAIDX_CHANGED_FILES ${_files})
include(${CMAKE_CURRENT_LIST_DIR}/RenewLoaderCache.cmake)
