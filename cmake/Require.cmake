# ternha_require(PACKAGE USE)
#
# Finds a package, or ends with what it is for and where the names of distributions' packages are.
macro(ternha_require PACKAGE USE)
  find_package(${PACKAGE} QUIET)
  if(NOT ${PACKAGE}_FOUND)
    message(FATAL_ERROR "${PACKAGE} was not found: ${USE}. CONTRIBUTING.md has its package's name in several "
                        "distributions; on Debian script/bootstrap installs it.")
  endif()
endmacro()
