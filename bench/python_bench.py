#!/usr/bin/env python3
"""spectra_to_Lab of one million float32 spectra (144 MB, larger than any
cache): the NxBase module against NumPy doing the same job (the weights as a
(36, 3) matrix, one matrix product, the CIELAB formula in NumPy), thread for
thread, NumPy's BLAS held to one thread per calling thread. NumPy runs in two
forms: on the whole array in one go, and in slices of 32 768 spectra whose
temporaries stay in the cache (its fastest form here, several times faster).

- one thread each: the process pinned to CPU 0, the module with threads=1;
- two threads each: the process on CPUs 0 and 1, the module with threads=2,
  NumPy (sliced) on two Python threads that each take half of the array
  (NumPy releases the GIL in the product and the ufuncs); and the module's
  two threads against its one in the same rounds, the one thread pinned to
  CPU 0 as in the one-thread case and free on both CPUs (where it runs on
  the faster one: the CPUs of a virtual machine need not be equally fast).

With the bench module nxbench_readonce (built beside the module with the
benchmarks), one read of the same array with the batch kernel's prefetch runs
in the same rounds, on one thread and on two: the memory-bandwidth bound. Its
ratios say how far the module is from it, and what any converter could reach
against NumPy and from a second thread on this machine.

Each round runs the contenders back to back, the side that goes first
alternating, each for about a quarter of a second (repeated calls, as a
single call of a few milliseconds is at the mercy of the scheduler); prints
min / median / max over the rounds of each rate and of the per-round ratios.

    PYTHONPATH=build/default/python /usr/bin/python3 bench/python_bench.py [ROUNDS]
"""
import os

# BLAS libraries read these when they load, so before NumPy is imported.
for _variable in ("OPENBLAS_NUM_THREADS", "OMP_NUM_THREADS", "MKL_NUM_THREADS", "BLIS_NUM_THREADS"):
    os.environ[_variable] = "1"

import statistics  # noqa: E402
import sys  # noqa: E402
import time  # noqa: E402
from concurrent.futures import ThreadPoolExecutor  # noqa: E402

import numpy as np  # noqa: E402

import nxbase  # noqa: E402

try:
    import nxbench_readonce  # noqa: E402
except ImportError:
    nxbench_readonce = None

COUNT = 1_000_000
ROUNDS = max(7, int(sys.argv[1]) if len(sys.argv) > 1 else 7)


def numpy_lab(spectra, weights, white):
    xyz = spectra @ weights
    t = xyz / white
    f = np.where(t > np.float32(0.008856), np.cbrt(t), np.float32(7.787) * t + np.float32(16 / 116))
    lab = np.empty_like(xyz)
    lab[:, 0] = 116 * f[:, 1] - 16
    lab[:, 1] = 500 * (f[:, 0] - f[:, 1])
    lab[:, 2] = 200 * (f[:, 1] - f[:, 2])
    return lab


SLICE = 32768


def numpy_lab_sliced(spectra, weights, white, out):
    for first in range(0, len(spectra), SLICE):
        out[first:first + SLICE] = numpy_lab(spectra[first:first + SLICE], weights, white)
    return out


def numpy_lab_on_two_threads(pool, spectra, weights, white, out):
    half = len(spectra) // 2
    halves = ((spectra[:half], out[:half]), (spectra[half:], out[half:]))
    list(pool.map(lambda part: numpy_lab_sliced(part[0], weights, white, part[1]), halves))
    return out


SAMPLE_SECONDS = 0.25


def on_cpu0(function):
    """Runs function with the calling thread on CPU 0, then back on 0 and 1."""
    os.sched_setaffinity(0, {0})
    try:
        return function()
    finally:
        os.sched_setaffinity(0, {0, 1})


def seconds(function, repeats):
    """Seconds per call over `repeats` calls."""
    start = time.perf_counter()
    for _ in range(repeats):
        function()
    return (time.perf_counter() - start) / repeats


def repeats_for(function):
    """Calls that take about SAMPLE_SECONDS (one untimed call first: page
    faults of fresh arrays and thread start-up are not what is compared)."""
    function()
    return max(1, round(SAMPLE_SECONDS / seconds(function, 3)))


def spread(values):
    return f"{min(values):6.2f} / {statistics.median(values):6.2f} / {max(values):6.2f}"


def run_rounds(contenders):
    """Times each contender once per round, the starting one rotating."""
    times = {name: [] for name, _ in contenders}
    repeats = {name: repeats_for(function) for name, function in contenders}
    for round_number in range(ROUNDS):
        shift = round_number % len(contenders)
        for name, function in contenders[shift:] + contenders[:shift]:
            times[name].append(seconds(function, repeats[name]))
    return times


