# Installs the build tree BUILD_DIR into a prefix under WORK_DIR, then builds
# against it, as a program outside the tree would: the embedding example
# (which must run and record into a store) and a program that breaks an
# assertion in an installed header (whose message must name the header by
# its path from the repository root, not by the prefix).
#   cmake -DBUILD_DIR=... -DSOURCE_DIR=... -DWORK_DIR=... -DCXX=... -P InstalledPackage.cmake

function(run)
    execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
    if(NOT rc EQUAL 0)
        message(FATAL_ERROR "failed (${rc}): ${ARGN}\n${out}\n${err}")
    endif()
endfunction()

file(REMOVE_RECURSE ${WORK_DIR})
set(prefix ${WORK_DIR}/prefix)
run(${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix})
foreach(project embed assertion)
    if(project STREQUAL "embed")
        set(source ${SOURCE_DIR}/examples/embed)
    else()
        set(source ${SOURCE_DIR}/tests/installed)
    endif()
    run(${CMAKE_COMMAND} -S ${source} -B ${WORK_DIR}/${project} -G Ninja
        -DCMAKE_CXX_COMPILER=${CXX} -DCMAKE_PREFIX_PATH=${prefix})
    run(${CMAKE_COMMAND} --build ${WORK_DIR}/${project})
endforeach()

run(${WORK_DIR}/embed/embed-example ${WORK_DIR}/store)

execute_process(COMMAND ${WORK_DIR}/assertion/broken-assertion
    RESULT_VARIABLE rc ERROR_VARIABLE err)
if(rc EQUAL 0)
    message(FATAL_ERROR "the broken assertion did not stop the program")
endif()
if(NOT err MATCHES "^tnPersistStore/pref\\.h:[0-9]+: [^\n]*tarn::cref<void>::operator=\\(void ?\\*\\): Assertion \"!p\" failed\\.")
    message(FATAL_ERROR "unexpected assertion message: ${err}")
endif()
message(STATUS "installed package: ${err}")
