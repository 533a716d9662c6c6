# The binary interface of each shared library: its SONAME and what it exports.

# lib<target>.so.<soversion>, the file named <soversion>.<minor>.<patch> of
# the project's version. The linker exports only the library's public API
# (cmake/exports/<target>.map), whatever its objects hold with default
# visibility.
function(karst_shared_library target soversion)
  set(map ${PROJECT_SOURCE_DIR}/cmake/exports/${target}.map)
  set_target_properties(${target} PROPERTIES SOVERSION ${soversion}
    VERSION ${soversion}.${PROJECT_VERSION_MINOR}.${PROJECT_VERSION_PATCH})
  target_link_options(${target} PRIVATE -Wl,--version-script=${map})
  set_property(TARGET ${target} APPEND PROPERTY LINK_DEPENDS ${map})
endfunction()
