#!/usr/bin/env python3
"""Colour values of a spectral file (or the ColorChecker shipped with the
sources) with the NxBase module, and the difference between two illuminants.

    PYTHONPATH=build/default/python /usr/bin/python3 examples/python/chart_colours.py [FILE]
"""
import os
import sys

import numpy as np

import nxbase

here = os.path.dirname(os.path.abspath(__file__))
if len(sys.argv) > 1:
    ids, names, spectra = nxbase.read_spectra(sys.argv[1])   # the scale guessed, with a warning
else:  # the shipped chart holds reflectance factors
    ids, names, spectra = nxbase.read_spectra(os.path.join(
        here, "..", "..", "tools", "nxcolor", "data", "colorchecker_babelcolor_average.csv"), scale="fraction")

lab_d50 = nxbase.spectra_to_Lab(spectra)                                  # (N, 3)
lab_a = nxbase.spectra_to_Lab(spectra, illuminant="A", observer=10)
lch = nxbase.spectra_to_LCh(spectra)
rgb = nxbase.Lab_to_sRGB(lab_d50)                                         # 0..100
shift = nxbase.delta_E(lab_d50, lab_a)                                    # CIEDE2000

print(f"{'id':>4} {'name':<22} {'L*':>7} {'C*':>7} {'h':>7}  screen   dE00 D50/A")
for i, (sample, name) in enumerate(zip(ids, names)):
    hex_colour = "#" + "".join(f"{int(round(v * 2.55)):02X}" for v in rgb[i])
    print(f"{sample:>4} {name:<22} {lch[i, 0]:7.2f} {lch[i, 1]:7.2f} {lch[i, 2]:7.2f}  {hex_colour}  {shift[i]:6.2f}")
print(f"largest change from D50/2 to A/10: {names[int(np.argmax(shift))]} ({shift.max():.2f})")
