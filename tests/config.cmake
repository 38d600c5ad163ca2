# Tests: config.
nxbase_add_test(config_test config_test.cpp LABELS config)
nxbase_add_test(appconfig_test appconfig_test.cpp LABELS config)
