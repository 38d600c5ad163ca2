# Benchmarks: color.
nxbase_add_bench(color_bench color_bench.cpp)
