# SPDX-License-Identifier: MIT
# HALVEX_SANITIZER: empty, asan (AddressSanitizer + UBSan), tsan, or fuzz (clang only: asan with
# libFuzzer's coverage instrumentation in every library; the fuzz targets add libFuzzer itself).
if(HALVEX_SANITIZER STREQUAL "asan")
  add_compile_options(-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=address,undefined)
elseif(HALVEX_SANITIZER STREQUAL "tsan")
  add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
  add_link_options(-fsanitize=thread)
elseif(HALVEX_SANITIZER STREQUAL "fuzz")
  if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    message(FATAL_ERROR "HALVEX_SANITIZER=fuzz needs clang (libFuzzer); use the fuzz preset")
  endif()
  add_compile_options(-fsanitize=fuzzer-no-link,address,undefined -fno-omit-frame-pointer
                      -fno-sanitize-recover=all)
  add_link_options(-fsanitize=address,undefined)
elseif(NOT HALVEX_SANITIZER STREQUAL "")
  message(FATAL_ERROR "HALVEX_SANITIZER must be empty, asan, tsan or fuzz")
endif()
