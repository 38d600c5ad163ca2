# Benchmarks: the message transport.
nxbase_add_bench(pipe_bench pipe_bench.cpp)
