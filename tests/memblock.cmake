# Tests: memblock.
