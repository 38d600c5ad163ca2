#!/usr/bin/env bash
# Builds the Debian packages in build/deb (a Release build for /usr) and puts
# them in build/deb/packages. With "test": checks their dependencies,
# installs them, builds the example consumer against /usr with find_package
# and with pkg-config, runs the installed tools and imports the module with
# Debian's python3, then removes the packages again. Needs root or sudo for
# the test; leaves alone a machine that has NxBase packages installed already.
set -euo pipefail
cd "$(dirname "$0")/.."
root=$PWD
build=$root/build/deb
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release -DCMAKE_INSTALL_PREFIX=/usr \
      -DNXBASE_BUILD_TESTS=OFF -DNXBASE_BUILD_BENCH=OFF -DNXBASE_BUILD_FUZZ=OFF \
      -DNXBASE_BUILD_TOOLS=ON -DNXBASE_BUILD_PYTHON=ON \
      -DNXBASE_PYTHON_SITEARCH=lib/python3/dist-packages -DCMAKE_INTERPROCEDURAL_OPTIMIZATION=OFF \
      > "$build.configure.log" 2>&1 ||
    { cat "$build.configure.log"; exit 1; }
cmake --build "$build" -j "$(nproc)"
cmake --build "$build" --target docs  # the API reference goes into libnxbase-dev
rm -rf "$build/packages"
(cd "$build" && cpack -G DEB > "$build/cpack.log" 2>&1) || { cat "$build/cpack.log"; exit 1; }
packages=(libnxbase0 libnxbase-dev nxbase-tools python3-nxbase
          libnxbase-glib0 libnxbase-glib-dev libnxbase-qt0 libnxbase-qt-dev)
for p in "${packages[@]}"; do
    ls "$build/packages/${p}_"*.deb > /dev/null
done
ls -l "$build/packages/"*.deb
[ "${1:-}" = test ] || exit 0

fail() { echo "packages: $*"; exit 1; }
deb() { ls "$build/packages/${1}_"*.deb; }

# Debian's checker: no error, and no warning but those packaging/README.md
# explains (listed in packaging/lintian-expected).
lintian_out=$(lintian --tag-display-limit 0 "$build/packages/"*.deb 2>&1 | grep -E '^[EW]: ' || true)
echo "$lintian_out"
grep -q '^E: ' <<< "$lintian_out" && fail "lintian reports errors"
unexplained=$(sed -E 's/^W: [^:]+: ([^ ]+).*/\1/' <<< "$lintian_out" | sort -u |
              grep -vxF -f <(grep -v '^#' "$root/packaging/lintian-expected") || true)
[ -z "$unexplained" ] || fail "lintian warnings not explained in packaging/README.md: $unexplained"

# What the runtime packages ask for: Debian 12's library packages, never a
# -dev package; the ABI version in the library package's name and shlibs.
for p in libnxbase0 nxbase-tools python3-nxbase libnxbase-glib0 libnxbase-qt0; do
    depends=$(dpkg-deb -f "$(deb "$p")" Depends)
    echo "$p depends on: $depends"
    case "$depends" in *-dev*) fail "$p depends on a -dev package" ;; esac
done
lib_depends=$(dpkg-deb -f "$(deb libnxbase0)" Depends)
case "$lib_depends" in *libqt6* | *libglib*) fail "the GUI leaks into libnxbase0: $lib_depends" ;; esac
for needed in libsqlite3-0 liblcms2-2 libssl3 libpng16-16 libboost-regex1.74.0 libsdbus-c++1 libstdc++6; do
    case "$lib_depends" in *"$needed"*) ;; *) fail "libnxbase0 does not depend on $needed" ;; esac
done
# (Listings are read whole first: grep -q ending a pipe early would fail it.)
shlibs=$(dpkg-deb -I "$(deb libnxbase0)" shlibs)
grep -q "^libnxbase 0 libnxbase0" <<< "$shlibs" || fail "no shlibs entry for libnxbase.so.0: $shlibs"
contents=$(dpkg-deb -c "$(deb libnxbase0)")
grep -q "libnxbase.so.0 -> " <<< "$contents" || fail "no libnxbase.so.0 in libnxbase0"
contents=$(dpkg-deb -c "$(deb libnxbase-dev)")
grep -q "usr/share/doc/libnxbase-dev/html/index.html" <<< "$contents" || fail "no API reference in libnxbase-dev"
grep -q "usr/share/doc/libnxbase-dev/examples/batch-lab/main.cpp" <<< "$contents" || fail "no examples in libnxbase-dev"
for page in first-hour messaging asciifile textfile logfile memblock_format registry configuration finegrid; do
    grep -q "usr/share/doc/libnxbase-dev/$page.md" <<< "$contents" || fail "no $page.md in libnxbase-dev"
