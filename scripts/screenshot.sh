#!/usr/bin/env bash
# Makes doc/qt-measure.png: the qt-measure example under Xvfb, measuring the
# built-in chart through a LumaServer registered in a private hive, compared
# with a reference in which three patches are darker, patch 5's spectrum and
# its reference drawn. Needs a built tree
# (build/default) and Xvfb.
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build/default}
[ -x "$build/examples/qt-measure" ] || { echo "build $build/examples/qt-measure first"; exit 1; }
work=$(mktemp -d "$PWD/$build/screenshot.XXXXXX")
xvfb=""
cleanup() {
    [ -n "$xvfb" ] && kill "$xvfb" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT

export NXBASE_MACHINE_REGISTRY="$work/machine.sqlite" NXBASE_USER_REGISTRY="$work/user.sqlite"
export NXBASE_RUNTIME_DIR="$work/run" NXBASE_LOG_PATH="$work" XDG_RUNTIME_DIR="$work"
"$build/tools/lumaserver" --register > /dev/null
awk -F, 'BEGIN { OFS = "," } NR == 6 || NR == 12 || NR == 18 { for (i = 3; i <= NF; ++i) $i = $i * 0.8 } { print }' \
    tools/nxcolor/data/colorchecker_babelcolor_average.csv > "$work/reference.csv"

# Xvfb picks a free display and writes its number to the descriptor given.
exec {displayfd}<> <(:)
Xvfb -displayfd "$displayfd" -screen 0 800x900x24 -nolisten tcp > "$work/xvfb.log" 2>&1 &
xvfb=$!
read -r -t 10 -u "$displayfd" display || { cat "$work/xvfb.log"; exit 1; }
DISPLAY=":$display" QT_QPA_PLATFORM=xcb "$build/examples/qt-measure" \
    --reference "$work/reference.csv" --measure --select 5 --screenshot doc/qt-measure.png
echo "doc/qt-measure.png written"
