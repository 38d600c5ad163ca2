#!/usr/bin/env bash
# Runs the examples as a user would and checks what they print.
set -euo pipefail
build="$1"
source="$2"
work=$(mktemp -d "$build/examples-test.XXXXXX")
trap 'rm -rf "$work"' EXIT
fail() { echo "examples: $*"; exit 1; }

# Batch Lab: a file against itself differs by nothing; the built-in sample
# of slightly warmer greys differs most in the lightest grey.
chart="$source/tools/nxcolor/data/colorchecker_babelcolor_average.csv"
out=$("$build/examples/batch-lab" "$chart" "$chart")
grep -q "largest dE00 0.00" <<< "$out" || fail "a chart against itself: $out"
[ "$(grep -c "^" <<< "$out")" -eq 26 ] || fail "not 24 patches: $out"
out=$("$build/examples/batch-lab")
grep -q "largest dE00 0.45 (grey 8)" <<< "$out" || fail "built-in greys: $out"

# INI and log: the second run reads what the first wrote.
"$build/examples/ini-log" "$work" > /dev/null
out=$("$build/examples/ini-log" "$work")
grep -q "Runs = 2" <<< "$out" || fail "settings not kept: $out"
grep -q "white tile read, run 2" <<< "$out" || fail "log line missing: $out"
grep -q "not written" <<< "$out" && fail "a line under a key that is off was written"

# Measuring through LumaServer, registered in a private hive and started on demand.
export NXBASE_MACHINE_REGISTRY="$work/machine.sqlite" NXBASE_USER_REGISTRY="$work/user.sqlite"
export NXBASE_RUNTIME_DIR="$work/run" NXBASE_LOG_PATH="$work"
"$build/tools/lumaserver" --register > /dev/null
out=$("$build/examples/measure" 4)
[ "$(grep -c " L\* " <<< "$out")" -eq 4 ] || fail "not 4 measurements: $out"
grep -q "100 %" <<< "$out" || fail "no progress to 100 %: $out"
for _ in $(seq 50); do
    [ -S "$NXBASE_RUNTIME_DIR/PipeRequest-LumaServer" ] || break
    sleep 0.1
done
[ ! -S "$NXBASE_RUNTIME_DIR/PipeRequest-LumaServer" ] || fail "lumaserver did not end after the example left"

# The same with the GLib loop and the asynchronous send, when it was built.
if [ -x "$build/examples/glib-measure" ]; then
    out=$("$build/examples/glib-measure" 3)
    [ "$(grep -c " L\* " <<< "$out")" -eq 3 ] || fail "glib-measure: not 3 measurements: $out"
    grep -q "^1 dark skin  L\*  38.42  a\*   13.69  b\*   14.42" <<< "$out" || fail "glib-measure: dark skin: $out"
    grep -q "^3 notices" <<< "$out" || fail "glib-measure: notices missing: $out"
fi
echo "the examples work"
