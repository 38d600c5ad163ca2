# Benchmarks: the message transport.
nxbase_add_bench(messaging_bench messaging_bench.cpp)
