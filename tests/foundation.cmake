# Tests: foundation.
