# Fuzz targets: config.
