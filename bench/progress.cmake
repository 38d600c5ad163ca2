# Benchmarks: progress and screen colours.
nxbase_add_bench(rgb_bench rgb_bench.cpp)
target_link_libraries(rgb_bench PRIVATE PkgConfig::LCMS2)
