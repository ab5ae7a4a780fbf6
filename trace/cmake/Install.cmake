# SPDX-License-Identifier: MIT
# Installs the HalvexTrace package (component "HalvexTrace") for find_package(HalvexTrace):
#   Halvex::trace          this library, exported
#   Halvex::platform_core  the platform core it links, imported by HalvexTraceConfig.cmake
# plus the platform headers the library's users see: the core's own and the device interfaces
# that trace includes and that a backend implements. No backend is installed; a consumer links
# its own (see tests/trace/consumer).
#
# The core is installed here rather than exported because its build-tree include directory is
# the source root itself, which install(EXPORT) rejects. Its platform headers go to
# include/halvex/platform so that no top-level "platform" folder lands in a shared prefix; the
# imported core adds include/halvex to keep the "platform/..." include paths working.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(HALVEX_TRACE_CONFIG_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/HalvexTrace)
set(HALVEX_PLATFORM_INCLUDE_DIR ${CMAKE_INSTALL_INCLUDEDIR}/halvex)

install(TARGETS halvex_trace EXPORT HalvexTraceTargets
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT HalvexTrace
  FILE_SET HEADERS DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT HalvexTrace)
install(TARGETS halvex_platform_core
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT HalvexTrace
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT HalvexTrace)
install(FILES
    ${PROJECT_SOURCE_DIR}/platform/DevicePropertyService.h
    ${PROJECT_SOURCE_DIR}/platform/DeviceQueries.h
    ${PROJECT_SOURCE_DIR}/platform/MessageDict.h
    ${PROJECT_SOURCE_DIR}/platform/Result.h
    ${PROJECT_SOURCE_DIR}/platform/ServerProtocol.h
    ${PROJECT_SOURCE_DIR}/platform/SystemLog.h
    ${PROJECT_SOURCE_DIR}/platform/TaskGroup.h
    ${PROJECT_SOURCE_DIR}/platform/WorkQueue.h
  DESTINATION ${HALVEX_PLATFORM_INCLUDE_DIR}/platform COMPONENT HalvexTrace)
install(EXPORT HalvexTraceTargets NAMESPACE Halvex::
  DESTINATION ${HALVEX_TRACE_CONFIG_DIR} COMPONENT HalvexTrace)

# Two steps: the package helpers fill in the relocatable paths, then file(GENERATE) fills in the
# core's actual file name.
configure_package_config_file(cmake/HalvexTraceConfig.cmake.in
  ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake.in
  INSTALL_DESTINATION ${HALVEX_TRACE_CONFIG_DIR}
  PATH_VARS CMAKE_INSTALL_LIBDIR HALVEX_PLATFORM_INCLUDE_DIR)
file(GENERATE OUTPUT ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake
  INPUT ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake.in)
write_basic_package_version_file(${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfigVersion.cmake
  VERSION ${PROJECT_VERSION} COMPATIBILITY SameMinorVersion)
install(FILES
    ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfig.cmake
    ${CMAKE_CURRENT_BINARY_DIR}/HalvexTraceConfigVersion.cmake
  DESTINATION ${HALVEX_TRACE_CONFIG_DIR} COMPONENT HalvexTrace)
