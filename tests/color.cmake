# Tests: color.
