#!/usr/bin/env python3
"""CIELAB and an sRGB picture of a hyperspectral cube, converted in chunks of
rows by the worker processes of a Dask cluster.

The cube is (rows, columns, bands) of reflectance factors: 36 bands of
380..730 nm (10 nm) or 471 bands of 360..830 nm (1 nm), made here or read
from an .npy file row block by row block, so that a cube larger than memory
never has to fit in it. Each worker reads its own rows from the file.

    PYTHONPATH=build/default/python /usr/bin/python3 examples/python/dask_cube.py \
        --rows 256 --columns 256 --step 1 --png cube.png --check
    ... --npy cube.npy --chunk-rows 64 --png cube.png          # a cube on disk
    ... --scheduler tcp://scheduler:8786 --npy /shared/cube.npy  # a running cluster

--check converts the same cube in this process alone and requires identical
Lab values. With --scheduler the workers must import nxbase and read the file
at the same path.
"""
import argparse
import struct
import sys
import tempfile
import zlib

import dask
import dask.array as da
import numpy as np
from dask.distributed import Client, LocalCluster

import nxbase


def wavelengths_of(step):
    return np.arange(380, 731, 10.0) if step == 10 else np.arange(360, 831, 1.0)


def make_cube(rows, columns, step, seed=1):
    """Smooth random spectra: a few broad bumps per pixel."""
    nm = wavelengths_of(step)
    random = np.random.default_rng(seed)
    centres = random.uniform(380, 730, (rows, columns, 3, 1))
    heights = random.uniform(0.05, 0.5, (rows, columns, 3, 1))
    bumps = heights * np.exp(-0.5 * ((nm - centres) / 40.0) ** 2)
    return (0.05 + bumps.sum(axis=2)).clip(0.0, 1.0).astype(np.float32)


def read_rows(path, start, stop):
    """One block of rows of an .npy cube, read where the task runs."""
    return np.asarray(np.load(path, mmap_mode="r")[start:stop], dtype=np.float32)


def cube_from_npy(path, chunk_rows):
    shape = np.load(path, mmap_mode="r").shape
    blocks = [da.from_delayed(dask.delayed(read_rows)(path, start, min(start + chunk_rows, shape[0])),
                              shape=(min(chunk_rows, shape[0] - start),) + shape[1:], dtype=np.float32)
              for start in range(0, shape[0], chunk_rows)]
    return da.concatenate(blocks, axis=0)


def lab_of_block(block, wavelengths):
    """Lab of one block of the cube, on the worker's one thread."""
    spectra = block.reshape(-1, block.shape[-1])
    grid = None if len(wavelengths) == 36 else wavelengths
    lab = nxbase.spectra_to_Lab(spectra, wavelengths=grid, threads=1)
    return lab.reshape(block.shape[:-1] + (3,))


def convert(cube, wavelengths):
    """The task graph: Lab per block, then sRGB per block."""
    lab = cube.map_blocks(lab_of_block, wavelengths, dtype=np.float32,
                          chunks=cube.chunks[:-1] + ((3,),))
    return lab, lab.map_blocks(nxbase.Lab_to_sRGB, dtype=np.float32)


def write_png(path, rgb):
    """An 8-bit RGB PNG of sRGB components 0..100, with the standard library."""
    pixels = np.round(np.clip(rgb, 0, 100) * 2.55).astype(np.uint8)
    rows = b"".join(b"\x00" + row.tobytes() for row in pixels)

    def chunk(kind, data):
        return struct.pack(">I", len(data)) + kind + data + struct.pack(">I", zlib.crc32(kind + data))

    header = struct.pack(">IIBBBBB", pixels.shape[1], pixels.shape[0], 8, 2, 0, 0, 0)
    with open(path, "wb") as out:
        out.write(b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", header) + chunk(b"IDAT", zlib.compress(rows, 6))
                  + chunk(b"IEND", b""))


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n\n")[0])
    parser.add_argument("--npy", help="an .npy cube (rows, columns, 36 or 471) to read in chunks")
    parser.add_argument("--rows", type=int, default=128)
    parser.add_argument("--columns", type=int, default=128)
    parser.add_argument("--step", type=int, choices=(1, 10), default=10, help="nm, for a made cube")
    parser.add_argument("--chunk-rows", type=int, default=32)
    parser.add_argument("--workers", type=int, default=2)
    parser.add_argument("--scheduler", help="address of a running Dask scheduler")
    parser.add_argument("--png", help="write the sRGB picture here")
    parser.add_argument("--check", action="store_true", help="compare with one process")
    args = parser.parse_args()

    if args.npy:
        cube = cube_from_npy(args.npy, args.chunk_rows)
    else:
        cube = da.from_array(make_cube(args.rows, args.columns, args.step),
                             chunks=(args.chunk_rows, -1, -1))
    bands = cube.shape[-1]
    if bands not in (36, 471):
        sys.exit(f"{bands} bands: expected 36 (380..730/10 nm) or 471 (360..830/1 nm)")
    wavelengths = wavelengths_of(10 if bands == 36 else 1)

    with tempfile.TemporaryDirectory(prefix="nxbase-dask-") as scratch:
        if args.scheduler:
            client = Client(args.scheduler)
        else:
            cluster = LocalCluster(n_workers=args.workers, threads_per_worker=1, processes=True,
                                   dashboard_address=None, local_directory=scratch)
            client = Client(cluster)
        with client:
            lab, rgb = convert(cube, wavelengths)
            lab, rgb = dask.compute(lab, rgb)
        if not args.scheduler:
            cluster.close()

    print(f"{cube.shape[0]} x {cube.shape[1]} spectra of {bands} bands in {cube.numblocks[0]} "
          f"chunks: L* {lab[..., 0].min():.2f} .. {lab[..., 0].max():.2f}")
    if args.check:
        alone = lab_of_block(cube.compute(scheduler="synchronous"), wavelengths)
        if not np.array_equal(lab, alone):
            sys.exit("the cluster's Lab values differ from one process's")
        print("identical to the conversion in one process")
    if args.png:
        write_png(args.png, rgb)
        print(f"sRGB picture in {args.png}")


if __name__ == "__main__":
    main()