done
for p in "${packages[@]}"; do
    contents=$(dpkg-deb -c "$(deb "$p")")
    grep -q "usr/share/doc/$p/copyright" <<< "$contents" || fail "$p has no copyright file"
    grep -q "usr/share/doc/$p/changelog.Debian.gz" <<< "$contents" || fail "$p has no changelog"
done

for p in "${packages[@]}"; do
    if dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
        echo "packages: $p is installed on this machine already; the install test leaves it alone"
        exit 0
    fi
done
if [ "$(id -u)" -eq 0 ]; then sudo=""; else sudo="sudo"; fi
work=$(mktemp -d "$root/build/packages-test.XXXXXX")
cleanup() {
    $sudo dpkg --purge "${packages[@]}" > /dev/null 2>&1 || true
    rm -rf "$work"
}
trap cleanup EXIT
debs=()
for p in "${packages[@]}"; do debs+=("$(deb "$p")"); done
$sudo dpkg -i "${debs[@]}" > "$work/dpkg.log" ||
    { cat "$work/dpkg.log"; fail "dpkg -i failed"; }

# The consumer against /usr: CMake's package and pkg-config, nothing given.
export NXBASE_LOG_PATH="$work"
started=$SECONDS
cmake -S "$root/examples/consumer" -B "$work/consumer" -G Ninja > "$work/configure.log" || { cat "$work/configure.log"; exit 1; }
cmake --build "$work/consumer" > "$work/build.log" || { cat "$work/build.log"; exit 1; }
echo "consumer configured and built against /usr in $((SECONDS - started)) s"
"$work/consumer/consumer"
c++ -std=c++17 "$root/examples/consumer/main.cpp" $(pkg-config --cflags --libs nxbase) -o "$work/consumer-pc"
[ "$(pkg-config --variable=includedir nxbase)" = /usr/include ] ||
    fail "nxbase.pc names $(pkg-config --variable=includedir nxbase), not /usr/include"
"$work/consumer-pc"

# The GUI examples against the adapters' packages (CMake components), and
# the adapters through pkg-config; glib-measure measures through the
# installed lumaserver, qt-measure runs offscreen and saves its window.
for example in glib-measure qt-measure; do
    cmake -S "/usr/share/doc/libnxbase-dev/examples/$example" -B "$work/$example" -G Ninja > "$work/$example.log" 2>&1 &&
        cmake --build "$work/$example" >> "$work/$example.log" 2>&1 || { cat "$work/$example.log"; fail "the installed $example example"; }
done
pkg-config --exists nxbase-glib nxbase-qt || fail "no pkg-config files for the adapters"
(
    export NXBASE_MACHINE_REGISTRY="$work/gm.sqlite" NXBASE_USER_REGISTRY="$work/gu.sqlite"
    export NXBASE_RUNTIME_DIR="$work/run" XDG_RUNTIME_DIR="$work" QT_QPA_PLATFORM=offscreen
    lumaserver --register > /dev/null
    "$work/glib-measure/glib-measure" 2 | grep -q "^2 light skin" || fail "the installed glib-measure"
    "$work/qt-measure/qt-measure" --measure --screenshot "$work/qt-measure.png" 2> /dev/null || fail "the installed qt-measure"
    test -s "$work/qt-measure.png" || fail "qt-measure saved no window"
    for _ in $(seq 50); do [ -S "$NXBASE_RUNTIME_DIR/PipeRequest-LumaServer" ] || break; sleep 0.1; done
)
echo "glib-measure and qt-measure built against the adapters' packages and ran"

# The tools from /usr/bin, with their manual pages.
nxcolor --list-illuminants | grep -q D65 || fail "nxcolor"
NXBASE_MACHINE_REGISTRY="$work/m.sqlite" NXBASE_USER_REGISTRY="$work/u.sqlite" nxreg files > /dev/null || fail "nxreg"
lumaserver --version > /dev/null || fail "lumaserver"
nxmsg --help > /dev/null || fail "nxmsg"
for tool in nxcolor nxreg nxmsg lumaserver; do
    test -s "/usr/share/man/man1/$tool.1.gz" || fail "no manual page for $tool"
done
# The module from Debian's python3, without any path given.
(cd "$work" && env -u PYTHONPATH /usr/bin/python3 -c \
    "import nxbase; assert nxbase.spectra_to_Lab([0.5] * 36).shape == (3,); print('python3-nxbase', nxbase.__version__)")

cleanup
trap - EXIT
for p in "${packages[@]}"; do
    if dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then fail "$p is still installed"; fi
done
test ! -e /usr/include/nxbase || fail "/usr/include/nxbase is left behind"
echo "packages build, install, serve the consumer, the tools and python3, and uninstall"
