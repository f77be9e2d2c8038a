# ternha_require(PACKAGE USE)
#
# Finds a package, or fails with its use and where package names of distributions are listed.
macro(ternha_require PACKAGE USE)
  find_package(${PACKAGE} QUIET)
  if(NOT ${PACKAGE}_FOUND)
    message(FATAL_ERROR "${PACKAGE} was not found: ${USE}. CONTRIBUTING.md has its package's name in several "
                        "distributions; on Debian \"script/bootstrap PURPOSE\" installs it.")
  endif()
endmacro()
