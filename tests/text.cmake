# Tests: text.
