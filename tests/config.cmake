# Tests: config.
nxbase_add_test(config_test config_test.cpp LABELS config)
