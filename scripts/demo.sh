#!/usr/bin/env bash
# Installs what is needed, builds the library and its tools, and runs the
# main job: the whole system end to end. The measuring-device server emulator
# lumaserver is registered in a private machine hive; nxcolor connects to
# "LumaServer" through the post office, which starts the server on demand,
# locks it, measures the 24 patches of the built-in ColorChecker through it,
# prints their colour values and draws the chart; the server ends by itself
# one second after nxcolor leaves.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
cmake --preset default -DNXBASE_BUILD_TESTS=OFF -DNXBASE_BUILD_BENCH=OFF -DNXBASE_BUILD_FUZZ=OFF
cmake --build --preset default -j "$(nproc)"

demo="$(mktemp -d "${TMPDIR:-/tmp}/nxbase-demo-XXXXXX")"
trap 'rm -rf "$demo"' EXIT
export NXBASE_MACHINE_REGISTRY="$demo/machine.sqlite"
export NXBASE_USER_REGISTRY="$demo/user.sqlite"
export NXBASE_RUNTIME_DIR="$demo/run"
export NXBASE_LOG_PATH="$demo"

build/default/tools/lumaserver --register
build/default/tools/nxcolor --measure 24 --rgb --report build/default/colorchecker.svg "$@"
echo "Chart picture: build/default/colorchecker.svg (open it in a browser)"

# The server was started on demand and ends one second after its last peer.
for _ in $(seq 50); do
    [ -S "$NXBASE_RUNTIME_DIR/PipeRequest-LumaServer" ] || break
    sleep 0.1
done
if [ -S "$NXBASE_RUNTIME_DIR/PipeRequest-LumaServer" ]; then
    echo "lumaserver is still running" >&2
    exit 1
fi
echo "lumaserver ended by itself after the last peer left"
