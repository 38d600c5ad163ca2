# Benchmarks: foundation.
