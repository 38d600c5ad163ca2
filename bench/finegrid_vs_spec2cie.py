"""ArgyllCMS's F1, F5 and F8 lamp spectra (5 nm) turned into reflectances:
their colour against ArgyllCMS's spec2cie, once from the 10 nm points (the
36-point path) and once summed at 5 nm (nxbase.FineGridTristimulus).

    PYTHONPATH=build/default/python /usr/bin/python3 bench/finegrid_vs_spec2cie.py

Needs the argyll package (spec2cie and /usr/share/color/argyll/ref).
Prints dE00 of each lamp for both paths.
"""
import shutil
import subprocess
import tempfile
import warnings

import numpy as np

import nxbase

warnings.simplefilter("ignore", nxbase.SpectralDataWarning)
d = tempfile.mkdtemp(prefix="nxbase-lamps-")
ref = "/usr/share/color/argyll/ref/"
def read_sp(path):
    lines = open(path).read().split("BEGIN_DATA\n")[1].split("END_DATA")[0].split()
    return np.array([float(v) for v in lines])
grid = np.arange(380, 781, 5.0)
rows = []
for name in ("F1", "F5", "F8"):
    p = read_sp(ref + name + ".sp")
    rows.append((name, 100.0 * p / p.max()))
rows.append(("white", np.full(len(grid), 100.0)))
fields = ["SAMPLE_ID", "SAMPLE_NAME", "RGB_R", "RGB_G", "RGB_B", "XYZ_X", "XYZ_Y", "XYZ_Z"] + [f"SPEC_{int(w)}" for w in grid]
with open(f"{d}/lamps.ti3", "w") as f:
    f.write('CTI3\n\nDESCRIPTOR "lamps as reflectances"\nORIGINATOR "test"\nCREATED "now"\nKEYWORD "DEVICE_CLASS"\nDEVICE_CLASS "OUTPUT"\nKEYWORD "COLOR_REP"\nCOLOR_REP "RGB_XYZ"\n')
    f.write(f'KEYWORD "SPECTRAL_BANDS"\nSPECTRAL_BANDS "{len(grid)}"\nKEYWORD "SPECTRAL_START_NM"\nSPECTRAL_START_NM "380.000000"\nKEYWORD "SPECTRAL_END_NM"\nSPECTRAL_END_NM "780.000000"\nKEYWORD "SPECTRAL_NORM"\nSPECTRAL_NORM "100.0"\n\n')
    f.write(f"NUMBER_OF_FIELDS {len(fields)}\nBEGIN_DATA_FORMAT\n{' '.join(fields)}\nEND_DATA_FORMAT\n\nNUMBER_OF_SETS {len(rows)}\nBEGIN_DATA\n")
    for i, (name, r) in enumerate(rows):
        f.write(f'{i+1} "{name}" 0 0 0 0 0 0 ' + " ".join(f"{v:.5f}" for v in r) + "\n")
    f.write("END_DATA\n")
subprocess.run(["spec2cie", "-i", "D50", f"{d}/lamps.ti3", f"{d}/out.ti3"], check=True)
data = open(f"{d}/out.ti3").read().split("BEGIN_DATA\n")[1].split("END_DATA")[0].strip().splitlines()
xyz = np.array([[float(v) for v in line.split()[5:8]] for line in data])
white = xyz[-1]
argyll = nxbase.XYZ_to_Lab(xyz[:3], white)  # against spec2cie's own white
_, _, native, wl = nxbase.read_spectra(f"{d}/lamps.ti3", native=True)
_, _, standard = nxbase.read_spectra(f"{d}/lamps.ti3")
after = nxbase.spectra_to_Lab(native[:3], wavelengths=wl)
before = nxbase.spectra_to_Lab(standard[:3])
print("white XYZ: spec2cie", white, " ours", nxbase.spectra_to_XYZ(native[3:4], wavelengths=wl)[0])
for i, name in enumerate(("F1", "F5", "F8")):
    print(f"{name}: dE00 against spec2cie  before (10 nm points) {nxbase.delta_E(argyll[i], before[i]):.3f}  after (5 nm sum) {nxbase.delta_E(argyll[i], after[i]):.3f}")
shutil.rmtree(d)
