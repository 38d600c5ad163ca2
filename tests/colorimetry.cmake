# Tests: colorimetry.
