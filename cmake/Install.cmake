# Installation directories and properties.
include(CMakePackageConfigHelpers)

# Configuration belongs in /etc if the prefix is /usr; otherwise the tree is relocatable.
if(CMAKE_INSTALL_PREFIX STREQUAL "/usr")
  set(TERNHA_INSTALL_CONFDIR /etc/ternha)
  set(TERNHA_CONFIG_FILE /etc/ternha/ternhad.conf)
else()
  set(TERNHA_INSTALL_CONFDIR ${CMAKE_INSTALL_SYSCONFDIR}/ternha)
  set(TERNHA_CONFIG_FILE ${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_SYSCONFDIR}/ternha/ternhad.conf)
  # The dynamic linker searches only /usr.
  file(RELATIVE_PATH lib_from_sbin /${CMAKE_INSTALL_SBINDIR} /${CMAKE_INSTALL_LIBDIR})
  set(CMAKE_INSTALL_RPATH $ORIGIN $ORIGIN/${lib_from_sbin})
endif()

set(TERNHA_INSTALL_CMAKEDIR ${CMAKE_INSTALL_LIBDIR}/cmake/ternhadaemon)

# ternha_install_compressed(FILE NAME DESTINATION COMPONENT)
#
# Installs FILE as NAME.gz, reproducibly.
function(ternha_install_compressed FILE NAME DESTINATION COMPONENT)
  find_program(TERNHA_GZIP gzip)
  mark_as_advanced(TERNHA_GZIP)
  if(NOT TERNHA_GZIP)
    message(FATAL_ERROR "gzip was not found: it compresses the manual pages")
  endif()
  set(compressed "${CMAKE_CURRENT_BINARY_DIR}/${COMPONENT}/${NAME}.gz")
  file(MAKE_DIRECTORY "${CMAKE_CURRENT_BINARY_DIR}/${COMPONENT}")
  add_custom_command(
    OUTPUT "${compressed}"
    COMMAND "${TERNHA_GZIP}" -9nc "${FILE}" > "${compressed}"
    DEPENDS "${FILE}"
    VERBATIM)
  string(MAKE_C_IDENTIFIER "compress_${COMPONENT}_${NAME}" target)
  add_custom_target(${target} ALL DEPENDS "${compressed}")
  install(FILES "${compressed}" DESTINATION "${DESTINATION}" COMPONENT ${COMPONENT})
endfunction()
