# Differences between Debian releases; packages are for the release of the build machine.
cmake_host_system_information(RESULT host QUERY DISTRIB_INFO)

# Suffix of the version; that of a later release sorts as newer.
if(NOT host_VERSION_ID)
  set(TERNHA_RELEASE_SUFFIX "") # Debian before its release
elseif(host_ID STREQUAL "debian")
  set(TERNHA_RELEASE_SUFFIX "~deb${host_VERSION_ID}u1")
else()
  set(TERNHA_RELEASE_SUFFIX "~${host_ID}${host_VERSION_ID}")
endif()
set(TERNHA_RELEASE_NAME unstable)
if(host_VERSION_CODENAME)
  set(TERNHA_RELEASE_NAME ${host_VERSION_CODENAME})
endif()

# Up to Debian 12, packages must not use /usr/lib for /lib; from Debian 13 on, not /lib.
set(TERNHA_SYSTEM_UNITDIR /usr/lib/systemd/system)
if(host_ID STREQUAL "debian" AND host_VERSION_ID AND host_VERSION_ID VERSION_LESS 13)
  set(TERNHA_SYSTEM_UNITDIR /lib/systemd/system)
endif()
