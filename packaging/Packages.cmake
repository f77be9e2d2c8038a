# Debian packages, one per component; script/package builds them.
set(library_package libternhadaemon6)
set(development_package libternhadaemon-dev)
set(platform_package libterncore6)
set(daemon_package ternhad)

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME ternhadaemon)
set(CPACK_PACKAGE_VENDOR "The ternhadaemon authors")
set(CPACK_PACKAGE_CONTACT "The ternhadaemon authors <ternhadaemon@example.org>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "") # it would precede the description of each package
set(CPACK_COMPONENTS_ALL library development platform daemon)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_SET_DESTDIR ON) # /etc and /lib are outside of the prefix
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
    OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1${TERNHA_RELEASE_SUFFIX})
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${PROJECT_BINARY_DIR}/src ${PROJECT_BINARY_DIR}/platform)
if(CMAKE_CROSSCOMPILING)
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE armhf)
endif()
set(version ${PROJECT_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE})

file(WRITE ${CMAKE_CURRENT_BINARY_DIR}/triggers "activate-noawait ldconfig\n")
foreach(name ternhadaemon terncore)
  file(WRITE ${CMAKE_CURRENT_BINARY_DIR}/${name}/shlibs "lib${name} 6 lib${name}6 (>= ${PROJECT_VERSION})\n")
endforeach()
file(WRITE ${CMAKE_CURRENT_BINARY_DIR}/conffiles "${TERNHA_CONFIG_FILE}\n")

set(CPACK_COMPONENT_LIBRARY_DESCRIPTION
    [[support library of a two-node high-availability daemon
The daemon of a storage node uses it to detect whether its peer is alive,
whether an md resync or disk error handling is in progress on either node, and
how healthy the replication link is, and to fence the peer by a reboot.]])
# The library runs programs of these packages.
set(CPACK_DEBIAN_LIBRARY_PACKAGE_DEPENDS
    "libterncore6 (>= ${PROJECT_VERSION}), iputils-ping, net-tools, procps, xz-utils")
set(CPACK_DEBIAN_LIBRARY_PACKAGE_CONTROL_EXTRA ${CMAKE_CURRENT_BINARY_DIR}/triggers
                                               ${CMAKE_CURRENT_BINARY_DIR}/ternhadaemon/shlibs)

set(CPACK_COMPONENT_DEVELOPMENT_DESCRIPTION
    [[development files of the high-availability support library
Headers, link name, CMake package and pkg-config file for a host daemon that
uses libternhadaemon.]])
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS "${library_package} (= ${version}), libjsoncpp-dev")
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SHLIBDEPS OFF)

set(CPACK_COMPONENT_PLATFORM_DESCRIPTION
    [[portable replacement for the storage appliance's platform library
It implements for libternhadaemon, on any Linux, the functions of the
appliance's own library of this name: running programs, reading configuration
keys, naming disks.]])
set(CPACK_DEBIAN_PLATFORM_PACKAGE_CONTROL_EXTRA ${CMAKE_CURRENT_BINARY_DIR}/triggers
                                                ${CMAKE_CURRENT_BINARY_DIR}/terncore/shlibs)

set(CPACK_COMPONENT_DAEMON_DESCRIPTION
    [[high-availability daemon of a two-node storage cluster
The daemon monitors its peer over the replication link, replies to the peer's
requests and serves a control socket; ternhactl is its control tool.
ternha-firewall generates nftables rules that restrict its port to the peer.]])
set(CPACK_DEBIAN_DAEMON_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_DAEMON_PACKAGE_DEPENDS "${library_package} (>= ${PROJECT_VERSION})")
set(CPACK_DEBIAN_DAEMON_PACKAGE_RECOMMENDS nftables)
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_EXTRA
    ${CMAKE_CURRENT_BINARY_DIR}/conffiles ${CMAKE_CURRENT_SOURCE_DIR}/debian/postinst
    ${CMAKE_CURRENT_SOURCE_DIR}/debian/prerm ${CMAKE_CURRENT_SOURCE_DIR}/debian/postrm)

# Its latest entry names this version and release.
file(READ debian/changelog changelog)
string(REGEX REPLACE "^([a-z]+) [(]([^)]*)[)] unstable;" "\\1 (\\2${TERNHA_RELEASE_SUFFIX}) ${TERNHA_RELEASE_NAME};"
                     changelog "${changelog}")
file(CONFIGURE OUTPUT changelog CONTENT "${changelog}" @ONLY)

foreach(component ${CPACK_COMPONENTS_ALL})
  set(package ${${component}_package})
  string(TOUPPER ${component} upper)
  set(CPACK_DEBIAN_${upper}_PACKAGE_NAME ${package})
  if(CMAKE_INSTALL_PREFIX STREQUAL "/usr") # elsewhere it is no package
    set(documentation ${CMAKE_INSTALL_DATADIR}/doc/${package})
    install(
      FILES debian/copyright
      DESTINATION ${documentation}
      COMPONENT ${component})
    ternha_install_compressed(${CMAKE_CURRENT_BINARY_DIR}/changelog changelog.Debian ${documentation}
                              ${component})
    install(
      FILES debian/${package}.lintian-overrides
      DESTINATION ${CMAKE_INSTALL_DATADIR}/lintian/overrides
      RENAME ${package}
      COMPONENT ${component})
  endif()
endforeach()

include(CPack)
