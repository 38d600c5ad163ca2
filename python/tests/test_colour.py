"""Colour functions: shapes, dtypes, exactness against the C++ paths, errors."""
import os
import subprocess
import sys
import tracemalloc
import warnings

import numpy as np
import pytest

import nxbase
from conftest import CHART, tool


@pytest.fixture(scope="module")
def chart():
    ids, names, spectra = nxbase.read_spectra(CHART)
    assert len(ids) == 24 and spectra.shape == (24, 36) and spectra.dtype == np.float32
    assert (ids[0], names[0]) == ("1", "dark skin")
    return spectra


def test_shapes_dtypes_and_layouts_give_the_same_numbers(chart):
    lab = nxbase.spectra_to_Lab(chart)
    assert lab.shape == (24, 3) and lab.dtype == np.float32
    assert nxbase.spectra_to_Lab(chart[5]).shape == (3,)
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(chart[5]), lab[5])
    cube = chart.reshape(2, 3, 4, 36)
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(cube).reshape(24, 3), lab)
    # Non-contiguous views and Fortran order are copied, not misread.
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(chart[::3]), lab[::3])
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(np.asfortranarray(chart)), lab)
    padded = np.zeros((24, 72), dtype=np.float32)
    padded[:, ::2] = chart
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(padded[:, ::2]), lab)
    # float64 is rounded to float32 first: the same numbers.
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(chart.astype(np.float64)), lab)
    assert nxbase.spectra_to_Lab(np.zeros((0, 36))).shape == (0, 3)
    for function in (nxbase.spectra_to_XYZ, nxbase.spectra_to_LCh, nxbase.spectra_to_DIN99,
                     nxbase.spectra_to_density):
        assert function(cube).shape == (2, 3, 4, 3)


def test_large_arrays_take_the_parallel_path_with_identical_results(chart):
    many = np.tile(chart, (5000, 1))  # 120 000 spectra
    lab = nxbase.spectra_to_Lab(many)
    np.testing.assert_array_equal(lab[-24:], nxbase.spectra_to_Lab(chart))
    np.testing.assert_array_equal(nxbase.spectra_to_XYZ(many)[:24], nxbase.spectra_to_XYZ(chart))
    # Any thread count gives the same numbers; 1 runs on the calling thread.
    for threads in (1, 2, 3):
        np.testing.assert_array_equal(nxbase.spectra_to_Lab(many, threads=threads), lab)
    np.testing.assert_array_equal(nxbase.spectra_to_LCh(many, threads=1), nxbase.spectra_to_LCh(many))
    with pytest.raises(ValueError, match="threads must be at least 1"):
        nxbase.spectra_to_Lab(chart, threads=0)
    # Percentages in two parts of a split array, or twice in what one thread
    # checks: the earliest is named.
    bad = many * 1
    bad[[90001, 70001]] *= 100
    for threads in (None, 1, 3):
        with pytest.raises(ValueError, match="spectrum 70001 gives L"):
            nxbase.spectra_to_Lab(bad, threads=threads)
    with pytest.raises(ValueError, match="spectrum 70001 gives Y"):
        nxbase.spectra_to_XYZ(bad, threads=1)
    # Contiguous float64 is read in place: the same numbers, and no copy of
    # the input (the peak grows by the result only, not by 17 MB of float32).
    wide = many.astype(np.float64)
    tracemalloc.start()
    try:
        tracemalloc.reset_peak()
        before = tracemalloc.get_traced_memory()[0]
        lab64 = nxbase.spectra_to_Lab(wide, threads=2)
        peak = tracemalloc.get_traced_memory()[1] - before
    finally:
        tracemalloc.stop()
    np.testing.assert_array_equal(lab64, lab)
    assert peak < 2 * lab64.nbytes, peak


