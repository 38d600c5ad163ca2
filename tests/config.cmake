# Tests: config.
