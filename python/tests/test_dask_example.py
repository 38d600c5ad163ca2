"""The module across processes: its functions pickle by name, and the Dask
example converts cubes on a cluster of worker processes to the same Lab
values as one process (run where Debian's python3-dask and
python3-distributed are installed; scripts/deps.sh installs them)."""
import multiprocessing
import os
import pickle
import struct
import subprocess
import sys

import numpy as np
import pytest

import nxbase

EXAMPLE = os.path.join(os.path.dirname(__file__), "..", "..", "examples", "python", "dask_cube.py")


def test_the_functions_pickle_by_name_and_run_in_spawned_workers():
    for name in ("spectra_to_Lab", "spectra_to_XYZ", "Lab_to_sRGB", "delta_E", "read_spectra"):
        function = getattr(nxbase, name)
        assert pickle.loads(pickle.dumps(function)) is function
    assert pickle.loads(pickle.dumps(len)) is len  # other built-ins as before
    spectra = np.random.default_rng(5).uniform(0, 1, (4, 100, 36)).astype(np.float32)
    with multiprocessing.get_context("spawn").Pool(2) as pool:
        labs = pool.map(nxbase.spectra_to_Lab, list(spectra))
    np.testing.assert_array_equal(np.stack(labs), nxbase.spectra_to_Lab(spectra))


def png_size(path):
    with open(path, "rb") as picture:
        head = picture.read(24)
    assert head[:8] == b"\x89PNG\r\n\x1a\n" and head[12:16] == b"IHDR"
    return struct.unpack(">II", head[16:24])


@pytest.mark.parametrize("source", ["made 10 nm", "made 1 nm", "npy 10 nm"])
def test_the_dask_example_matches_one_process(source, tmp_path):
    pytest.importorskip("dask.array")
    pytest.importorskip("distributed")
    picture = tmp_path / "cube.png"
    command = [sys.executable, EXAMPLE, "--rows", "40", "--columns", "24", "--chunk-rows", "16",
               "--png", str(picture), "--check"]
    if source == "made 1 nm":
        command += ["--step", "1"]
    if source.startswith("npy"):
        sys.path.insert(0, os.path.dirname(EXAMPLE))
        import dask_cube
        np.save(tmp_path / "cube.npy", dask_cube.make_cube(40, 24, 10, seed=3))
        command += ["--npy", str(tmp_path / "cube.npy")]
    # The workers import the module this test imported.
    env = dict(os.environ, PYTHONPATH=os.path.dirname(os.path.abspath(nxbase.__file__)))
    run = subprocess.run(command, capture_output=True, text=True, cwd=tmp_path, env=env, timeout=300)
    assert run.returncode == 0, run.stdout + run.stderr
    assert "identical to the conversion in one process" in run.stdout
    assert png_size(picture) == (24, 40)
