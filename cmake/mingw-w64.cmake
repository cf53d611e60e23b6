# Cross build for 64-bit Windows with Debian's mingw-w64. The -posix compilers, because the
# -win32 ones have no std::thread or std::mutex. Tests run under Wine (tests/CMakeLists.txt).
set(CMAKE_SYSTEM_NAME Windows)
set(CMAKE_SYSTEM_PROCESSOR x86_64)
set(NQ_MINGW_PREFIX x86_64-w64-mingw32)

set(CMAKE_C_COMPILER ${NQ_MINGW_PREFIX}-gcc-posix)
set(CMAKE_CXX_COMPILER ${NQ_MINGW_PREFIX}-g++-posix)
set(CMAKE_RC_COMPILER ${NQ_MINGW_PREFIX}-windres)
set(NQ_WIDL ${NQ_MINGW_PREFIX}-widl)
# Wine's IDL files (libwine-dev): the ones mingw-w64 lacks, and stdole2.tlb's neighbours.
set(NQ_WINE_IDL_DIR /usr/include/wine/wine/windows)

set(CMAKE_FIND_ROOT_PATH /usr/${NQ_MINGW_PREFIX})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

find_program(NQ_WINE NAMES wine64 wine)
if(NQ_WINE)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${NQ_WINE})
endif()
