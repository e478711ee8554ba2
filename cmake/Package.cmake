# The files a system installation needs beyond the libraries and programs (systemd unit, logrotate file, manuals,
# example configuration, copyright and changelog per package), and the Debian package set built from the install
# components by CPack. scripts/package.sh configures a build for the prefix /usr and runs cpack there.
#
# Install components and their packages:
#   sdk      libzepasdk1        the SDK stand-in's shared library
#   runtime  libzeparelayd1     the library (named after its SONAME)
#   dev      libzeparelayd-dev  headers of both, .so links, pkg-config files, CMake package
#   daemon   zeparelayd         daemon, control tool, unit, logrotate file, manuals, example configuration
# The SDK has a package of its own: one SONAME per runtime package, and on the appliance the system library comes
# with the firmware, so it must be possible to leave it out or replace it without touching libzeparelayd1.

# A package installs below /usr, with its configuration in /etc; any other prefix keeps everything below itself.
if(CMAKE_INSTALL_PREFIX STREQUAL "/usr")
  set(ZEPA_ETC_DESTINATION ${CMAKE_INSTALL_FULL_SYSCONFDIR})
else()
  set(ZEPA_ETC_DESTINATION ${CMAKE_INSTALL_SYSCONFDIR})
endif()
set(ZEPA_UNIT_DESTINATION lib/systemd/system)
set(ZEPA_PACKAGING_DIR ${PROJECT_SOURCE_DIR}/packaging)

# Per package: the copyright file and a Debian changelog, compressed as Debian wants it.
set(ZEPA_DEB_CHANGELOG ${PROJECT_BINARY_DIR}/packaging/changelog.Debian.gz)
add_custom_command(OUTPUT ${ZEPA_DEB_CHANGELOG}
  COMMAND gzip -9n -c ${ZEPA_PACKAGING_DIR}/debian/changelog > ${ZEPA_DEB_CHANGELOG}
  DEPENDS ${ZEPA_PACKAGING_DIR}/debian/changelog
  COMMENT "Compressing the Debian changelog")
set(ZEPA_MANUALS zeparelayd.8 zeparelayctl.8 zeparelayd.conf.5)
set(ZEPA_MANUALS_GZ)
foreach(page ${ZEPA_MANUALS})
  add_custom_command(OUTPUT ${PROJECT_BINARY_DIR}/man/${page}.gz
    COMMAND ${CMAKE_COMMAND} -E make_directory ${PROJECT_BINARY_DIR}/man
    COMMAND gzip -9n -c ${PROJECT_SOURCE_DIR}/man/${page} > ${PROJECT_BINARY_DIR}/man/${page}.gz
    DEPENDS ${PROJECT_SOURCE_DIR}/man/${page}
    COMMENT "Compressing the manual ${page}")
  list(APPEND ZEPA_MANUALS_GZ ${PROJECT_BINARY_DIR}/man/${page}.gz)
endforeach()
add_custom_target(zepa_distribution_files ALL DEPENDS ${ZEPA_DEB_CHANGELOG} ${ZEPA_MANUALS_GZ})

set(ZEPA_PACKAGES sdk libzepasdk1 runtime libzeparelayd1 dev libzeparelayd-dev daemon zeparelayd)
while(ZEPA_PACKAGES)
  list(POP_FRONT ZEPA_PACKAGES component package)
  install(FILES ${ZEPA_PACKAGING_DIR}/debian/copyright ${ZEPA_DEB_CHANGELOG}
    DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/${package} COMPONENT ${component})
  if(EXISTS ${ZEPA_PACKAGING_DIR}/debian/${package}.lintian-overrides)
    install(FILES ${ZEPA_PACKAGING_DIR}/debian/${package}.lintian-overrides
      DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/lintian/overrides RENAME ${package} COMPONENT ${component})
  endif()
endwhile()

if(ZEPA_BUILD_TOOLS)
  set(ZEPA_FULL_SBINDIR ${CMAKE_INSTALL_FULL_SBINDIR})
  set(ZEPA_FULL_BINDIR ${CMAKE_INSTALL_FULL_BINDIR})
  configure_file(${ZEPA_PACKAGING_DIR}/systemd/zeparelayd.service.in ${PROJECT_BINARY_DIR}/zeparelayd.service @ONLY)
  install(FILES ${PROJECT_BINARY_DIR}/zeparelayd.service DESTINATION ${ZEPA_UNIT_DESTINATION} COMPONENT daemon)
  install(FILES ${ZEPA_PACKAGING_DIR}/logrotate/zeparelayd DESTINATION ${ZEPA_ETC_DESTINATION}/logrotate.d
    COMPONENT daemon)
  install(FILES ${PROJECT_BINARY_DIR}/man/zeparelayd.8.gz ${PROJECT_BINARY_DIR}/man/zeparelayctl.8.gz
    DESTINATION ${CMAKE_INSTALL_MANDIR}/man8 COMPONENT daemon)
  install(FILES ${PROJECT_BINARY_DIR}/man/zeparelayd.conf.5.gz DESTINATION ${CMAKE_INSTALL_MANDIR}/man5
    COMPONENT daemon)
  install(FILES ${PROJECT_SOURCE_DIR}/examples/zeparelayd.conf
    DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/zeparelayd/examples COMPONENT daemon)
