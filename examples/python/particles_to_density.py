"""Splats particles into a density, each onto the eight samples round it, smooths it in place and saves it.

    python3 particles_to_density.py DENSITY.vdb DENSITY.vti
"""

import sys

import numpy as np

import vln


def splat(points: np.ndarray, voxel_size: float) -> vln.Volume:
    at = points / voxel_size
    low = np.floor(at).astype(np.int64)
    t = at - low
    ijk, weight = [], []
    for corner in np.ndindex(2, 2, 2):
        ijk.append(low + corner)
        weight.append(np.prod(np.where(corner, t, 1 - t), axis=1))
    samples, where = np.unique(np.concatenate(ijk), axis=0, return_inverse=True)
    total = np.bincount(where.ravel(), np.concatenate(weight))
    volume = vln.Volume(voxel_size)
    volume.add("density", grid_class="fog volume").set(samples, total.astype(np.float32))
    return volume


def main(vdb: str, vti: str) -> None:
    rng = np.random.default_rng(1)
    points = rng.normal(size=(200_000, 3)) * (2, 1, 0.5)
    volume = splat(points, voxel_size=0.1)
    density = volume["density"]
    print(volume)

    # The sum is the number of particles, whichever way it is asked for.
    print(f"{density.values().sum(dtype=float):.0f} of {len(points)} particles")

    # In place, tile by tile: no copy is made, and nothing else may change the volume meanwhile.
    with density.writable() as tiles:
        values = tiles.values()
        np.minimum(values, 10, out=values)
        del values
    volume.set_coarse_values()

    volume.save(vdb)
    volume.save(vti)


if __name__ == "__main__":
    main(*sys.argv[1:])
