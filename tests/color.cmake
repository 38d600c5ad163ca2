# Tests: color.
nxbase_add_test(linalg_test linalg_test.cpp)
nxbase_add_test(colorvector_test colorvector_test.cpp)
nxbase_add_test(colorbatch_test colorbatch_test.cpp)
if(TARGET nxcolor)
    nxbase_add_test(nxcolor_test nxcolor_test.cpp LIBS nxcolor_core)
    target_compile_definitions(nxcolor_test PRIVATE NXCOLOR_PATH="$<TARGET_FILE:nxcolor>")
    add_dependencies(nxcolor_test nxcolor)
    target_link_libraries(nxcolor_test PRIVATE PkgConfig::LCMS2)
    # Every file reader and writer under a decimal-comma locale.
    nxbase_add_test(locale_test locale_test.cpp LIBS nxcolor_core)
endif()
nxbase_add_test(colordiff_test colordiff_test.cpp)
target_link_libraries(colordiff_test PRIVATE PkgConfig::LCMS2)
add_test(NAME KernelFiles.DefineOnlyTheirEntryPoints
    COMMAND sh ${CMAKE_CURRENT_SOURCE_DIR}/color/check_kernel_symbols.sh
            $<TARGET_OBJECTS:nxbase_color> $<TARGET_OBJECTS:nxbase_colorimetry>
    COMMAND_EXPAND_LISTS)
