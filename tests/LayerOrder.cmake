# Each layer of the library sees the headers of its own layer and of the
# layers below it, and no other: a header of a layer above it, or of a folder
# outside the library, is not found. Compiled with the include directories
# the build gives each layer, so that a layer given more (the repository root,
# say) fails here. The README's layout table names, for every layer, the
# folders it builds.
#   cmake -DCXX=... -DWORK_DIR=... -DREADME=... -DLAYERS=layer|layer...
#         -DINCLUDES_<layer>=dir|dir... -DFOLDERS_<layer>=folder|folder...
#         -P LayerOrder.cmake

# layer | a header of its own | headers it must not see, separated by commas
set(cases
    "tarn_values|tnUtils/Archive.h|tnObject/IObject.h,tnBackends/IStore.h"
    "tarn_objects|tnPersistStore/pref.h|tnOperation/FieldId.h,tnRuntime/CSpace.h,tnBackends/IStore.h"
    "tarn_module|tnOperation/src/WorkingSet/CompOp/OffsetOps.h|tnRuntime/CSpace.h,tnBackends/IStore.h,tnStore/OffsetOpsStore.h"
    "tarn_backends|tnBackends/LmdbStore.h|tnObject/IObject.h,tnRuntime/CSpace.h,tnStore/Journal.h"
    "tarn_runtime|tnRuntime/CSpace.h|tnOperation/src/WorkingSet/CompOp/OffsetOps.h,tnStore/OffsetOpsStore.h"
    "tarn_api|tnStore/OffsetOpsStoreImpl.h|tools/CommandTable.h,tests/StoreTestDir.h")

file(REMOVE_RECURSE ${WORK_DIR})
file(MAKE_DIRECTORY ${WORK_DIR})

# Compiles a file that includes `header` with the include directories of
# `layer`; sets `compiled` and `errors` in the caller.
function(compile layer header)
    string(REPLACE "|" ";" dirs "${INCLUDES_${layer}}")
    if(NOT dirs)
        message(FATAL_ERROR "no include directories given for ${layer}")
    endif()
    set(flags)
    foreach(dir ${dirs})
        list(APPEND flags -I${dir})
    endforeach()
    string(MAKE_C_IDENTIFIER "${layer}_${header}" name)
    set(source ${WORK_DIR}/${name}.cpp)
    file(WRITE ${source} "#include \"${header}\"\n")
    execute_process(COMMAND ${CXX} -std=c++20 -fsyntax-only ${flags} ${source}
        RESULT_VARIABLE rc ERROR_VARIABLE err OUTPUT_QUIET)
    if(rc EQUAL 0)
        set(compiled TRUE PARENT_SCOPE)
    else()
        set(compiled FALSE PARENT_SCOPE)
    endif()
    set(errors "${err}" PARENT_SCOPE)
endfunction()

foreach(case ${cases})
    string(REPLACE "|" ";" fields "${case}")
    list(GET fields 0 layer)
    list(GET fields 1 own)
    list(GET fields 2 above)
    string(REPLACE "," ";" above "${above}")
    compile(${layer} ${own})
    if(NOT compiled)
        message(FATAL_ERROR "${layer} does not compile its own ${own}:\n${errors}")
    endif()
    foreach(header ${above})
        compile(${layer} ${header})
        if(compiled)
            message(FATAL_ERROR "${layer} sees ${header}, which is not below it")
        endif()
        if(NOT errors MATCHES "${header}: No such file or directory")
            message(FATAL_ERROR "${layer} including ${header} failed otherwise than by not finding it:\n${errors}")
        endif()
    endforeach()
endforeach()

# The README's layout table: one row per layer, "| `folder/`, ... | `layer`".
file(STRINGS ${README} rows REGEX "^\\| `")
string(REPLACE "|" ";" layers "${LAYERS}")
foreach(layer ${layers})
    string(REPLACE "|" ";" folders "${FOLDERS_${layer}}")
    set(expected)
    foreach(folder ${folders})
        list(APPEND expected "`${folder}/`")
    endforeach()
    list(JOIN expected ", " expected)
    set(found FALSE)
    foreach(row ${rows})
        string(FIND "${row}" "| ${expected} | `${layer}`" at)
        if(at EQUAL 0)
            set(found TRUE)
        endif()
    endforeach()
    if(NOT found)
        message(FATAL_ERROR "the README's layout table has no row \"| ${expected} | `${layer}`\"")
    endif()
endforeach()