def test_values_agree_with_nxcolor(chart):
    out = subprocess.run([tool("nxcolor"), "-f", "csv", "-p", "4", "-i", "D65", "-o", "10", "--din99",
                          "-d", "Status T"], capture_output=True, text=True, check=True).stdout
    rows = [line.split(",") for line in out.strip().splitlines()[1:]]
    printed = np.array([[float(v) for v in row[2:]] for row in rows])
    xyz = nxbase.spectra_to_XYZ(chart, illuminant="d65", observer=10)
    lab = nxbase.spectra_to_Lab(chart, illuminant="D65", observer="10")
    lch = nxbase.spectra_to_LCh(chart, illuminant="D65", observer=10)
    din = nxbase.spectra_to_DIN99(chart, illuminant="D65", observer=10)
    density = nxbase.spectra_to_density(chart, density_standard="Status T")
    # One default density standard in NxBase, Python included.
    np.testing.assert_array_equal(nxbase.spectra_to_density(chart),
                                  nxbase.spectra_to_density(chart, density_standard="Status E"))
    # XYZ are the very numbers nxcolor's objects compute; Lab and what follows
    # from it within the batch cube root's few units in the last place.
    assert [f"{v:.4f}" for v in xyz.ravel()] == [f"{v:.4f}" for v in printed[:, 0:3].ravel()]
    np.testing.assert_allclose(lab, printed[:, 3:6], atol=1.5e-4)
    np.testing.assert_allclose(lch[:, 1], printed[:, 6], atol=1.5e-4)
    # Near-neutral patches turn a last-place difference of a*, b* into
    # thousandths of a degree of hue.
    np.testing.assert_allclose(lch[:, 2], printed[:, 7], atol=5e-3)
    np.testing.assert_allclose(din, printed[:, 8:11], atol=1.5e-4)
    np.testing.assert_allclose(density, printed[:, 11:14], atol=1.5e-4)


def test_the_example_script_prints_the_chart_without_warnings(chart):
    script = os.path.join(os.path.dirname(__file__), "..", "..", "examples", "python", "chart_colours.py")
    run = subprocess.run([sys.executable, script], capture_output=True, text=True, check=True)
    lines = run.stdout.splitlines()
    lch = nxbase.spectra_to_LCh(chart)
    assert len(lines) == 26 and lines[1].split()[:5] == ["1", "dark", "skin", f"{lch[0, 0]:.2f}", f"{lch[0, 1]:.2f}"]
    assert lines[-1].startswith("largest change from D50/2 to A/10: ") and run.stderr == ""


def test_conversions_adaptation_and_progress(chart):
    # XYZ to Lab and back agree with the spectra's own paths and invert.
    xyz = nxbase.spectra_to_XYZ(chart, illuminant="D65").astype(np.float64)
    lab = nxbase.XYZ_to_Lab(xyz, "D65")
    np.testing.assert_allclose(lab, nxbase.spectra_to_Lab(chart, illuminant="D65"), atol=2e-3)
    np.testing.assert_array_equal(nxbase.XYZ_to_Lab(xyz[5], "D65"), lab[5])  # one as among many
    np.testing.assert_allclose(nxbase.Lab_to_XYZ(lab, "D65"), xyz, rtol=1e-12, atol=1e-12)
    white = nxbase.Lab_to_XYZ([100, 0, 0], "D65")  # the white point itself
    np.testing.assert_allclose(white, nxbase.spectra_to_XYZ(np.ones(36), illuminant="D65"), rtol=1e-6)
    np.testing.assert_array_equal(nxbase.XYZ_to_Lab(xyz, white), lab)
    lch = nxbase.Lab_to_LCh(lab)
    np.testing.assert_allclose(lch, nxbase.spectra_to_LCh(chart, illuminant="D65"), atol=2e-3)
    assert nxbase.Lab_to_LCh([50, 0, 0])[2] == 360.0
    # Bradford D65 to D50 takes the D65 white onto the D50 white; the names
    # of colour-science are accepted, a zero white is refused.
    d50 = nxbase.XYZ_to_Lab(nxbase.chromatic_adaptation(white, "D65", "D50", method="Bradford"), "D50")
    np.testing.assert_allclose(d50, [100, 0, 0], atol=1e-9)
    np.testing.assert_allclose(nxbase.chromatic_adaptation(xyz, "D65", "D50", method="von kries"),
                               nxbase.chromatic_adaptation(xyz, "D65", "D50", method="VonKries"))
    with pytest.raises(ValueError, match="unknown method"):
        nxbase.chromatic_adaptation(xyz, "D65", "D50", method="CAT16x")
    with pytest.raises(ValueError):
        nxbase.chromatic_adaptation(xyz, [0, 0, 0], "D50")
    # Progress: rising fractions, ending at 1, and the same numbers.
    many = np.tile(chart, (30000, 1))
    seen = []
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(many, progress=seen.append), nxbase.spectra_to_Lab(many))
    assert seen == sorted(seen) and seen[-1] == 1.0 and len(seen) == 3

    def stop(fraction):
        raise KeyboardInterrupt
    with pytest.raises(KeyboardInterrupt):
        nxbase.spectra_to_XYZ(many, progress=stop)


