# The library is built as one static library per layer, and each layer sees
# and links only the layers below it (README, "Layers"):
#
#   tarn_layer(NAME FOLDERS folder... [LINKS target...] [PROVIDERS target...])
#
# compiles every .cpp under the folders into the static library NAME, linked
# (PUBLIC) to LINKS, and adds its link check (below); PROVIDERS are what the
# layer calls without linking it (the runtime, for its interface). Includes are written from the repository root
# ("tnUtils/Archive.h"), so the root itself is never an include directory of
# a layer: each layer publishes its own folders alone, as symbolic links in
# <build>/layers/NAME, and a source sees exactly the folders of its layer and
# of the layers it links. An include of a higher layer's header is then a
# compile error ("No such file or directory").
#
# Headers reached through such a link are named by their path from the link
# directory in __FILE__ (-fmacro-prefix-map), so that assertion messages name
# them from the repository root, as the sources themselves are.
function(tarn_layer name)
    cmake_parse_arguments(PARSE_ARGV 1 layer "" "" "FOLDERS;LINKS;PROVIDERS")
    set(sources)
    set(staging ${CMAKE_BINARY_DIR}/layers/${name})
    file(REMOVE_RECURSE ${staging})
    file(MAKE_DIRECTORY ${staging})
    foreach(folder ${layer_FOLDERS})
        file(GLOB_RECURSE folder_sources CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/${folder}/*.cpp)
        list(APPEND sources ${folder_sources})
        file(CREATE_LINK ${CMAKE_SOURCE_DIR}/${folder} ${staging}/${folder} SYMBOLIC)
    endforeach()
    add_library(${name} STATIC ${sources})
    target_include_directories(${name} PUBLIC
        $<BUILD_INTERFACE:${staging}>
        $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/tarn>)
    target_compile_options(${name} PUBLIC
        $<BUILD_INTERFACE:-fmacro-prefix-map=${staging}/=>)
    target_link_libraries(${name} PUBLIC ${layer_LINKS})
    # Read back by the test LayerOrder, which holds the README's layout table
    # to these folders.
    set_property(TARGET ${name} PROPERTY TARN_FOLDERS ${layer_FOLDERS})
    set_property(GLOBAL APPEND PROPERTY TARN_LAYERS ${name})
    tarn_layer_link_check(${name} ${layer_PROVIDERS})
endfunction()

# tarn_layer_link_check(NAME provider...)
#
# The build refuses a call against the order as it refuses an include: the
# executable NAME_link_check holds every object of the layer NAME and links
# only what NAME links, plus the providers (the runtime, for the layers below
# it that call the runtime's interface, tnObject/RuntimeInterface.h). A function
# that the layer calls and none of these defines is an undefined reference,
# and the build stops there.
function(tarn_layer_link_check name)
    set(check_target ${name}_link_check)
    add_executable(${check_target} ${CMAKE_SOURCE_DIR}/cmake/LinkCheck.cpp)
    target_link_options(${check_target} PRIVATE
        LINKER:--whole-archive $<TARGET_FILE:${name}> LINKER:--no-whole-archive)
    target_link_libraries(${check_target} PRIVATE ${name} ${ARGN})
endfunction()
