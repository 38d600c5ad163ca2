# Tests: colorimetry (the CIE data provider, spectra, filters, measuring
# conditions, the colorimetry facade).
nxbase_add_test(cmetry_provider_test cmetry_provider_test.cpp LABELS colorimetry)
nxbase_add_test(spectrum_test spectrum_test.cpp LABELS colorimetry)
nxbase_add_test(colorimetry_test colorimetry_test.cpp LABELS colorimetry)
nxbase_add_test(spectrafile_test spectrafile_test.cpp LABELS colorimetry)
nxbase_add_test(encryptedspectrum_test encryptedspectrum_test.cpp LABELS colorimetry)
