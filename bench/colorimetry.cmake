# Benchmarks: colorimetry (weight lookup and tristimulus sums).
nxbase_add_bench(colorimetry_bench colorimetry_bench.cpp)
