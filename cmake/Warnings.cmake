# SPDX-License-Identifier: MIT
# Project code builds warning-free; third-party headers come in as SYSTEM and stay out of it.
function(halvex_warnings target)
  target_compile_options(${target} PRIVATE
    -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Wold-style-cast -Wcast-align
    -Woverloaded-virtual -Wconversion -Wsign-conversion
    -Wimplicit-fallthrough -Werror)
endfunction()
