# Installation, the CMake package (find_package(karst)), karst.pc and the
# Debian package.

include(CMakePackageConfigHelpers)

install(TARGETS velkcore configstore karst
  EXPORT karstTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT development
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY include/TavoKarst DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  COMPONENT development)
install(DIRECTORY platform/configstore/include/TavoConfigStore
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT development)
install(DIRECTORY platform/velkcore/include/Velk DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  COMPONENT development)

set(KARST_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/karst)
install(EXPORT karstTargets NAMESPACE karst:: DESTINATION ${KARST_CMAKE_DIR}
  COMPONENT development)
configure_package_config_file(cmake/karstConfig.cmake.in
  ${CMAKE_CURRENT_BINARY_DIR}/karstConfig.cmake INSTALL_DESTINATION ${KARST_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_CURRENT_BINARY_DIR}/karstConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/karstConfig.cmake
  ${CMAKE_CURRENT_BINARY_DIR}/karstConfigVersion.cmake
  DESTINATION ${KARST_CMAKE_DIR} COMPONENT development)

file(RELATIVE_PATH KARST_PC_TO_PREFIX /${CMAKE_INSTALL_LIBDIR}/pkgconfig /)
configure_file(cmake/karst.pc.in ${CMAKE_CURRENT_BINARY_DIR}/karst.pc @ONLY)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/karst.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT development)

set(CPACK_PACKAGE_NAME libkarst)
set(CPACK_PACKAGE_VENDOR "libkarst developers")
set(CPACK_PACKAGE_CONTACT "libkarst developers <karst@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "${PROJECT_DESCRIPTION}")
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
# dpkg-shlibdeps derives the SQLite and C++ runtime dependencies from the
# binaries themselves.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
include(CPack)
