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
