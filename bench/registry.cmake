# Benchmarks: registry.
