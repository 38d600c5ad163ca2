# Fuzz targets: memblock.
