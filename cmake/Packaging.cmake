# SPDX-License-Identifier: MIT
# `cpack -G DEB` from a build configured with -DCMAKE_INSTALL_PREFIX=/usr makes one Debian
# package per install component:
#   halvextool            component tool       the programs, manual pages, completion, bus
#                                              policy, halvexdiag group, service and scenarios
#   libhalvex-traceN      component trace      the shared libraries (N: the major version)
#   libhalvex-trace-dev   component trace_dev  headers, static archives, CMake and pkg-config
# Paths compiled into the programs (the simulator's default scenario) come from the configured
# prefix, so cpack refuses a build configured for another prefix rather than package wrong paths.
include(${CMAKE_CURRENT_LIST_DIR}/InstallHelpers.cmake)

set(HALVEX_TRACE_PACKAGE libhalvex-trace${PROJECT_VERSION_MAJOR})
set(HALVEX_PACKAGE_DOCS ${PROJECT_BINARY_DIR}/package-docs)

# Debian's copyright format, with the text of LICENSE.
file(READ ${PROJECT_SOURCE_DIR}/LICENSE license)
string(REGEX MATCH "Copyright \\(c\\) ([^\n]+)" _ "${license}")
set(copyright_holder "${CMAKE_MATCH_1}")
string(REGEX REPLACE "^.*\n\n(Permission)" "\\1" license_terms "${license}")
string(REGEX REPLACE "\n+$" "" license_terms "${license_terms}")
string(REPLACE "\n\n" "\n.\n" license_terms "${license_terms}")
string(REPLACE "\n" "\n " license_terms "${license_terms}")
file(WRITE ${HALVEX_PACKAGE_DOCS}/copyright
"Format: https://www.debian.org/doc/packaging-manuals/copyright-format/1.0/
Upstream-Name: ${PROJECT_NAME}

Files: *
Copyright: ${copyright_holder}
License: Expat

License: Expat
 ${license_terms}
")
configure_file(${PROJECT_SOURCE_DIR}/data/debian/changelog.in ${HALVEX_PACKAGE_DOCS}/changelog
               @ONLY)
add_custom_command(OUTPUT ${HALVEX_PACKAGE_DOCS}/changelog.gz
  COMMAND sh -c "gzip -9 -n -c \"$1\" > \"$2\"" gzip
          ${HALVEX_PACKAGE_DOCS}/changelog ${HALVEX_PACKAGE_DOCS}/changelog.gz
  DEPENDS ${HALVEX_PACKAGE_DOCS}/changelog
  VERBATIM)
add_custom_target(halvex_package_docs ALL DEPENDS ${HALVEX_PACKAGE_DOCS}/changelog.gz)

# Every package carries its own copyright and changelog, as Debian requires.
foreach(pair IN ITEMS "tool=halvextool" "trace=${HALVEX_TRACE_PACKAGE}"
                      "trace_dev=libhalvex-trace-dev")
  string(REPLACE "=" ";" pair "${pair}")
  list(GET pair 0 component)
  list(GET pair 1 package)
  install(FILES ${HALVEX_PACKAGE_DOCS}/copyright ${HALVEX_PACKAGE_DOCS}/changelog.gz
    DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${package} COMPONENT ${component})
endforeach()

set(CPACK_PACKAGE_NAME ${PROJECT_NAME})
set(CPACK_PACKAGE_VENDOR "halvextool authors")
set(CPACK_PACKAGE_CONTACT "halvextool authors <halvextool@example.org>")
set(CPACK_RESOURCE_FILE_LICENSE ${PROJECT_SOURCE_DIR}/LICENSE)
set(CPACK_PACKAGE_DIRECTORY ${PROJECT_BINARY_DIR}/packages)
set(CPACK_GENERATOR DEB)
set(CPACK_COMPONENTS_ALL tool trace trace_dev)
# Install with DESTDIR so that files generated at install time see the packages' prefix, /usr.
set(CPACK_SET_DESTDIR ON)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
    OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
set(CPACK_PROJECT_CONFIG_FILE ${PROJECT_BINARY_DIR}/HalvexCPackOptions.cmake)
file(WRITE ${CPACK_PROJECT_CONFIG_FILE}
"if(NOT \"${CMAKE_INSTALL_PREFIX}\" STREQUAL \"/usr\")
  message(FATAL_ERROR \"The packages install to /usr, but this build was configured for \"
    \"${CMAKE_INSTALL_PREFIX}: configure it with -DCMAKE_INSTALL_PREFIX=/usr first.\")
endif()
")

set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY "=")
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)

set(CPACK_DEBIAN_TOOL_PACKAGE_NAME halvextool)
set(CPACK_DEBIAN_TOOL_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_TOOL_PACKAGE_DEPENDS "dbus, systemd | adduser")
set(CPACK_DEBIAN_TOOL_PACKAGE_CONTROL_EXTRA
  ${PROJECT_SOURCE_DIR}/data/debian/postinst
  ${PROJECT_SOURCE_DIR}/data/debian/prerm
  ${PROJECT_SOURCE_DIR}/data/debian/postrm)
set(CPACK_DEBIAN_TOOL_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_COMPONENT_TOOL_DESCRIPTION
"console to the Halvex baseband-manager server
halvextool collects diagnostic logs from a cellular modem's baseband-manager
server: telephony logs, telephony logs with a baseband core dump, and baseband
logs alone, through a helper when the server says it is not running. It is a
small hierarchical shell, interactive or given one command line.
.
The package also holds halvex-sim, which plays the device, the server and the
helper on the system bus for tests and demonstrations, with its service unit
and example scenarios, and the system-bus policy that lets root and the
halvexdiag group collect logs.")

set(CPACK_DEBIAN_TRACE_PACKAGE_NAME ${HALVEX_TRACE_PACKAGE})
set(CPACK_DEBIAN_TRACE_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_TRACE_PACKAGE_MULTIARCH same)
set(CPACK_DEBIAN_TRACE_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/data/debian/triggers)
set(CPACK_POST_BUILD_SCRIPTS ${CMAKE_CURRENT_LIST_DIR}/DebLdconfigScripts.cmake)
set(CPACK_COMPONENT_TRACE_DESCRIPTION
"Halvex trace support library
The trace catalogue and support rules, log locations and file naming,
diagnostic-logging configuration, device identity and a time-stamp class of
the Halvex baseband-manager product, with the Linux platform backend that asks
the device over the D-Bus system bus.")

set(CPACK_DEBIAN_TRACE_DEV_PACKAGE_NAME libhalvex-trace-dev)
set(CPACK_DEBIAN_TRACE_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_TRACE_DEV_PACKAGE_MULTIARCH same)
set(CPACK_COMPONENT_TRACE_DEV_DEPENDS trace)
set(CPACK_DEBIAN_TRACE_DEV_PACKAGE_DEPENDS "libsystemd-dev")
set(CPACK_COMPONENT_TRACE_DEV_DESCRIPTION
"Halvex trace support library - development files
Headers, static libraries, the CMake package (find_package(HalvexTrace)) and
the pkg-config files halvex-trace (with the Linux backend) and
halvex-trace-core (for programs that bring their own backend).")

include(CPack)
