# SPDX-License-Identifier: MIT
# The protections a distribution's build flags give its packages, for builds made without them:
# the stack protector, fortified libc calls, stack-clash and control-flow protection where the
# compiler has them, position-independent executables, and immediate binding with read-only
# relocations. HALVEX_HARDENING=OFF leaves all of it to the packager's own flags (debian/rules
# turns it off so that dpkg-buildflags decides).
#
# Sanitizer builds get none of it: they check at run time what these guard against, and the
# checked libc calls of _FORTIFY_SOURCE hide accesses from AddressSanitizer. _FORTIFY_SOURCE
# works only with optimisation (glibc warns without it, and warnings may be errors), so only the
# optimised build types define it; undefining it first spares a compiler that defines it itself a
# redefinition warning.
option(HALVEX_HARDENING
  "Build with the stack protector, _FORTIFY_SOURCE, stack-clash and control-flow protection, PIE and full RELRO"
  ON)
if(NOT HALVEX_HARDENING OR NOT HALVEX_SANITIZER STREQUAL "")
  return()
endif()

include(CheckCXXCompilerFlag)
include(CheckPIESupported)
check_pie_supported(LANGUAGES CXX)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)

foreach(flag IN ITEMS -fstack-protector-strong -fstack-clash-protection -fcf-protection)
  string(MAKE_C_IDENTIFIER "HALVEX_HAS${flag}" supported)
  check_cxx_compiler_flag(${flag} ${supported})
  if(${supported})
    add_compile_options(${flag})
  endif()
endforeach()
set(optimised $<CONFIG:Release,RelWithDebInfo,MinSizeRel>)
add_compile_options($<${optimised}:-U_FORTIFY_SOURCE> $<${optimised}:-D_FORTIFY_SOURCE=2>)
add_link_options(-Wl,-z,relro -Wl,-z,now)
