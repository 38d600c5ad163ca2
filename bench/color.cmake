# Benchmarks: color. The vectorised baseline is compiled for this machine
# with the flags a performance-minded author would use for a plain loop.
nxbase_add_bench(color_bench color_bench.cpp color_baseline.cpp)
set_source_files_properties(color_baseline.cpp PROPERTIES
    COMPILE_OPTIONS "-O3;-march=native;-ffast-math;-fopenmp-simd")
target_link_libraries(color_bench PRIVATE mvec m)
