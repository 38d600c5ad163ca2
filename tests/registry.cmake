# Tests: registry.
