# Fuzz targets: text.