endif()

# ---- CPack: one Debian package per component ---------------------------------------------------------------------
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME zeparelayd)
set(CPACK_PACKAGE_VENDOR "libzeparelayd developers")
set(CPACK_PACKAGE_CONTACT "libzeparelayd developers <zeparelayd@zepa.example>")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_RESOURCE_FILE_LICENSE ${PROJECT_SOURCE_DIR}/LICENSE)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL sdk runtime dev daemon)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_HOMEPAGE "https://zepa.example/zeparelayd")
# Dependencies on other distribution packages come from the binaries; between our own packages they are exact.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY "=")
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS
  ${PROJECT_BINARY_DIR}/sdk ${PROJECT_BINARY_DIR}/src)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(ZEPA_DEB_EXACT "(= ${PROJECT_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE})")
# The libraries' packages tell dpkg to refresh the linker cache.
set(CPACK_DEBIAN_SDK_PACKAGE_CONTROL_EXTRA ${ZEPA_PACKAGING_DIR}/debian/triggers)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA ${ZEPA_PACKAGING_DIR}/debian/triggers)

set(CPACK_DEBIAN_SDK_PACKAGE_NAME libzepasdk1)
set(CPACK_DEBIAN_SDK_DESCRIPTION "appliance system library stand-in for the relay daemon
libzepasdk gives the relay daemon library the appliance's system facts
(key/value files, firewall definitions, network, identity) on a stock
Linux system, below a configurable system root.")

set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libzeparelayd1)
# libcurl is loaded on the first request (dlopen), so shlibdeps cannot see it: name it here.
set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS "libzepasdk1 ${ZEPA_DEB_EXACT}, libcurl4")
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION "relay daemon library of a NAS appliance
libzeparelayd holds what the relay daemon and the appliance's
administration tools share: the relay configuration and its JSON files,
the relayable services and their permissions, HTTP(S) requests, the alias
client, the VPN tunnel controller, process control and status queries.")

set(CPACK_DEBIAN_DEV_PACKAGE_NAME libzeparelayd-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS
  "libzeparelayd1 ${ZEPA_DEB_EXACT}, libzepasdk1 ${ZEPA_DEB_EXACT}, libjsoncpp-dev, libcurl4-openssl-dev | libcurl-dev, libboost-dev")
set(CPACK_DEBIAN_DEV_DESCRIPTION "relay daemon library of a NAS appliance - development files
Headers, linker links, pkg-config files (zeparelayd, zepasdk) and the CMake
package (zeparelayd::zeparelayd, zeparelayd::zepasdk) of libzeparelayd and
the system library stand-in libzepasdk.")

set(CPACK_DEBIAN_DAEMON_PACKAGE_NAME zeparelayd)
set(CPACK_DEBIAN_DAEMON_PACKAGE_SECTION net)
set(CPACK_DEBIAN_DAEMON_PACKAGE_DEPENDS "libzeparelayd1 ${ZEPA_DEB_EXACT}, libzepasdk1 ${ZEPA_DEB_EXACT}")
set(CPACK_DEBIAN_DAEMON_PACKAGE_SUGGESTS "openvpn, logrotate")
set(CPACK_DEBIAN_DAEMON_DESCRIPTION "relay daemon of a NAS appliance and its control tool
zeparelayd registers the appliance's services with the relay's control
server and keeps its alias registered; zeparelayctl asks it for its state
and controls it. Ships a systemd unit (Type=notify), manuals, a logrotate
file and an example configuration.")
# A cross build (scripts/package.sh --arch) packages for the target. dpkg-shlibdeps reads the build machine's package
# database, which holds none of the target's packages: the script reads the same dependencies from the shlibs files
# of the target's packages in its sysroot and passes them in.
if(CMAKE_CROSSCOMPILING)
  if(NOT ZEPA_DEB_ARCHITECTURE)
    message(FATAL_ERROR "a cross build needs ZEPA_DEB_ARCHITECTURE (set by cmake/toolchains/<arch>.cmake)")
  endif()
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE ${ZEPA_DEB_ARCHITECTURE})
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS OFF)
  foreach(component SDK RUNTIME DAEMON)
    if(ZEPA_DEB_SHLIBS_${component})
      if(CPACK_DEBIAN_${component}_PACKAGE_DEPENDS)
        string(APPEND CPACK_DEBIAN_${component}_PACKAGE_DEPENDS ", ${ZEPA_DEB_SHLIBS_${component}}")
      else()
        set(CPACK_DEBIAN_${component}_PACKAGE_DEPENDS "${ZEPA_DEB_SHLIBS_${component}}")
      endif()
    endif()
  endforeach()
endif()

configure_file(${ZEPA_PACKAGING_DIR}/debian/conffiles.in ${PROJECT_BINARY_DIR}/packaging/daemon/conffiles @ONLY)
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_EXTRA ${PROJECT_BINARY_DIR}/packaging/daemon/conffiles)

include(CPack)
