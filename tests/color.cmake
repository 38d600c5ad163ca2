# Tests: color.
nxbase_add_test(linalg_test linalg_test.cpp)
nxbase_add_test(colorvector_test colorvector_test.cpp)
nxbase_add_test(colorbatch_test colorbatch_test.cpp)
if(TARGET nxcolor)
    nxbase_add_test(nxcolor_test nxcolor_test.cpp LIBS nxcolor_core)
    target_compile_definitions(nxcolor_test PRIVATE NXCOLOR_PATH="$<TARGET_FILE:nxcolor>")
    add_dependencies(nxcolor_test nxcolor)
endif()
