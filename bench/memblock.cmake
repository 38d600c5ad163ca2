# Benchmarks: memory block streaming against memcpy.
nxbase_add_bench(memblock_bench memblock_bench.cpp)
