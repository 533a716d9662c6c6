# `cpack -G DEB` makes one package per install component, each binary one
# with its -dbgsym.ddeb: a runtime package per shared library, named after
# its SONAME (libkarst1, libconfigstore2, libvelkcore1), libkarst-dev
# (development) and karstctl. One package per library because their SONAMEs
# change apart: libconfigstore's went to 2 when its object representation,
# which its headers carried, changed, while libkarst's and libvelkcore's
# interfaces stayed those of 1.0.0.

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

# A program built against this version runs with any later version of the
# same SONAME. Each runtime package carries the shlibs line of its library;
# all of them also sit in a package-like tree over the built libraries, so
# dpkg-shlibdeps derives the packages' dependencies on one another from it.
set(shlibs_root ${KARST_DEB_DOCS}/shlibs)
set(shlibs "")
set(components "")
set(packages "")
foreach(lib IN LISTS KARST_SHARED_LIBRARIES)
  set(package lib${lib}${KARST_SOVERSION_${lib}})
  set(line "lib${lib} ${KARST_SOVERSION_${lib}} ${package} (>= ${PROJECT_VERSION})\n")
  string(APPEND shlibs "${line}")
  file(WRITE ${KARST_DEB_DOCS}/${package}/shlibs "${line}")
  string(TOUPPER lib${lib} upper)
  set(CPACK_DEBIAN_${upper}_PACKAGE_SECTION libs)
  set(CPACK_DEBIAN_${upper}_PACKAGE_CONTROL_EXTRA ${KARST_DEB_DOCS}/${package}/shlibs
    ${debian}/triggers)
  list(APPEND components lib${lib})
  list(APPEND packages ${package})
endforeach()
file(WRITE ${shlibs_root}/DEBIAN/shlibs "${shlibs}")
get_filename_component(libdir_parent ${shlibs_root}/${CMAKE_INSTALL_LIBDIR} DIRECTORY)
file(MAKE_DIRECTORY ${libdir_parent})
file(CREATE_LINK ${PROJECT_BINARY_DIR}/${CMAKE_INSTALL_LIBDIR} ${shlibs_root}/${CMAKE_INSTALL_LIBDIR}
  SYMBOLIC)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${shlibs_root}/${CMAKE_INSTALL_LIBDIR})
# Release 1.0.0 shipped all three libraries in one package, libkarst1:
# libvelkcore1 takes libvelkcore.so.1 over from it, and libkarst1 itself
# no longer holds libconfigstore.so.1.
set(CPACK_DEBIAN_LIBVELKCORE_PACKAGE_BREAKS "libkarst1 (<< 1.1.0)")
set(CPACK_DEBIAN_LIBVELKCORE_PACKAGE_REPLACES "libkarst1 (<< 1.1.0)")

list(APPEND components development)
list(APPEND packages libkarst-dev)
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
# dpkg-shlibdeps derives the SQLite, gRPC and C++ runtime dependencies, and
# those on our own libraries, from the binaries and our shlibs files.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)

set(CPACK_DEBIAN_LIBKARST_DESCRIPTION "storage policy and datastore catalogue library
libkarst keeps a host's catalogue of storage policies and of the datastores
that use them in the host's configuration store: it replaces either catalogue
as a whole, lists it, fetches the blob a policy holds for a namespace, and
gives short digests that tell whether a copy of a catalogue is stale.")
set(CPACK_DEBIAN_LIBCONFIGSTORE_DESCRIPTION "transactional configuration object store
libconfigstore keeps a host's configuration as objects of named values and
sub-objects, in collections, with nested transactions: in a SQLite file
(safe across processes, the default), in an etcd cluster shared by hosts,
or in memory. libkarst keeps its catalogues in it.")
set(CPACK_DEBIAN_LIBVELKCORE_DESCRIPTION "core exception and string helpers of the catalogue libraries
libvelkcore holds the exception type that libconfigstore's and libkarst's
errors derive from, and the string formatting helpers they share.")

set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_COMPONENT_DEVELOPMENT_DEPENDS libvelkcore libconfigstore libkarst)
set(CPACK_DEBIAN_DEVELOPMENT_DESCRIPTION "storage policy and datastore catalogue library - development files
libkarst keeps a host's catalogue of storage policies and of the datastores
that use them in the host's configuration store.

This package holds the C++17 headers of libkarst, libconfigstore and
libvelkcore, the links to build against them, the CMake package
(find_package(karst) and karst::karst) and the pkg-config file karst.pc.")

set(CPACK_DEBIAN_KARSTCTL_PACKAGE_SECTION admin)
# The completion file uses bash-completion's helpers (_init_completion,
# _filedir); without the package it does nothing, so it is recommended, not
# required.
set(CPACK_DEBIAN_KARSTCTL_PACKAGE_RECOMMENDS bash-completion)
set(CPACK_DEBIAN_KARSTCTL_DESCRIPTION "command-line tool for the storage policy catalogue
karstctl does every operation of libkarst from a shell, with JSON in and
out: it imports and exports the storage policy and datastore catalogues,
shows what an import would change, lists them or one record, writes a
policy's blob for a namespace and prints the catalogue digests. A file is
checked whole before the store is touched, so a bad file never changes the
catalogue.")

include(CPack)
