# Benchmarks: text files.
nxbase_add_bench(text_bench text_bench.cpp)
