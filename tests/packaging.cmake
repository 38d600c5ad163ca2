# Tests: packaging.
