# SPDX-License-Identifier: MIT
# Helpers for install rules that depend on where things are installed.

# halvex_pkg_config_dir(<out> <module> <variable> <fallback>)
# Sets <out> to the folder that <module>'s pkg-config file names in <variable>, relative to the
# install prefix, so that the folder follows --prefix and packaging. A path the module builds
# from its prefix or root prefix (systemd's units: ${rootprefix}/lib/systemd/system) keeps what
# follows that prefix; a literal path under the module's own prefix (bash-completion's
# /usr/share/...) keeps what follows it. Anything else, or no module, gives the relative
# <fallback>. A value given on the command line (-D<out>=...) wins.
function(halvex_pkg_config_dir out module variable fallback)
  if(NOT "${${out}}" STREQUAL "")
    message(STATUS "Install folder for ${module} ${variable}: ${${out}} (as set)")
    return()
  endif()
  set(dir "${fallback}")
  set(marker "/halvex-install-prefix")
  if(PKG_CONFIG_EXECUTABLE)
    execute_process(
      COMMAND ${PKG_CONFIG_EXECUTABLE} --define-variable=prefix=${marker}
              --define-variable=root_prefix=${marker} --variable=${variable} ${module}
      OUTPUT_VARIABLE value OUTPUT_STRIP_TRAILING_WHITESPACE RESULT_VARIABLE status ERROR_QUIET)
    execute_process(
      COMMAND ${PKG_CONFIG_EXECUTABLE} --variable=prefix ${module}
      OUTPUT_VARIABLE module_prefix OUTPUT_STRIP_TRAILING_WHITESPACE ERROR_QUIET)
    foreach(base IN ITEMS "${marker}" "${module_prefix}")
      if(status EQUAL 0 AND NOT base STREQUAL "" AND value MATCHES "^${base}/(.+)$")
        set(dir "${CMAKE_MATCH_1}")
        break()
      endif()
    endforeach()
  endif()
  message(STATUS "Install folder for ${module} ${variable}: <prefix>/${dir}")
  set(${out} "${dir}" PARENT_SCOPE)
endfunction()

# halvex_install_configured(<template> DESTINATION <dir> COMPONENT <component>)
# <dir> is relative to the install prefix, or absolute.
# Installs <template> without its ".in", with @prefix@ and @bindir@ replaced at install time by
# the prefix actually installed to (cmake --install --prefix, or the packages' /usr), and
# @PROJECT_VERSION@, @CMAKE_INSTALL_LIBDIR@, @CMAKE_INSTALL_INCLUDEDIR@ by this build's values.
function(halvex_install_configured template)
  cmake_parse_arguments(ARG "" "DESTINATION;COMPONENT" "" ${ARGN})
  get_filename_component(template "${template}" ABSOLUTE)
  get_filename_component(name "${template}" NAME)
  string(REGEX REPLACE "\\.in$" "" name "${name}")
  set(staged "${CMAKE_CURRENT_BINARY_DIR}/install-time/${name}")
  set(destination "${ARG_DESTINATION}")
  if(NOT IS_ABSOLUTE "${destination}")
    set(destination "\${CMAKE_INSTALL_PREFIX}/${destination}")
  endif()
  install(CODE "
    set(prefix \"\${CMAKE_INSTALL_PREFIX}\")
    set(bindir \"\${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_BINDIR}\")
    set(PROJECT_VERSION \"${PROJECT_VERSION}\")
    set(CMAKE_INSTALL_LIBDIR \"${CMAKE_INSTALL_LIBDIR}\")
    set(CMAKE_INSTALL_INCLUDEDIR \"${CMAKE_INSTALL_INCLUDEDIR}\")
    configure_file(\"${template}\" \"${staged}\" @ONLY)
    file(INSTALL \"${staged}\" DESTINATION \"${destination}\"
         FILE_PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)"
    COMPONENT ${ARG_COMPONENT})
endfunction()

# halvex_strip_installed(<component> OPTIONS <strip options...> FILES <paths...>)
# Runs strip with <options> on the installed <paths> (relative to the prefix) when the install
# strips (cmake --install --strip): for what install(TARGETS) leaves, the debug sections
# of static archives and the .comment and .note sections Debian's own strip removes.
function(halvex_strip_installed component)
  cmake_parse_arguments(ARG "" "" "OPTIONS;FILES" ${ARGN})
  install(CODE "
    if(CMAKE_INSTALL_DO_STRIP)
      foreach(file ${ARG_FILES})
        execute_process(COMMAND \"${CMAKE_STRIP}\" ${ARG_OPTIONS}
                                \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/\${file}\"
                        COMMAND_ERROR_IS_FATAL ANY)
      endforeach()
    endif()"
    COMPONENT ${component})
endfunction()
