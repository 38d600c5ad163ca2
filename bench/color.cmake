# Benchmarks: color. The baselines are compiled for this machine with the
# flags a performance-minded author would use for a plain loop.
add_library(nxbench_color_baseline STATIC color_baseline.cpp)
set_target_properties(nxbench_color_baseline PROPERTIES POSITION_INDEPENDENT_CODE ON)
target_compile_options(nxbench_color_baseline PRIVATE -O3 -march=native -ffast-math -fopenmp-simd)
target_link_libraries(nxbench_color_baseline PUBLIC mvec m)

nxbase_add_bench(color_bench color_bench.cpp)
target_link_libraries(color_bench PRIVATE nxbench_color_baseline)

# The same read baseline for bench/python_bench.py, as a module of its own.
if(TARGET nxbase_python)
    find_package(Python COMPONENTS Interpreter Development.Module REQUIRED)
    find_package(pybind11 CONFIG REQUIRED)
    pybind11_add_module(nxbench_readonce python_readonce.cpp)
    target_link_libraries(nxbench_readonce PRIVATE nxbench_color_baseline)
    set_target_properties(nxbench_readonce PROPERTIES
        LIBRARY_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/python)
endif()
