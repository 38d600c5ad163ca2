# Benchmarks: the message transport, also with the loop inside GLib and Qt
# when their adapters are built.
nxbase_add_bench(messaging_bench messaging_bench.cpp)
if(TARGET nxbase-glib AND TARGET nxbase-qt)
    target_link_libraries(messaging_bench PRIVATE nxbase-glib nxbase-qt)
    target_compile_definitions(messaging_bench PRIVATE NXBASE_BENCH_GUI_LOOPS)
endif()
