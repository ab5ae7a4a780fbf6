# SPDX-License-Identifier: MIT
# Installs the HalvexTrace package in two components:
#   trace      libhalvex-trace.so.N and libhalvex-platform.so.N (the Linux backend)
#   trace_dev  headers under include/halvex, the static archives, the .so links, the CMake
#              package (find_package(HalvexTrace)) and the pkg-config files
#
# Targets of the CMake package, and the pkg-config file that matches each:
#   Halvex::trace              trace library + Linux backend, shared      halvex-trace
#   Halvex::trace_static       the same, static
#   Halvex::trace_core         trace library alone, shared                halvex-trace-core
#   Halvex::trace_core_static  the same, static
#   Halvex::platform           the backend alone (with the portable platform core), shared
#   Halvex::platform_static    the same, static
# A program that brings its own backend links trace_core and defines the device queries and
# DevicePropertyService::create itself (see tests/trace/consumer).
#
# The platform headers go to include/halvex/platform, so that no top-level "platform" folder lands
# in a shared prefix; the targets add include/halvex to keep the "platform/..." includes working.
include(CMakePackageConfigHelpers)
include(${PROJECT_SOURCE_DIR}/cmake/InstallHelpers.cmake)

set(HALVEX_TRACE_CONFIG_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/HalvexTrace)

install(TARGETS halvex_trace_shared halvex_platform_shared EXPORT HalvexTraceTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT trace NAMELINK_COMPONENT trace_dev)
install(TARGETS halvex_trace EXPORT HalvexTraceTargets
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT trace_dev
  FILE_SET HEADERS DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT trace_dev)
install(TARGETS halvex_platform_static halvex_trace_linux halvex_trace_linux_static
  EXPORT HalvexTraceTargets
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT trace_dev)
halvex_strip_installed(trace OPTIONS --remove-section=.comment --remove-section=.note FILES
  ${CMAKE_INSTALL_LIBDIR}/$<TARGET_FILE_NAME:halvex_trace_shared>
  ${CMAKE_INSTALL_LIBDIR}/$<TARGET_FILE_NAME:halvex_platform_shared>)
halvex_strip_installed(trace_dev OPTIONS --strip-debug --remove-section=.comment FILES
  ${CMAKE_INSTALL_LIBDIR}/$<TARGET_FILE_NAME:halvex_trace>
  ${CMAKE_INSTALL_LIBDIR}/$<TARGET_FILE_NAME:halvex_platform_static>)
install(FILES
    ${PROJECT_SOURCE_DIR}/platform/DevicePropertyService.h
    ${PROJECT_SOURCE_DIR}/platform/DeviceQueries.h
    ${PROJECT_SOURCE_DIR}/platform/MessageDict.h
    ${PROJECT_SOURCE_DIR}/platform/Result.h
    ${PROJECT_SOURCE_DIR}/platform/ServerProtocol.h
    ${PROJECT_SOURCE_DIR}/platform/SystemLog.h
    ${PROJECT_SOURCE_DIR}/platform/TaskGroup.h
    ${PROJECT_SOURCE_DIR}/platform/WorkQueue.h
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/halvex/platform COMPONENT trace_dev)
install(EXPORT HalvexTraceTargets NAMESPACE Halvex::
  DESTINATION ${HALVEX_TRACE_CONFIG_DIR} COMPONENT trace_dev)

configure_package_config_file(cmake/HalvexTraceConfig.cmake.in
  ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake
  INSTALL_DESTINATION ${HALVEX_TRACE_CONFIG_DIR})
write_basic_package_version_file(${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfigVersion.cmake
  VERSION ${PROJECT_VERSION} COMPATIBILITY SameMajorVersion)
install(FILES
    ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake
    ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfigVersion.cmake
  DESTINATION ${HALVEX_TRACE_CONFIG_DIR} COMPONENT trace_dev)

foreach(pc IN ITEMS halvex-trace halvex-trace-core)
  halvex_install_configured(cmake/${pc}.pc.in
    DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT trace_dev)
endforeach()
