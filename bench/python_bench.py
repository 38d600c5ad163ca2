#!/usr/bin/env python3
"""spectra_to_Lab of one million spectra: the NxBase module against NumPy's own
fastest way of doing the same job in the same process (the weights as a
(36, 3) float32 matrix, one matrix product, the CIELAB formula in NumPy).
Both work on the same float32 array (144 MB, larger than any cache); the
module splits the work over the cores as it does for large arrays, NumPy's
matrix product uses its BLAS threads. Prints min/median/max of each and the
ratio of the medians.

    PYTHONPATH=build/default/python python3 bench/python_bench.py [RUNS]
"""
import statistics
import sys
import time

import numpy as np

import nxbase

COUNT = 1_000_000
RUNS = int(sys.argv[1]) if len(sys.argv) > 1 else 7


def numpy_lab(spectra, weights, white):
    xyz = spectra @ weights
    t = xyz / white
    f = np.where(t > np.float32(0.008856), np.cbrt(t), np.float32(7.787) * t + np.float32(16 / 116))
    lab = np.empty_like(xyz)
    lab[:, 0] = 116 * f[:, 1] - 16
    lab[:, 1] = 500 * (f[:, 0] - f[:, 1])
    lab[:, 2] = 200 * (f[:, 1] - f[:, 2])
    return lab


def timed(function, *args):
    start = time.perf_counter()
    result = function(*args)
    return time.perf_counter() - start, result


def main():
    rng = np.random.default_rng(7)
    steps = rng.uniform(-0.05, 0.05, size=(COUNT, 36)).astype(np.float32)
    spectra = np.clip(rng.uniform(0, 1, size=(COUNT, 1)).astype(np.float32) + np.cumsum(steps, axis=1), 0, 1)
    spectra = np.ascontiguousarray(spectra, dtype=np.float32)
    # The same weights as the module's: XYZ of the 36 unit spectra.
    weights = nxbase.spectra_to_XYZ(np.eye(36, dtype=np.float32))
    white = nxbase.spectra_to_XYZ(np.ones(36, dtype=np.float32))
    # One untimed run of each first: page faults of fresh result arrays and
    # thread start-up are not what is compared.
    nxbase.spectra_to_Lab(spectra)
    numpy_lab(spectra, weights, white)
    ours, theirs = [], []
    for _ in range(RUNS):
        seconds, lab = timed(nxbase.spectra_to_Lab, spectra)
        ours.append(seconds)
        seconds, reference = timed(numpy_lab, spectra, weights, white)
        theirs.append(seconds)
    worst = float(np.max(np.abs(lab - reference)))
    for name, times in (("nxbase.spectra_to_Lab", ours), ("NumPy matmul + Lab", theirs)):
        rates = [COUNT / t / 1e6 for t in times]
        print(f"{name:24s} M spectra/s  min {min(rates):7.1f}  median {statistics.median(rates):7.1f}  "
              f"max {max(rates):7.1f}")
    ratios = sorted(t / o for t, o in zip(theirs, ours))
    print(f"speed-up over NumPy (per run): min {ratios[0]:.2f}  median {statistics.median(ratios):.2f}  "
          f"max {ratios[-1]:.2f}; largest Lab difference {worst:.2e}")


if __name__ == "__main__":
    main()
