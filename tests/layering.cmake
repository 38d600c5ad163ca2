# Tests: the families' layering. For every family, each public header of a
# family that is neither below it nor itself must be out of its reach: the
# preprocessor, given exactly the family's include directories, cannot find it.

# The include directories a family's sources compile with: its own and, through
# its dependencies, those of every family below it.
function(nxbase_family_reach family out)
    get_property(dirs GLOBAL PROPERTY NXBASE_FAMILY_HEADERS_${family})
    get_target_property(extra nxbase_${family} INTERFACE_INCLUDE_DIRECTORIES)
    if(extra)
        list(APPEND dirs ${extra})
    endif()
    get_property(below GLOBAL PROPERTY NXBASE_FAMILY_DEPENDS_${family})
    foreach(lower ${below})
        nxbase_family_reach(${lower} lower_dirs)
        list(APPEND dirs ${lower_dirs})
    endforeach()
    list(REMOVE_DUPLICATES dirs)
    set(${out} ${dirs} PARENT_SCOPE)
endfunction()

get_property(families GLOBAL PROPERTY NXBASE_FAMILIES)
set(table "")
foreach(family ${families})
    nxbase_family_reach(${family} dirs)
    set(reachable "")
    foreach(dir ${dirs})
        file(GLOB headers RELATIVE ${dir}/nxbase ${dir}/nxbase/*.h)
        list(APPEND reachable ${headers})
    endforeach()
    file(GLOB all RELATIVE ${PROJECT_SOURCE_DIR}/include/nxbase ${PROJECT_SOURCE_DIR}/include/nxbase/*.h)
    set(forbidden ${all})
    if(reachable)
        list(REMOVE_ITEM forbidden ${reachable})
    endif()
    list(JOIN dirs "," dir_text)
    list(JOIN forbidden "," forbidden_text)
    string(APPEND table "${family};${dir_text};${forbidden_text}\n")
endforeach()
file(WRITE ${PROJECT_BINARY_DIR}/family-reach.txt "${table}")

add_test(NAME Layering.AFamilyCannotIncludeTheHeadersAboveIt
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/layering/check_layers.sh
                 ${CMAKE_CXX_COMPILER} ${PROJECT_BINARY_DIR}/family-reach.txt)
set_tests_properties(Layering.AFamilyCannotIncludeTheHeadersAboveIt PROPERTIES LABELS layering)
