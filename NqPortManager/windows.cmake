# The Windows module's type library: NqPortManager.idl through widl. The LIBID of the result is
# checked by the Windows tests (widl has written wrong ones for some orders of the library).
set(NQ_TLB ${CMAKE_BINARY_DIR}/NqPortManager/NqPortManager.tlb)
set(NQ_STDOLE_DIR /usr/lib/x86_64-linux-gnu/wine/x86_64-windows)
add_custom_command(OUTPUT ${NQ_TLB}
                   COMMAND ${CMAKE_COMMAND} -E make_directory ${CMAKE_BINARY_DIR}/NqPortManager
                   COMMAND ${NQ_WIDL} -I${NQ_WINE_IDL_DIR} -L${NQ_STDOLE_DIR} -t -o ${NQ_TLB}
                           ${CMAKE_CURRENT_LIST_DIR}/NqPortManager.idl
                   DEPENDS ${CMAKE_CURRENT_LIST_DIR}/NqPortManager.idl VERBATIM)
add_custom_target(nq_typelib ALL DEPENDS ${NQ_TLB})

# The module's resources: TYPELIB 1, and the registry scripts 101 and 103 to 106 taken from
# Registration.cpp.
set(NQ_RES_DIR ${CMAKE_BINARY_DIR}/NqPortManager/resources)
add_custom_command(OUTPUT ${NQ_RES_DIR}/NqPortManager.rc
                   COMMAND ${CMAKE_COMMAND} -E make_directory ${NQ_RES_DIR}
                   COMMAND ${CMAKE_COMMAND} -DSOURCE=${CMAKE_CURRENT_LIST_DIR} -DOUTPUT=${NQ_RES_DIR}
                           -DTLB=${NQ_TLB} -P ${CMAKE_CURRENT_LIST_DIR}/resources.cmake
                   DEPENDS ${CMAKE_CURRENT_LIST_DIR}/Registration.cpp
                           ${CMAKE_CURRENT_LIST_DIR}/resources.cmake ${NQ_TLB}
                           ${PROJECT_SOURCE_DIR}/include/nqportmanager/NqPortManager.h VERBATIM)

file(GLOB NQ_MODULE_SOURCES CONFIGURE_DEPENDS ${CMAKE_CURRENT_LIST_DIR}/*.cpp)
list(REMOVE_ITEM NQ_MODULE_SOURCES ${CMAKE_CURRENT_LIST_DIR}/Module.cpp
     ${CMAKE_CURRENT_LIST_DIR}/ClientApi.cpp)
# The library's description comes along for registration (its id, version and help string);
# IDispatch itself is oleaut32's here.
add_library(nq_module STATIC ${NQ_MODULE_SOURCES} ${PROJECT_SOURCE_DIR}/automation/NqPortManagerLib.cpp)
target_link_libraries(nq_module PUBLIC nq_platform PRIVATE nlohmann_json::nlohmann_json)

# NqPortManager.dll: the four entry points by name (the .def), its resources inside.
add_library(NqPortManager SHARED ${CMAKE_CURRENT_LIST_DIR}/Module.cpp
            ${CMAKE_CURRENT_LIST_DIR}/ClientApi.cpp ${CMAKE_CURRENT_LIST_DIR}/NqPortManager.def
            ${NQ_RES_DIR}/NqPortManager.rc)
target_link_libraries(NqPortManager PRIVATE nq_module nq_portmanager nq_sipproxy)
set_target_properties(NqPortManager PROPERTIES PREFIX "")
