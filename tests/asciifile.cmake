# Tests: asciifile.