def test_differences_resampling_and_screen_colours():
    pairs = np.loadtxt(CHART.replace("tools/nxcolor/data/colorchecker_babelcolor_average.csv",
                                     "tests/data/ciede2000_sharma2005.csv"), delimiter=",", skiprows=1)
    de = nxbase.delta_E(pairs[:, 1:4], pairs[:, 4:7])
    np.testing.assert_allclose(de, pairs[:, 7], atol=1e-4)
    # Broadcasting: one reference against many samples.
    assert nxbase.delta_E([50, 0, 0], pairs[:, 4:7], method="ab").shape == (34,)
    assert nxbase.delta_E(np.zeros((2, 1, 3)), np.ones((5, 3)), method="cmc").shape == (2, 5)
    # colour-science's method names give the same formulas as the short ones.
    for long_name, short in (("CIE 2000", "2000"), ("CIE 1994", "94"), ("CMC", "cmc"), ("cie 1976", "ab")):
        np.testing.assert_array_equal(nxbase.delta_E(pairs[:, 1:4], pairs[:, 4:7], method=long_name),
                                      nxbase.delta_E(pairs[:, 1:4], pairs[:, 4:7], method=short))
    # A 5 nm spectrum holding a line comes back exactly at the 10 nm points.
    grid = np.arange(380, 731, 5.0)
    values = 0.2 + 0.001 * (grid - 380)
    np.testing.assert_allclose(nxbase.resample(grid, np.stack([values, values])),
                               np.tile(0.2 + 0.01 * np.arange(36), (2, 1)), atol=1e-12)
    # Spectra on their own grid: 5 nm is summed at 5 nm (as nxcolor does),
    # 10 nm goes the 36-point way.
    five = CHART.replace("tools/nxcolor/data/colorchecker_babelcolor_average.csv",
                         "tests/data/spectra/colorchecker_5nm_percent.csv")
    with warnings.catch_warnings():
        warnings.simplefilter("ignore", nxbase.SpectralScaleWarning)
        _, _, fine, grid = nxbase.read_spectra(five, native=True)
        _, _, standard = nxbase.read_spectra(five)
    assert fine.shape == (24, 71) and grid[0] == 380 and grid[-1] == 730
    xyz = nxbase.spectra_to_XYZ(fine, wavelengths=grid)
    printed = subprocess.run([tool("nxcolor"), five, "-f", "csv", "-p", "4"], capture_output=True, text=True,
                             check=True).stdout.splitlines()[1].split(",")
    np.testing.assert_allclose(xyz[0], [float(v) for v in printed[2:5]], atol=1e-4)
    lab_fine = nxbase.spectra_to_Lab(fine, wavelengths=grid)
    # Summed at 5 nm against the 10 nm tables: close for the chart's smooth
    # spectra, not equal (0.11 dE00 at most here).
    assert 0 < np.max(nxbase.delta_E(lab_fine, nxbase.spectra_to_Lab(standard))) < 0.25
    np.testing.assert_array_equal(nxbase.spectra_to_Lab(standard, wavelengths=np.arange(380, 731, 10.0)),
                                  nxbase.spectra_to_Lab(standard))
    # Fine grids are split across threads too, with the same numbers; a
    # thread pays off from fewer spectra than on the 36-point grid.
    many = np.tile(fine, (800, 1))  # 19 200 spectra of 71 values: two parts or more
    one = nxbase.spectra_to_Lab(many, wavelengths=grid, threads=1)
    for threads in (2, 3, None):
        np.testing.assert_array_equal(nxbase.spectra_to_XYZ(many, wavelengths=grid, threads=threads)[-24:],
                                      xyz)
        np.testing.assert_array_equal(nxbase.spectra_to_Lab(many, wavelengths=grid, threads=threads), one)
    rgb = nxbase.Lab_to_sRGB(np.array([[100, 0, 0], [0, 0, 0]], dtype=np.float32))
    assert rgb.shape == (2, 3) and rgb[0, 0] > 99 and rgb[1, 0] < 1


