"""XYZ_to_Lab of a million float64 XYZ triples against a NumPy copy of the
same array (one read, one write: the floor), in the same rounds, one thread
on CPU 0. Usage: python3 bench/xyz_to_lab_vs_copy.py [module directory]
(default build/default/python); prints min / median / max over 7 rounds."""
import os
import sys
import time

import numpy as np

sys.path.insert(0, sys.argv[1] if len(sys.argv) > 1 else "build/default/python")
import nxbase  # noqa: E402

os.sched_setaffinity(0, {0})
xyz = np.random.default_rng(3).random((1000000, 3)) * 100


def timed(f):
    start = time.perf_counter()
    f()
    return time.perf_counter() - start


ratios = sorted(timed(lambda: nxbase.XYZ_to_Lab(xyz)) / timed(xyz.copy) for _ in range(7))
print("XYZ_to_Lab over array copy  min/median/max %.2f / %.2f / %.2f" % (ratios[0], ratios[3], ratios[6]))
