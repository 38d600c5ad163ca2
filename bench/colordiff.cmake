# Benchmarks: colour differences and resampling.
nxbase_add_bench(colordiff_bench colordiff_bench.cpp)
target_link_libraries(colordiff_bench PRIVATE PkgConfig::LCMS2)
