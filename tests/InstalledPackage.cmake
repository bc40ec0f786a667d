# Installs the build tree BUILD_DIR into a prefix under WORK_DIR, then builds
# against it, as a program outside the tree would: the package holds the
# API's headers and no internal one, its version file takes this version and
# refuses another major or minor one, pkg-config finds the library, the
# embedding example builds (with CMake, and with pkg-config's flags) and runs,
# the program comes with its man page and completion,
# and a misuse caught in an installed header names it from the repository
# root, not by the prefix.
#   cmake -DBUILD_DIR=... -DSOURCE_DIR=... -DWORK_DIR=... -DCXX=... -DVERSION=... -P InstalledPackage.cmake

function(run)
    execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
    if(NOT rc EQUAL 0)
        message(FATAL_ERROR "failed (${rc}): ${ARGN}\n${out}\n${err}")
    endif()
    set(output "${out}" PARENT_SCOPE)
endfunction()

file(REMOVE_RECURSE ${WORK_DIR})
set(prefix ${WORK_DIR}/prefix)
run(${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix})

# The API's headers, and an internal one left out.
foreach(header tnStore/OffsetOpsStore.h tnStore/FieldCursor.h tnStore/FieldTable.h
               tnStore/FieldIdText.h tnUtils/RuntimeError.h tnOperation/FieldId.h)
    if(NOT EXISTS ${prefix}/include/tarn/${header})
        message(FATAL_ERROR "the API header ${header} is not installed")
    endif()
endforeach()
foreach(header tnRuntime/CSpace.h tnStore/OffsetOpsStoreImpl.h tnBackends/LmdbStore.h
               tnObject/RuntimeInterface.h tnOperation/src/WorkingSet/CompOp/OffsetOpsOnField.h)
    if(EXISTS ${prefix}/include/tarn/${header})
        message(FATAL_ERROR "the internal header ${header} is installed")
    endif()
endforeach()
# Nothing at all of the object runtime, the storage backends or the module's
# own folder: the API's headers reach none of them.
foreach(folder tnRuntime tnBackends tnOperation/src/WorkingSet)
    if(EXISTS ${prefix}/include/tarn/${folder})
        message(FATAL_ERROR "internal headers installed: include/tarn/${folder}")
    endif()
endforeach()

# The library of every layer, which a static library needs beside it.
foreach(library tarn tarn_module tarn_runtime tarn_objects tarn_backends tarn_values)
    file(GLOB_RECURSE archive ${prefix}/*/lib${library}.a)
    if(NOT archive)
        message(FATAL_ERROR "lib${library}.a is not installed")
    endif()
endforeach()

# The program's man page and bash completion.
foreach(file share/man/man1/offsetops.1 share/bash-completion/completions/offsetops)
    if(NOT EXISTS ${prefix}/${file})
        message(FATAL_ERROR "${file} is not installed")
    endif()
endforeach()

# The version file: this version and a later minor one asked for.
file(GLOB_RECURSE version_file ${prefix}/*/tarnConfigVersion.cmake)
if(NOT version_file)
    message(FATAL_ERROR "no tarnConfigVersion.cmake installed")
endif()
foreach(asked ${VERSION} 0.1 1.0 0.99)
    set(PACKAGE_FIND_VERSION ${asked})
    string(REPLACE "." ";" parts ${asked})
    list(GET parts 0 PACKAGE_FIND_VERSION_MAJOR)
    list(GET parts 1 PACKAGE_FIND_VERSION_MINOR)
    set(PACKAGE_VERSION_COMPATIBLE FALSE)
    include(${version_file})
    if(NOT PACKAGE_VERSION STREQUAL VERSION)
        message(FATAL_ERROR "the version file says ${PACKAGE_VERSION}, not ${VERSION}")
    endif()
    if(asked STREQUAL VERSION AND NOT PACKAGE_VERSION_COMPATIBLE)
        message(FATAL_ERROR "version ${asked} asked for is refused")
    elseif(NOT asked STREQUAL VERSION AND PACKAGE_VERSION_COMPATIBLE)
        message(FATAL_ERROR "version ${asked} asked for is taken by ${PACKAGE_VERSION}")
    endif()
endforeach()

# pkg-config, from the prefix's lib/pkgconfig.
file(GLOB_RECURSE pc_file ${prefix}/*/pkgconfig/tarn.pc)
if(NOT pc_file)
    message(FATAL_ERROR "no tarn.pc installed")
endif()
get_filename_component(pc_dir ${pc_file} DIRECTORY)
set(ENV{PKG_CONFIG_PATH} ${pc_dir})
run(pkg-config --modversion tarn)
string(STRIP "${output}" modversion)
if(NOT modversion STREQUAL VERSION)
    message(FATAL_ERROR "pkg-config says version ${modversion}, not ${VERSION}")
endif()
run(pkg-config --cflags --libs tarn)
string(STRIP "${output}" flags)
string(REGEX MATCH "-I([^ ]+)" include_flag "${flags}")
if(NOT EXISTS "${CMAKE_MATCH_1}/tnStore/OffsetOpsStore.h" OR NOT flags MATCHES "-ltarn")
    message(FATAL_ERROR "pkg-config --cflags --libs tarn: ${flags}")
endif()
run(pkg-config --static --cflags --libs tarn)
string(STRIP "${output}" static_flags)
if(NOT static_flags MATCHES "-llmdb" OR NOT static_flags MATCHES "-lxxhash")
    message(FATAL_ERROR "pkg-config --static --libs tarn lacks LMDB or xxHash: ${static_flags}")
endif()
separate_arguments(static_flags UNIX_COMMAND "${static_flags}")
run(${CXX} ${SOURCE_DIR}/examples/embed/main.cpp -o ${WORK_DIR}/embed-pkg-config ${static_flags})
run(${WORK_DIR}/embed-pkg-config ${WORK_DIR}/store-pkg-config)
if(NOT output MATCHES "#42/01 --> {\\(0123abcd-0001-beef-8000-00000000002a,\\(8,7\\)\\)}")
    message(FATAL_ERROR "the example built with pkg-config printed: ${output}")
endif()

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
if(NOT output MATCHES "#42/01 --> {[^\n]*}\n#43/ --> [^\n]*\nback: #43/\nback: #42/01\n$")
    message(FATAL_ERROR "the embedding example printed: ${output}")
endif()

execute_process(COMMAND ${WORK_DIR}/assertion/broken-assertion
    RESULT_VARIABLE rc ERROR_VARIABLE err)
if(rc EQUAL 0)
    message(FATAL_ERROR "the misuse did not stop the program")
endif()
if(NOT err MATCHES "^tnStore/FieldCursor\\.h:[0-9]+: [^\n]*tarn::FieldCursor::Key\\(\\) const: Assertion \"!AtEnd\\(\\)\" failed\\.")
    message(FATAL_ERROR "unexpected assertion message: ${err}")
endif()
message(STATUS "installed package: ${err}")
