#!/usr/bin/env bash
# Installs the Debian 12 packages NxBase builds and tests with; skips the
# installation when every package is present already.
set -euo pipefail

packages=(
    build-essential cmake ninja-build pkg-config git python3 file dpkg-dev
    libboost-dev libboost-regex-dev
    libsimpleini-dev libsqlite3-dev sqlite3 liblcms2-dev libpng-dev libssl-dev
    libsdbus-c++-dev dbus-daemon dbus-bin procps
    libgtest-dev libgmock-dev libbenchmark-dev help2man doxygen clang-format
    python3-dev pybind11-dev python3-numpy python3-pytest
    # pip install . into a virtual environment, offline
    python3-venv python3-setuptools python3-wheel
    # the Dask example and its test
    python3-dask python3-distributed
    argyll
    # the German locale the file readers and writers are tested under
    locales
    # GUI loop adapters, the Qt user interface and the GUI examples (Xvfb for the screenshot)
    qt6-base-dev libglib2.0-dev xvfb
    # NumPy's vectorised BLAS, so that bench/python_bench.py compares with a fair peer
    libopenblas0-pthread
    # Debian's package checker, run on the built packages
    lintian
)

missing=()
for p in "${packages[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -eq 0 ]; then sudo=""; else sudo="sudo"; fi
echo "Installing: ${missing[*]}"
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
