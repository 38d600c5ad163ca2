# Benchmarks: memblock.