def test_bad_input_raises_with_the_librarys_words(tmp_path):
    with pytest.raises(ValueError, match=r"shape \(\.\.\., 36\), got \(3, 35\)"):
        nxbase.spectra_to_Lab(np.zeros((3, 35)))
    with pytest.raises(ValueError, match="got \\(\\)"):
        nxbase.spectra_to_Lab(np.float32(1))
    with pytest.raises(ValueError, match="numbers"):
        nxbase.spectra_to_XYZ(np.array([["a"] * 36]))
    with pytest.raises(ValueError, match="unknown illuminant \"D42\""):
        nxbase.spectra_to_Lab(np.zeros(36), illuminant="D42")
    with pytest.raises(ValueError, match="observer"):
        nxbase.spectra_to_Lab(np.zeros(36), observer=7)
    with pytest.raises(ValueError, match="density standard"):
        nxbase.spectra_to_density(np.zeros(36), density_standard="Status Q")
    with pytest.raises(ValueError, match="unknown method"):
        nxbase.delta_E([0, 0, 0], [1, 1, 1], method="2001")
    with pytest.raises(ValueError, match="broadcast"):
        nxbase.delta_E(np.zeros((2, 3)), np.zeros((3, 3)))
    with pytest.raises(ValueError, match="increase"):
        nxbase.resample([500, 490, 510], [0.1, 0.2, 0.3])
    with pytest.raises(FileNotFoundError):
        nxbase.read_spectra(str(tmp_path / "missing.csv"))
    with pytest.raises(IsADirectoryError):
        nxbase.read_spectra(tmp_path)
    bad = tmp_path / "bad.csv"
    bad.write_text("id,r400,r550,r700\nA,0.1,0.2,0.3\nB,0.1,x,0.3\n")
    with warnings.catch_warnings(record=True) as caught:
        warnings.simplefilter("always")
        ids, _, spectra = nxbase.read_spectra(bad)  # os.PathLike
    assert ids == ["A"] and spectra.shape == (1, 36)
    assert any("bad.csv:3" in str(w.message) and w.category is nxbase.SpectralDataWarning for w in caught)
    # The guessed scale is a warning of its own category, which users filter.
    assert any(w.category is nxbase.SpectralScaleWarning and "read as reflectance factors" in str(w.message)
               for w in caught)
    with warnings.catch_warnings():
        warnings.simplefilter("error", nxbase.SpectralDataWarning)
        with pytest.raises(nxbase.SpectralDataWarning):
            nxbase.read_spectra(bad)
    empty = tmp_path / "empty.csv"
    empty.write_text("")
    with pytest.raises(ValueError, match="no spectra"):
        nxbase.read_spectra(empty)
    # Percentages handed over as reflectance factors: refused, not L* 411.
    with pytest.raises(ValueError, match="spectrum 1 gives L\\* .*divide percentages by 100"):
        nxbase.spectra_to_Lab(np.stack([np.full(36, 0.5), np.full(36, 50.0)]))
    with pytest.raises(ValueError, match="gives Y "):
        nxbase.spectra_to_XYZ(np.full(36, 50.0))


def test_the_first_spectrum_without_a_reflectance_colour_is_named_wherever_it_lies():
    """Up to three pieces of the check (131 072 spectra each, written around
    the cache) of spectra up to Y 199.9, a few of them percentages, beyond the
    limits (Y 200, L* 130.2) by a hair, huge, or holding NaN or an infinity:
    the error names the first, on one thread and two."""
    seed = int.from_bytes(os.urandom(4), "little")
    rng = np.random.default_rng(seed)

    def named(convert, spectra, threads):
        try:
            convert(spectra, threads=threads)
            return None
        except ValueError as error:
            return int(str(error).split()[1])

    piece = 1 << 17
    for _ in range(8):
        n = int(rng.integers(1, 3 * piece + 40))
        spectra = rng.uniform(0.0, 1.99, (n, 36)).astype(np.float32)
        spectra[rng.integers(0, n)] = 1.999  # Y 199.9, L* 130.13: still reflectance factors
        bad = sorted(set(rng.integers(0, n, int(rng.integers(0, 3))).tolist()))
        for i in bad:
            kind = int(rng.integers(0, 5))
            if kind == 0:
                spectra[i] *= 100
            elif kind == 1:
                spectra[i] = 2.003  # Y 200.3, L* 130.22
            elif kind == 2:
                spectra[i, 27] = 2e38  # X beyond the float range
            else:
                spectra[i, rng.integers(0, 36)] = [np.nan, np.inf][kind - 3]
        for convert in (nxbase.spectra_to_XYZ, nxbase.spectra_to_Lab):
            for threads in (1, 2):
                assert named(convert, spectra, threads) == (bad[0] if bad else None), (seed, n, bad)
    with pytest.raises(ValueError, match="spectrum 0 gives a colour beyond the float range"):
        nxbase.spectra_to_Lab(np.full(36, 1e37, dtype=np.float32))


