# Settings of all targets, as the interface target ternha_settings.
set(CMAKE_CXX_STANDARD 17)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)

# Do not relink programs when only the implementation of a shared library changes.
set(CMAKE_LINK_DEPENDS_NO_SHARED ON)

add_library(ternha_settings INTERFACE)

# Logs above 2 GiB and time stamps after 2038 on 32-bit machines.
target_compile_definitions(ternha_settings INTERFACE _GNU_SOURCE _FILE_OFFSET_BITS=64 _TIME_BITS=64)

target_compile_options(
  ternha_settings
  INTERFACE -Wall
            -Wextra
            -Wpedantic
            -Wshadow
            -Wconversion
            -Wsign-conversion
            -Wold-style-cast
            -Wcast-align
            -Wcast-qual
            -Wformat=2
            -Wnull-dereference
            -Woverloaded-virtual
            -Wundef
            -Wvla
            $<$<CXX_COMPILER_ID:GNU>:-Wduplicated-cond>
            $<$<CXX_COMPILER_ID:GNU>:-Wduplicated-branches>
            $<$<CXX_COMPILER_ID:GNU>:-Wlogical-op>
            # A cast needed for 64-bit types may be useless for 32-bit ones.
            $<$<AND:$<CXX_COMPILER_ID:GNU>,$<EQUAL:${CMAKE_SIZEOF_VOID_P},8>>:-Wuseless-cast>
            # Notes on an ABI change of GCC 7.1: nothing here was built by an older one.
            $<$<AND:$<CXX_COMPILER_ID:GNU>,$<EQUAL:${CMAKE_SIZEOF_VOID_P},4>>:-Wno-psabi>
            $<$<BOOL:${TERNHA_WARNINGS_AS_ERRORS}>:-Werror>)

if(TERNHA_SANITIZE)
  target_compile_options(ternha_settings INTERFACE -fsanitize=${TERNHA_SANITIZE} -fno-omit-frame-pointer
                                                   -fno-sanitize-recover=all)
  target_link_options(ternha_settings INTERFACE -fsanitize=${TERNHA_SANITIZE})
  if(TERNHA_SANITIZE MATCHES "thread")
    target_compile_options(ternha_settings INTERFACE "SHELL:-include ${CMAKE_CURRENT_LIST_DIR}/thread_sanitizer.h")
  endif()
endif()
