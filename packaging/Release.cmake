# The release that packages are built on, and so for: what differs from one to the next.
cmake_host_system_information(RESULT host QUERY DISTRIB_INFO)

# The end of the packages' version: that of a later release counts as newer.
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

# Until Debian 12 packages must not hold /lib under its new name, since Debian 13 not under its old one.
set(TERNHA_SYSTEM_UNITDIR /usr/lib/systemd/system)
if(host_ID STREQUAL "debian" AND host_VERSION_ID AND host_VERSION_ID VERSION_LESS 13)
  set(TERNHA_SYSTEM_UNITDIR /lib/systemd/system)
endif()
