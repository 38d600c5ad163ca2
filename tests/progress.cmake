# Tests: progress, and the screen-colour families (toolkit bitmap, colour converter).
nxbase_add_test(progress_test progress_test.cpp)
nxbase_add_test(bitmap_test bitmap_test.cpp)
nxbase_add_test(iccprofile_test iccprofile_test.cpp LIBS PkgConfig::LCMS2)
nxbase_add_test(colorconverter_test colorconverter_test.cpp LIBS PkgConfig::LCMS2)
