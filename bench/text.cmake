# Benchmarks: text.
