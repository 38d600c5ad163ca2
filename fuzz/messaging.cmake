# Fuzz targets: the transport's frame reader and the data-block decoding.
nxbase_add_fuzzer(pipe_frame_fuzz pipe_frame_fuzz.cpp)
nxbase_add_fuzzer(msgcat_decode_fuzz msgcat_decode_fuzz.cpp)
nxbase_add_fuzzer(postoffice_events_fuzz postoffice_events_fuzz.cpp)
nxbase_add_fuzzer(dde_poke_fuzz dde_poke_fuzz.cpp)
