# What `cmake --install` places, all relative to the chosen prefix: the
# library with its SONAME, the public headers, a pkg-config file, a CMake
# package, the library's resources, nubilosyncclient and its man page (the
# last two from their own folders). `cpack -G DEB` packs the same.
include(CMakePackageConfigHelpers)

install(TARGETS VantorSyncManager EXPORT VantorSyncManagerTargets
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
        INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY include/VantorSyncManager DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY data/resources/ DESTINATION ${CMAKE_INSTALL_DATADIR}/VantorSyncManager)

file(RELATIVE_PATH VSM_PC_TO_PREFIX /prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig /prefix)
configure_file(cmake/VantorSyncManager.pc.in ${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManager.pc @ONLY)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManager.pc
        DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

set(VSM_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/VantorSyncManager)
install(EXPORT VantorSyncManagerTargets NAMESPACE VantorSyncManager:: DESTINATION ${VSM_CMAKE_DIR})
configure_package_config_file(cmake/VantorSyncManagerConfig.cmake.in
  ${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManagerConfig.cmake INSTALL_DESTINATION ${VSM_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManagerConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManagerConfig.cmake
              ${CMAKE_CURRENT_BINARY_DIR}/VantorSyncManagerConfigVersion.cmake
        DESTINATION ${VSM_CMAKE_DIR})

set(CPACK_PACKAGE_NAME vantorsyncmanager)
set(CPACK_PACKAGE_VENDOR "Vantor")
set(CPACK_PACKAGE_CONTACT "VantorSyncManager developers <vantorsync@example.org>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY
    "Keeps contacts and calendars in step across computers through a WebDAV share")
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)  # dependencies from the libraries the binaries use
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
include(CPack)
