#!/usr/bin/env bash
# Installs what is needed, builds the library and its tools, and runs the
# main job: a demonstration of the library on embedded sample data.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
cmake --preset default -DNXBASE_BUILD_TESTS=OFF -DNXBASE_BUILD_BENCH=OFF -DNXBASE_BUILD_FUZZ=OFF
cmake --build --preset default -j "$(nproc)"
build/default/tools/nxdemo "$@"
# The ColorChecker chart with screen colours, and its picture: one swatch per
# sample in its screen colour with its id, Lab and reflectance curve.
build/default/tools/nxcolor --rgb --report build/default/colorchecker.svg
echo "Chart picture: build/default/colorchecker.svg (open it in a browser)"
