# tarn_header_closure(OUT ROOT...): the headers ROOT... include, themselves
# included, following `#include "..."` lines (paths from the source root)
# to the end. The public API is those headers and nothing else: an internal
# header that a public one starts to include joins the installed set at the
# next configure, and the build re-configures when any of them changes.
function(tarn_header_closure out)
    set(pending ${ARGN})
    set(seen)
    while(pending)
        list(POP_FRONT pending header)
        if(header IN_LIST seen)
            continue()
        endif()
        if(NOT EXISTS ${CMAKE_SOURCE_DIR}/${header})
            message(FATAL_ERROR "public header closure: '${header}' is not in the source tree "
                                "(includes are written from the repository root)")
        endif()
        list(APPEND seen ${header})
        set_property(DIRECTORY ${CMAKE_SOURCE_DIR} APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS
            ${CMAKE_SOURCE_DIR}/${header})
        file(STRINGS ${CMAKE_SOURCE_DIR}/${header} lines REGEX "^[ \t]*#[ \t]*include[ \t]*\"")
        foreach(line ${lines})
            string(REGEX REPLACE "^[ \t]*#[ \t]*include[ \t]*\"([^\"]+)\".*" "\\1" included "${line}")
            list(APPEND pending ${included})
        endforeach()
    endwhile()
    list(SORT seen)
    set(${out} ${seen} PARENT_SCOPE)
endfunction()
