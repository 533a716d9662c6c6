# The compiler's and linker's hardening, on by default as distributions build.
option(KARST_HARDEN "Stack protector, fortified libc calls, CET, PIE, full RELRO" ON)
if(NOT KARST_HARDEN)
  return()
endif()
add_compile_options(-fstack-protector-strong -fstack-clash-protection -fcf-protection)
# Fortified calls need the optimizer: at -O0 glibc warns, and -Werror fails.
# The sanitizer builds check those calls themselves.
if(NOT KARST_SANITIZE AND NOT KARST_FUZZ)
  set(optimized "$<CONFIG:Release,RelWithDebInfo,MinSizeRel>")
  add_compile_options("$<${optimized}:-U_FORTIFY_SOURCE>" "$<${optimized}:-D_FORTIFY_SOURCE=2>")
endif()
add_link_options(-Wl,-z,relro -Wl,-z,now)
# With CMAKE_POSITION_INDEPENDENT_CODE, executables link as PIE.
include(CheckPIESupported)
check_pie_supported(OUTPUT_VARIABLE pie_error LANGUAGES CXX)
if(NOT CMAKE_CXX_LINK_PIE_SUPPORTED)
  message(FATAL_ERROR "The linker cannot make PIE executables: ${pie_error}")
endif()
