# Install folders, and the same layout in the build tree for what is installed.

# Debian's multiarch library folder whatever the prefix, so that cpack run in
# any build tree puts the libraries where the dynamic linker looks. Build
# trees configured before this kept GNUInstallDirs' "lib": moved once.
get_property(libdir_type CACHE CMAKE_INSTALL_LIBDIR PROPERTY TYPE)
if(NOT DEFINED CACHE{KARST_LAYOUT} AND libdir_type STREQUAL "PATH" AND CMAKE_INSTALL_LIBDIR STREQUAL "lib")
  unset(CMAKE_INSTALL_LIBDIR CACHE)
endif()
set(KARST_LAYOUT multiarch CACHE INTERNAL "Marks build trees that have the multiarch default")
if(NOT DEFINED CMAKE_INSTALL_LIBDIR)
  find_program(KARST_DPKG_ARCHITECTURE dpkg-architecture)
  if(KARST_DPKG_ARCHITECTURE)
    execute_process(COMMAND ${KARST_DPKG_ARCHITECTURE} -qDEB_HOST_MULTIARCH
      OUTPUT_VARIABLE multiarch OUTPUT_STRIP_TRAILING_WHITESPACE COMMAND_ERROR_IS_FATAL ANY)
    set(CMAKE_INSTALL_LIBDIR lib/${multiarch} CACHE PATH "Object code libraries (LIBDIR)")
  endif()
endif()
include(GNUInstallDirs)
foreach(dir IN ITEMS CMAKE_INSTALL_LIBDIR CMAKE_INSTALL_BINDIR)
  if(IS_ABSOLUTE "${${dir}}")
    message(FATAL_ERROR "${dir} must be relative to the prefix: the installed tree can be moved")
  endif()
endforeach()

# Installed libraries and programs find the project's libraries through a
# RUNPATH relative to themselves ($ORIGIN). The build tree lays them out as
# installed and links them with that same RUNPATH, so install leaves the
# binaries as built. (Rewriting it at install time would make CMake pad the
# build-tree RUNPATH with ':', an empty entry: the current folder.)
file(RELATIVE_PATH KARST_BIN_TO_LIB /${CMAKE_INSTALL_BINDIR} /${CMAKE_INSTALL_LIBDIR})
function(karst_installed_libraries)
  set_target_properties(${ARGN} PROPERTIES
    LIBRARY_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/${CMAKE_INSTALL_LIBDIR}
    BUILD_WITH_INSTALL_RPATH ON INSTALL_RPATH "$ORIGIN")
endfunction()
function(karst_installed_programs)
  set_target_properties(${ARGN} PROPERTIES
    RUNTIME_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/${CMAKE_INSTALL_BINDIR}
    BUILD_WITH_INSTALL_RPATH ON INSTALL_RPATH "$ORIGIN/${KARST_BIN_TO_LIB}")
endfunction()
