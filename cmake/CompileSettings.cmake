# Settings that every target of the project shares, as the interface target ternha_settings.
set(CMAKE_CXX_STANDARD 17)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)

# A program need not be linked anew when a shared library changes behind its interface.
set(CMAKE_LINK_DEPENDS_NO_SHARED ON)

add_library(ternha_settings INTERFACE)

# A log may pass 2 GiB and a time stamp 2038 on 32-bit machines too.
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
            # A cast that 64-bit types need may be useless between 32-bit ones.
            $<$<AND:$<CXX_COMPILER_ID:GNU>,$<EQUAL:${CMAKE_SIZEOF_VOID_P},8>>:-Wuseless-cast>
            $<$<BOOL:${TERNHA_WARNINGS_AS_ERRORS}>:-Werror>)

if(TERNHA_SANITIZE)
  target_compile_options(ternha_settings INTERFACE -fsanitize=${TERNHA_SANITIZE} -fno-omit-frame-pointer
                                                   -fno-sanitize-recover=all)
  target_link_options(ternha_settings INTERFACE -fsanitize=${TERNHA_SANITIZE})
  if(TERNHA_SANITIZE MATCHES "thread")
    target_compile_options(ternha_settings INTERFACE "SHELL:-include ${CMAKE_CURRENT_LIST_DIR}/thread_sanitizer.h")
  endif()
endif()
