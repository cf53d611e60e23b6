# The Windows build: the same logic folders over platform/win32. Test executables are linked
# statically (no mingw runtime DLLs to find under Wine) and run under Wine through CTest, in a
# prefix of their own in the build tree.
enable_language(RC)
add_compile_definitions(__USE_MINGW_ANSI_STDIO=1)
add_link_options(-static -static-libgcc -static-libstdc++)

add_subdirectory(platform)
add_subdirectory(foundation)
add_subdirectory(stun)
add_subdirectory(diagnostics)
add_subdirectory(portmanager)
add_subdirectory(sipproxy)
# The header-only JSON library, without the rest of the host's include folder.
file(MAKE_DIRECTORY ${CMAKE_BINARY_DIR}/json-include)
file(CREATE_LINK /usr/include/nlohmann ${CMAKE_BINARY_DIR}/json-include/nlohmann SYMBOLIC)
add_library(nlohmann_json INTERFACE)
target_include_directories(nlohmann_json SYSTEM INTERFACE ${CMAKE_BINARY_DIR}/json-include)
add_library(nlohmann_json::nlohmann_json ALIAS nlohmann_json)
include(NqPortManager/windows.cmake)
# nqpm.exe, the command-line client, from the same sources.
file(GLOB NQPM_SOURCES CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/tools/nqpm/*.cpp)
list(REMOVE_ITEM NQPM_SOURCES ${PROJECT_SOURCE_DIR}/tools/nqpm/main.cpp)
add_library(nq_cli STATIC ${NQPM_SOURCES})
target_link_libraries(nq_cli PUBLIC nq_portmanager nq_sipproxy nq_module nlohmann_json::nlohmann_json)
add_executable(nqpm ${PROJECT_SOURCE_DIR}/tools/nqpm/main.cpp)
target_link_libraries(nqpm PRIVATE nq_cli)

if(NQPM_BUILD_TESTS)
  enable_testing()
  include(GoogleTest)
  set(NQ_WINE_PREFIX ${CMAKE_BINARY_DIR}/wineprefix)
  find_program(NQ_WINE_PROGRAM NAMES wine REQUIRED)
  find_program(NQ_WINESERVER NAMES wineserver PATHS /usr/lib/wine REQUIRED)
  find_program(NQ_WINEBOOT NAMES wineboot REQUIRED)
  # Every test process runs in the same headless prefix with Wine's own messages off.
  set(NQ_WINE_RUN ${CMAKE_BINARY_DIR}/wine-run.sh)
  file(CONFIGURE OUTPUT ${NQ_WINE_RUN} CONTENT [[#!/bin/sh
export WINEPREFIX="@NQ_WINE_PREFIX@" WINEDEBUG=-all DISPLAY=
exec "@NQ_WINE_PROGRAM@" "$@"
]] @ONLY)
  file(CHMOD ${NQ_WINE_RUN} PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ
       GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${NQ_WINE_RUN})

  set(BUILD_GMOCK OFF CACHE BOOL "" FORCE)
  set(INSTALL_GTEST OFF CACHE BOOL "" FORCE)
  set(gtest_disable_pthreads OFF CACHE BOOL "" FORCE)
  # GoogleTest built from its Debian sources for the target (it names GTest::gtest itself).
  add_subdirectory(/usr/src/googletest ${CMAKE_BINARY_DIR}/googletest EXCLUDE_FROM_ALL)

  add_subdirectory(tests/windows)
endif()
