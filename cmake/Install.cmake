# SPDX-License-Identifier: MIT
# Install rules of the "tool" component: the two programs and everything that makes them a
# system service and a documented command. The library's components are in trace/cmake/.
#
# Folders that other packages decide (bash completions, systemd units, sysusers.d) are read from
# their pkg-config files and made relative to the prefix, so that a --prefix install stays inside
# its prefix; a packager may set each instead (HALVEX_UNIT_DIR=/lib/systemd/system for Debian 12,
# whose units live outside /usr). zsh has no pkg-config file: its completions go where zsh's own
# package looks for other packages' (vendor-completions on Debian and Ubuntu, site-functions
# elsewhere), or to HALVEX_ZSH_COMPLETIONS_DIR. The bus reads policies only from
# /usr/share/dbus-1/system.d and /etc/dbus-1/system.d: the policy takes effect with the prefix
# /usr (and the packages), not /usr/local.
include(${CMAKE_CURRENT_LIST_DIR}/InstallHelpers.cmake)

halvex_pkg_config_dir(HALVEX_COMPLETIONS_DIR bash-completion completionsdir
                      ${CMAKE_INSTALL_DATADIR}/bash-completion/completions)
halvex_pkg_config_dir(HALVEX_UNIT_DIR systemd systemd_system_unit_dir lib/systemd/system)
halvex_pkg_config_dir(HALVEX_SYSUSERS_DIR systemd sysusers_dir lib/sysusers.d)
if(NOT HALVEX_ZSH_COMPLETIONS_DIR)
  set(HALVEX_ZSH_COMPLETIONS_DIR ${CMAKE_INSTALL_DATADIR}/zsh/site-functions)
  if(IS_DIRECTORY /usr/share/zsh/vendor-completions)
    set(HALVEX_ZSH_COMPLETIONS_DIR ${CMAKE_INSTALL_DATADIR}/zsh/vendor-completions)
  endif()
endif()

install(TARGETS halvextool halvex-sim RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tool)
halvex_strip_installed(tool OPTIONS --remove-section=.comment --remove-section=.note FILES
  ${CMAKE_INSTALL_BINDIR}/halvextool ${CMAKE_INSTALL_BINDIR}/halvex-sim)

install(FILES man/halvextool.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT tool)
install(FILES man/halvex-sim.8 DESTINATION ${CMAKE_INSTALL_MANDIR}/man8 COMPONENT tool)

install(FILES completion/halvextool completion/halvex-sim
  DESTINATION ${HALVEX_COMPLETIONS_DIR} COMPONENT tool)
install(FILES completion/_halvextool completion/_halvex-sim
  DESTINATION ${HALVEX_ZSH_COMPLETIONS_DIR} COMPONENT tool)

install(FILES data/dbus/org.halvex.conf
  DESTINATION ${CMAKE_INSTALL_DATADIR}/dbus-1/system.d COMPONENT tool)
install(FILES
    data/dbus/interfaces/org.halvex.Device1.xml
    data/dbus/interfaces/org.halvex.Helper1.xml
    data/dbus/interfaces/org.halvex.Server1.xml
    data/dbus/interfaces/org.halvex.Simulator1.xml
  DESTINATION ${CMAKE_INSTALL_DATADIR}/dbus-1/interfaces COMPONENT tool)
install(FILES data/sysusers/halvexdiag.conf DESTINATION ${HALVEX_SYSUSERS_DIR} COMPONENT tool)
halvex_install_configured(data/systemd/halvex-sim.service.in
  DESTINATION ${HALVEX_UNIT_DIR} COMPONENT tool)

install(DIRECTORY scenarios/ DESTINATION ${CMAKE_INSTALL_DATADIR}/halvex-sim/scenarios
  COMPONENT tool FILES_MATCHING PATTERN "*.json")
