# Benchmarks: asciifile.
