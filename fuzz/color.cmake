# Fuzz targets: color (the library's spectra reader, CSV and CGATS).
nxbase_add_fuzzer(nxcolor_spectra_fuzzer nxcolor_spectra_fuzzer.cpp)
