# SPDX-License-Identifier: MIT
# The shared libraries export what their installed headers declare and nothing else: the version
# scripts in abi/ list it. What stays inside (the backend's classes, the standard library's
# instantiations) can then change without breaking a program linked against SONAME 1, and the
# symbols file and the ABI baselines in abi/ pin only what the headers promise.
foreach(pair IN ITEMS halvex_trace_shared=libhalvex-trace halvex_platform_shared=libhalvex-platform)
  string(REPLACE "=" ";" pair "${pair}")
  list(GET pair 0 target)
  list(GET pair 1 name)
  set(script ${PROJECT_SOURCE_DIR}/abi/${name}.map)
  target_link_options(${target} PRIVATE LINKER:--version-script=${script})
  set_property(TARGET ${target} APPEND PROPERTY LINK_DEPENDS ${script})
endforeach()
