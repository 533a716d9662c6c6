# `cpack -G DEB` makes one package per install component, each with its
# -dbgsym.ddeb: libkarst1 (runtime), libkarst-dev (development) and karstctl.

set(KARST_MAINTAINER "libkarst developers <libkarst@lists.example.org>")
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(KARST_DEB_VERSION ${PROJECT_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE})

# The changelog's newest entry names the version being packaged.
set(debian ${PROJECT_SOURCE_DIR}/cmake/debian)
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${debian}/changelog)
file(STRINGS ${debian}/changelog newest LIMIT_COUNT 1)
if(NOT newest MATCHES "^libkarst \\(${KARST_DEB_VERSION}\\) ")
  message(FATAL_ERROR "cmake/debian/changelog: the newest entry is not ${KARST_DEB_VERSION}")
endif()
set(KARST_DEB_DOCS ${CMAKE_CURRENT_BINARY_DIR}/debian)
file(MAKE_DIRECTORY ${KARST_DEB_DOCS})
execute_process(COMMAND gzip -9nc INPUT_FILE ${debian}/changelog
  OUTPUT_FILE ${KARST_DEB_DOCS}/changelog.Debian.gz COMMAND_ERROR_IS_FATAL ANY)

# Machine-readable copyright: the licence after its notice, indented, with
# blank lines as " .".
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/LICENSE)
file(READ ${PROJECT_SOURCE_DIR}/LICENSE licence)
if(NOT licence MATCHES "\nCopyright \\(c\\) ([^\n]+)\n\n(.+[^\n])\n*$")
  message(FATAL_ERROR "LICENSE: no copyright notice followed by the licence")
endif()
set(KARST_COPYRIGHT "${CMAKE_MATCH_1}")
string(REPLACE "\n\n" "\n.\n" KARST_LICENSE_TEXT " ${CMAKE_MATCH_2}")
string(REPLACE "\n" "\n " KARST_LICENSE_TEXT "${KARST_LICENSE_TEXT}")
configure_file(${debian}/copyright.in ${KARST_DEB_DOCS}/copyright @ONLY)

# Any program built against this version runs with any later 1.x. The
# shlibs file also sits in a package-like tree over the built libraries, so
# dpkg-shlibdeps derives karstctl's dependency on libkarst1 from it.
set(shlibs "")
foreach(lib IN ITEMS karst configstore velkcore)
  string(APPEND shlibs "lib${lib} ${PROJECT_VERSION_MAJOR} libkarst${PROJECT_VERSION_MAJOR} (>= ${PROJECT_VERSION})\n")
endforeach()
set(shlibs_root ${KARST_DEB_DOCS}/libkarst${PROJECT_VERSION_MAJOR})
file(WRITE ${shlibs_root}/DEBIAN/shlibs "${shlibs}")
get_filename_component(libdir_parent ${shlibs_root}/${CMAKE_INSTALL_LIBDIR} DIRECTORY)
file(MAKE_DIRECTORY ${libdir_parent})
file(CREATE_LINK ${PROJECT_BINARY_DIR}/${CMAKE_INSTALL_LIBDIR} ${shlibs_root}/${CMAKE_INSTALL_LIBDIR}
  SYMBOLIC)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${shlibs_root}/${CMAKE_INSTALL_LIBDIR})

set(components runtime development)
set(packages libkarst${PROJECT_VERSION_MAJOR} libkarst-dev)
if(KARST_BUILD_TOOLS)
  list(APPEND components karstctl)
  list(APPEND packages karstctl)
endif()
# Only the component installs that cpack makes carry the Debian files.
foreach(component package IN ZIP_LISTS components packages)
  install(FILES ${KARST_DEB_DOCS}/copyright ${KARST_DEB_DOCS}/changelog.Debian.gz
    DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${package} COMPONENT ${component} EXCLUDE_FROM_ALL)
  string(TOUPPER ${component} upper)
  set(CPACK_DEBIAN_${upper}_PACKAGE_NAME ${package})
endforeach()

set(CPACK_PACKAGE_NAME libkarst)
set(CPACK_PACKAGE_VENDOR "libkarst developers")
set(CPACK_PACKAGE_CONTACT "${KARST_MAINTAINER}")
# Each package's description starts with its own summary; a project-wide one
# would be put in front of each.
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "")
set(CPACK_DEBIAN_PACKAGE_SOURCE libkarst)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL ${components})
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# Stripped binaries; their debug symbols go into -dbgsym.ddeb packages.
set(CPACK_DEBIAN_DEBUGINFO_PACKAGE ON)
# dpkg-shlibdeps derives the SQLite and C++ runtime dependencies, and
# karstctl's on libkarst1, from the binaries and our shlibs file.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)

set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA ${shlibs_root}/DEBIAN/shlibs ${debian}/triggers)
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION "storage policy and datastore catalogue library
libkarst keeps a host's catalogue of storage policies and of the datastores
that use them in the host's configuration store: it replaces either catalogue
as a whole, lists it, fetches the blob a policy holds for a namespace, and
gives short digests that tell whether a copy of a catalogue is stale.

This package holds the shared libraries libkarst, libconfigstore (a
transactional object store backed by SQLite) and libvelkcore (exceptions and
string helpers).")

set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_COMPONENT_DEVELOPMENT_DEPENDS runtime)
set(CPACK_DEBIAN_DEVELOPMENT_DESCRIPTION "storage policy and datastore catalogue library - development files
libkarst keeps a host's catalogue of storage policies and of the datastores
that use them in the host's configuration store.

This package holds the C++17 headers of libkarst, libconfigstore and
libvelkcore, the links to build against them, the CMake package
(find_package(karst) and karst::karst) and the pkg-config file karst.pc.")

set(CPACK_DEBIAN_KARSTCTL_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_KARSTCTL_DESCRIPTION "command-line tool for the storage policy catalogue
karstctl does every operation of libkarst from a shell, with JSON in and
out: it imports and exports the storage policy and datastore catalogues,
lists them, writes a policy's blob for a namespace and prints the catalogue
digests. A file is checked whole before the store is touched, so a bad file
never changes the catalogue.")

include(CPack)
