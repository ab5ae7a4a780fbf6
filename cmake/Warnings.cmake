# SPDX-License-Identifier: MIT
# Project code builds warning-free; third-party headers come in as SYSTEM and stay out of it.
# Warnings become errors only when HALVEX_WERROR asks for it (every preset does), so that a
# packager's newer compiler warns instead of breaking the build.
function(halvex_warnings target)
  target_compile_options(${target} PRIVATE
    -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Wold-style-cast -Wcast-align
    -Woverloaded-virtual -Wconversion -Wsign-conversion -Wimplicit-fallthrough)
  # sd-bus's public initialisers (SD_BUS_ERROR_NULL and friends) are C compound literals, which
  # clang's pedantic mode reports in C++ wherever they are used.
  # Clang checks the locks against what they guard (platform/Mutex.h).
  if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    target_compile_options(${target} PRIVATE -Wno-c99-extensions -Wthread-safety
      -Wthread-safety-beta)
  endif()
  if(HALVEX_WERROR)
    target_compile_options(${target} PRIVATE -Werror)
  endif()
endfunction()
