#!/usr/bin/env bash
# Installs what is needed, builds with the given preset (default: "default")
# and runs every test; with the default preset also the Debian packages' test
# and pip install . into a virtual environment.
set -euo pipefail
cd "$(dirname "$0")/.."
preset="${1:-default}"
scripts/deps.sh
# Tests and tools on explicitly: scripts/demo.sh configures the same build
# directory without them.
cmake --preset "$preset" -DNXBASE_BUILD_TESTS=ON -DNXBASE_BUILD_TOOLS=ON -DNXBASE_BUILD_FUZZ=ON -DNXBASE_BUILD_BENCH=ON -DNXBASE_BUILD_PYTHON=ON
cmake --build --preset "$preset" -j "$(nproc)"
ctest --preset "$preset"
# The Debian packages: built, installed, used and removed again.
# And the module installed with pip into a virtual environment.
if [ "$preset" = default ]; then scripts/packages.sh test && scripts/pip_test.sh; fi