def test_every_function_answers_nan_or_refuses_and_keeps_its_properties():
    """NaN or infinity in gives NaN out or a ValueError naming the item;
    dE(x, x) = 0 and symmetry where the formula is; Lab round-trips; whites
    that are not positive are refused and whites on different scales agree;
    a computed grey is grey."""
    seed = int.from_bytes(os.urandom(4), "little")
    rng = np.random.default_rng(seed)
    n = 4000
    lab = np.column_stack([rng.uniform(0, 100, n), rng.uniform(-128, 128, (n, 2))])
    other = np.column_stack([rng.uniform(0, 100, n), rng.uniform(-128, 128, (n, 2))])
    broken = lab.copy()
    broken[np.arange(n), rng.integers(0, 3, n)] = rng.choice([np.nan, np.inf, -np.inf], n)
    for method in ("2000", "94", "94t", "cmc", "cmc11", "ab"):
        assert np.all(nxbase.delta_E(lab, lab, method=method) == 0), (seed, method)
        assert np.all(np.isnan(nxbase.delta_E(broken, other, method=method))), (seed, method)
        assert np.all(np.isnan(nxbase.delta_E(other, broken, method=method))), (seed, method)
    for method in ("2000", "ab"):
        np.testing.assert_allclose(nxbase.delta_E(lab, other, method=method),
                                   nxbase.delta_E(other, lab, method=method), atol=1e-9, err_msg=str(seed))
    xyz = nxbase.Lab_to_XYZ(lab, "D65")
    np.testing.assert_allclose(nxbase.XYZ_to_Lab(xyz, "D65"), lab, atol=1e-9, err_msg=str(seed))
    for convert in (lambda v: nxbase.Lab_to_XYZ(v, "D65"), lambda v: nxbase.XYZ_to_Lab(v, "D65"),
                    nxbase.Lab_to_LCh, nxbase.Lab_to_sRGB):
        assert np.all(np.isnan(convert(broken))), seed
    for white in ([0, 100, 100], [95, -100, 108], [95, np.nan, 108], [np.inf, 100, 108]):
        with pytest.raises(ValueError, match="white must have X, Y and Z above zero"):
            nxbase.XYZ_to_Lab(xyz, white)
        with pytest.raises(ValueError, match="white must have X, Y and Z above zero"):
            nxbase.chromatic_adaptation(xyz, white, "D50")
    d65 = nxbase.Lab_to_XYZ([100, 0, 0], "D65")
    np.testing.assert_allclose(nxbase.chromatic_adaptation(xyz, d65 / 100, "D50"),
                               nxbase.chromatic_adaptation(xyz, "D65", "D50"), rtol=1e-12, atol=1e-12)
    # Spectra with NaN or infinity are refused, naming the spectrum and the value.
    spectra = rng.uniform(0.02, 0.95, (50, 36))
    row, value = int(rng.integers(0, 50)), int(rng.integers(0, 36))
    spectra[row, value] = np.nan
    for convert in (nxbase.spectra_to_XYZ, nxbase.spectra_to_Lab):
        with pytest.raises(ValueError, match=f"spectrum {row} holds NaN \\(value {value}\\)"):
            convert(spectra)
    fine = np.full((2, 351), 0.5)
    fine[1, 7] = np.inf
    with pytest.raises(ValueError, match="spectrum 1 holds an infinity \\(value 7\\)"):
        nxbase.spectra_to_Lab(fine, wavelengths=np.arange(380, 731.0))
    with pytest.raises(ValueError, match="cover 900..1000 nm, outside the visible"):
        nxbase.spectra_to_Lab(np.full(11, 0.5), wavelengths=np.arange(900, 1001.0, 10))
    # Greys, computed in single precision under every illuminant, are grey.
    for illuminant in ("A", "C", "D50", "D65", "E", "FL2"):
        for observer in (2, 10):
            greys = np.ones((3, 36)) * np.array([[1.0], [0.5], [0.18]])
            assert np.all(nxbase.spectra_to_LCh(greys, illuminant, observer)[:, 2] == 360), (illuminant, observer)
