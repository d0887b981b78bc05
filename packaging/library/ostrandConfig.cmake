# find_package(ostrand) gives the target ostrand::ostrand.

include(CMakeFindDependencyMacro)

get_filename_component(ostrand_prefix "${CMAKE_CURRENT_LIST_DIR}/../../.." ABSOLUTE)
if(NOT TARGET ostrand::ostrand)
    add_library(ostrand::ostrand STATIC IMPORTED)
    set_target_properties(ostrand::ostrand PROPERTIES
        IMPORTED_LOCATION "${ostrand_prefix}/lib/libostrand.a"
        IMPORTED_LINK_INTERFACE_LANGUAGES CXX
        INTERFACE_COMPILE_FEATURES cxx_std_23
        INTERFACE_INCLUDE_DIRECTORIES "${ostrand_prefix}/include")
endif()
