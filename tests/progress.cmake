# Tests: progress.