def speedups(times, contender, baseline):
    """Per round: how many times faster the contender ran than the baseline."""
    return [b / c for c, b in zip(times[contender], times[baseline])]


def report(title, times, ratios):
    print(title)
    for name, values in times.items():
        print(f"  {name:40s} M spectra/s  min / median / max {spread([COUNT / t / 1e6 for t in values])}")
    for label, (contender, baseline) in ratios.items():
        print(f"  {label:40s} ratio       min / median / max {spread(speedups(times, contender, baseline))}")


def main():
    rng = np.random.default_rng(7)
    steps = rng.uniform(-0.05, 0.05, size=(COUNT, 36)).astype(np.float32)
    spectra = np.clip(rng.uniform(0, 1, size=(COUNT, 1)).astype(np.float32) + np.cumsum(steps, axis=1), 0, 1)
    spectra = np.ascontiguousarray(spectra, dtype=np.float32)
    # The same weights as the module's: XYZ of the 36 unit spectra.
    weights = nxbase.spectra_to_XYZ(np.eye(36, dtype=np.float32))
    white = nxbase.spectra_to_XYZ(np.ones(36, dtype=np.float32))
    worst = float(np.max(np.abs(nxbase.spectra_to_Lab(spectra) - numpy_lab(spectra, weights, white))))
    print(f"{COUNT} float32 spectra, {ROUNDS} rounds; largest Lab difference between the two {worst:.2e}; "
          f"NumPy {np.__version__}, BLAS held to one thread per calling thread")

    out = np.empty((COUNT, 3), dtype=np.float32)
    sliced = numpy_lab_sliced(spectra, weights, white, out)
    assert np.array_equal(sliced, numpy_lab(spectra, weights, white))

    os.sched_setaffinity(0, {0})
    contenders = [
        ("nxbase threads=1", lambda: nxbase.spectra_to_Lab(spectra, threads=1)),
        ("NumPy whole array", lambda: numpy_lab(spectra, weights, white)),
        ("NumPy sliced", lambda: numpy_lab_sliced(spectra, weights, white, out)),
    ]
    ratios = {"nxbase over NumPy whole array": ("nxbase threads=1", "NumPy whole array"),
              "nxbase over NumPy sliced": ("nxbase threads=1", "NumPy sliced")}
    if nxbench_readonce:
        contenders.append(("read once", lambda: nxbench_readonce.read_once(spectra, 1)))
        ratios["nxbase over read once"] = ("nxbase threads=1", "read once")
        ratios["read once over NumPy sliced"] = ("read once", "NumPy sliced")
    report("One thread each, pinned to CPU 0:", run_rounds(contenders), ratios)

    if len(os.sched_getaffinity(0) | set(range(os.cpu_count() or 1))) < 2:
        print("Two threads each: skipped, one CPU")
        return
    os.sched_setaffinity(0, {0, 1})
    with ThreadPoolExecutor(2) as pool:
        contenders = [
            ("nxbase threads=2", lambda: nxbase.spectra_to_Lab(spectra, threads=2)),
            ("NumPy sliced, two threads", lambda: numpy_lab_on_two_threads(pool, spectra, weights, white, out)),
            ("nxbase threads=1 on CPU 0", lambda: on_cpu0(lambda: nxbase.spectra_to_Lab(spectra, threads=1))),
            ("nxbase threads=1 free", lambda: nxbase.spectra_to_Lab(spectra, threads=1)),
        ]
        ratios = {"nxbase over NumPy sliced": ("nxbase threads=2", "NumPy sliced, two threads"),
                  "nxbase two threads over one on CPU 0": ("nxbase threads=2", "nxbase threads=1 on CPU 0"),
                  "nxbase two threads over one free": ("nxbase threads=2", "nxbase threads=1 free")}
        if nxbench_readonce:
            contenders += [
                ("read once, two threads", lambda: nxbench_readonce.read_once(spectra, 2)),
                ("read once on CPU 0", lambda: on_cpu0(lambda: nxbench_readonce.read_once(spectra, 1))),
            ]
            ratios["nxbase over read once"] = ("nxbase threads=2", "read once, two threads")
            ratios["read once two threads over one on CPU 0"] = ("read once, two threads", "read once on CPU 0")
        two = run_rounds(contenders)
        report("Two threads each, on CPUs 0 and 1:", two, ratios)
    # Reading alone gains about twice from a second CPU here; far less means
    # the second CPU or the memory was busy with something else meanwhile.
    if nxbench_readonce and statistics.median(speedups(two, "read once, two threads", "read once on CPU 0")) < 1.5:
        print("WARNING: a second thread sped up reading alone by less than 1.5x in this run: the second CPU "
              "or the memory was busy; the two-thread ratios understate the machine")


if __name__ == "__main__":
    main()
