#!/usr/bin/env bash
# pip install . into a virtual environment made from Debian's python3,
# offline, against the installed build dependencies; then the module is used
# from that environment (and only from there).
set -euo pipefail
cd "$(dirname "$0")/.."
root=$PWD
work=$(mktemp -d "$root/build/pip-test.XXXXXX")
# setuptools builds in the source tree: its build and metadata directories go too.
trap 'rm -rf "$work" "$root/nxbase.egg-info" "$root"/build/{lib,temp,bdist}.linux-*' EXIT
started=$SECONDS
/usr/bin/python3 -m venv --system-site-packages "$work/env"
"$work/env/bin/pip" install --no-build-isolation --no-index "$root" > "$work/pip.log" 2>&1 ||
    { tail -40 "$work/pip.log"; echo "pip install failed"; exit 1; }
(cd "$work" && env -u PYTHONPATH "$work/env/bin/python" - << 'PY'
import pathlib, sys
import numpy, nxbase
assert pathlib.Path(nxbase.__file__).is_relative_to(sys.prefix), nxbase.__file__
lab = nxbase.spectra_to_Lab(numpy.full((4, 36), 0.5, dtype=numpy.float32))
assert lab.shape == (4, 3) and abs(lab[0, 0] - 76.07) < 0.01, lab
print("pip-installed nxbase", nxbase.__version__, "from", nxbase.__file__)
PY
)
echo "pip install . into a virtual environment works offline ($((SECONDS - started)) s)"
