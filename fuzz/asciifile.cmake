# Fuzz targets: asciifile.
