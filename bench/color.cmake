# Benchmarks: color.
