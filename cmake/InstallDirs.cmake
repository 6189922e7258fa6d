# Where the system integration files go: the directories the D-Bus daemon and systemd read, as
# their own pkg-config files name them. Installed under the distribution's own prefix (a package
# built with --prefix /usr) they are used as they are; under another prefix they are evaluated
# relative to it, so that an install into /usr/local stays inside /usr/local. Each one may be set
# on the command line (-DZLKA_UNIT_DIR=...) where a distribution wants it elsewhere.
pkg_check_modules(DBUS1 REQUIRED dbus-1)
pkg_check_modules(SYSTEMD_DIRS REQUIRED systemd)

# zlka_pkg_dir(VAR MODULE VARIABLE SUFFIX): VAR, unless given on the command line, is MODULE's
# VARIABLE followed by SUFFIX. Not cached, so that a change of prefix moves it too.
function(zlka_pkg_dir var module variable suffix)
  if(DEFINED CACHE{${var}})
    return()
  endif()
  execute_process(COMMAND ${PKG_CONFIG_EXECUTABLE} --variable=prefix ${module}
                  OUTPUT_VARIABLE own_prefix OUTPUT_STRIP_TRAILING_WHITESPACE COMMAND_ERROR_IS_FATAL ANY)
  set(defines "")
  if(NOT own_prefix STREQUAL CMAKE_INSTALL_PREFIX)
    # systemd's root_prefix (rootprefix in older releases) is where /lib lives on systems that
    # still split it from /usr; under a prefix of our own there is no such split.
    foreach(name prefix root_prefix rootprefix)
      list(APPEND defines --define-variable=${name}=${CMAKE_INSTALL_PREFIX})
    endforeach()
  endif()
  execute_process(COMMAND ${PKG_CONFIG_EXECUTABLE} ${defines} --variable=${variable} ${module}
                  OUTPUT_VARIABLE dir OUTPUT_STRIP_TRAILING_WHITESPACE COMMAND_ERROR_IS_FATAL ANY)
  if(NOT dir MATCHES "^/")
    message(FATAL_ERROR "pkg-config ${module} has no absolute ${variable} (got '${dir}')")
  endif()
  set(${var} "${dir}${suffix}" PARENT_SCOPE)
endfunction()

zlka_pkg_dir(ZLKA_UNIT_DIR systemd systemdsystemunitdir "")
zlka_pkg_dir(ZLKA_SYSUSERS_DIR systemd sysusersdir "")
zlka_pkg_dir(ZLKA_TMPFILES_DIR systemd tmpfilesdir "")
zlka_pkg_dir(ZLKA_DBUS_SYSTEM_SERVICES_DIR dbus-1 system_bus_services_dir "")
zlka_pkg_dir(ZLKA_DBUS_INTERFACES_DIR dbus-1 interfaces_dir "")
# dbus-1 names no variable for it: the system bus reads <datadir>/dbus-1/system.d.
zlka_pkg_dir(ZLKA_DBUS_POLICY_DIR dbus-1 datadir "/dbus-1/system.d")

# Said when installing, not at every configure: only an install can leave the name unownable.
execute_process(COMMAND ${PKG_CONFIG_EXECUTABLE} --variable=datadir dbus-1
                OUTPUT_VARIABLE bus_datadir OUTPUT_STRIP_TRAILING_WHITESPACE)
if(NOT ZLKA_DBUS_POLICY_DIR STREQUAL "${bus_datadir}/dbus-1/system.d" AND NOT ZLKA_DBUS_POLICY_DIR STREQUAL "/etc/dbus-1/system.d")
  install(CODE "message(WARNING \"The system bus does not read ${ZLKA_DBUS_POLICY_DIR}: installed there, the policy \"
                                \"does not let zlkad own its name. Configure with -DCMAKE_INSTALL_PREFIX=/usr for a \"
                                \"system install, or -DZLKA_DBUS_POLICY_DIR=/etc/dbus-1/system.d for a local one.\")")
endif()

# Paths inside the unit and the D-Bus files are fixed at configure time. Installing the same tree
# under another prefix (cmake --install --prefix) would move the files but not what they name.
install(CODE "
  if(NOT CMAKE_INSTALL_PREFIX STREQUAL \"${CMAKE_INSTALL_PREFIX}\")
    message(FATAL_ERROR \"this tree was configured for the prefix ${CMAKE_INSTALL_PREFIX}, which the unit and the D-Bus \"
                        \"files name; configure it with -DCMAKE_INSTALL_PREFIX=\${CMAKE_INSTALL_PREFIX} instead\")
  endif()")
