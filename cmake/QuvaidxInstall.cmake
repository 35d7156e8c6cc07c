# What `cmake --install` puts where. Included at the end of the top-level
# CMakeLists.txt, after every target exists; the programs install
# themselves where they are defined (bin/ and sbin/).
install(DIRECTORY include/quvaidx DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(TARGETS quvaidx quvaidx_static EXPORT quvaidxTargets
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
        ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
        INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})

# The CMake package: find_package(quvaidx) gives quvaidx::quvaidx and
# quvaidx::quvaidx_static, and quvaidx_VERSION.
install(EXPORT quvaidxTargets NAMESPACE quvaidx::
        DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/quvaidx)
configure_package_config_file(cmake/quvaidxConfig.cmake.in
  ${PROJECT_BINARY_DIR}/quvaidxConfig.cmake
  INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/quvaidx)
write_basic_package_version_file(
  ${PROJECT_BINARY_DIR}/quvaidxConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/quvaidxConfig.cmake
              ${PROJECT_BINARY_DIR}/quvaidxConfigVersion.cmake
        DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/quvaidx)

# The .pc file finds its prefix relative to itself, so an install with
# `cmake --install --prefix P` works wherever P is; its RUNPATH flag lets a
# program linked with `pkg-config --libs quvaidx` run from there as well.
file(RELATIVE_PATH QUVAIDX_PC_TO_PREFIX
     /prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig /prefix)
configure_file(cmake/quvaidx.pc.in ${PROJECT_BINARY_DIR}/quvaidx.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/quvaidx.pc
        DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# Last: a library directory that the loader searches through its cache
# (/usr/local/lib and the like) needs the cache renewed.
install(SCRIPT cmake/RenewLoaderCache.cmake)

# `cmake --build BUILD --target uninstall` removes what the last install
# from BUILD put in place (its install_manifest.txt).
add_custom_target(uninstall
  COMMAND ${CMAKE_COMMAND} -DMANIFEST=${PROJECT_BINARY_DIR}/install_manifest.txt
          -P ${PROJECT_SOURCE_DIR}/cmake/Uninstall.cmake
  COMMENT "Removing the installed files")
