# Benchmarks: progress.
