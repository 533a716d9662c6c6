# Installation, the CMake package (find_package(karst)), karst.pc; the Debian
# packages are in cmake/DebianPackages.cmake.

include(CMakePackageConfigHelpers)

# Each shared library is a component of its own, so that each goes into a
# runtime package named after its SONAME.
foreach(lib IN LISTS KARST_SHARED_LIBRARIES)
  install(TARGETS ${lib}
    EXPORT karstTargets
    LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT lib${lib}
      NAMELINK_COMPONENT development
    INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
endforeach()
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

include(cmake/DebianPackages.cmake)
