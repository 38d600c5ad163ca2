# Benchmarks: config.
nxbase_add_bench(config_bench config_bench.cpp)
