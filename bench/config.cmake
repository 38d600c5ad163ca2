# Benchmarks: config.
