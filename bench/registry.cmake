# Benchmarks: registry.
find_package(SQLite3 REQUIRED)
nxbase_add_bench(registry_bench registry_bench.cpp)
target_link_libraries(registry_bench PRIVATE SQLite::SQLite3)
