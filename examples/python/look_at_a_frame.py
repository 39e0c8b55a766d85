"""Looks at a frame of a smoke simulation: what it holds, where the smoke is, how fast it moves.

    python3 look_at_a_frame.py FRAME.vdb SLICE.png
"""

import sys

import numpy as np

import vln


def main(frame: str, picture: str) -> None:
    with vln.open(frame, channels="density velocity temperature") as file:
        for name in file:
            print(file[name])
        density, velocity = file["density"], file["velocity"]

        # Dense, over the box round the smoke.
        dense = density.to_numpy()
        mass = dense.sum() * file.volume.voxel_size**3
        print(f"box {dense.shape}, {np.count_nonzero(dense) / dense.size:.0%} of it smoke, mass {mass:.3f}")

        # Sparse: the active voxels alone.
        ijk = density.active()
        weights = density.get(ijk)
        center = np.average(file.volume.to_world(ijk), axis=0, weights=weights)
        speed = np.linalg.norm(velocity.sample(file.volume.to_world(ijk)), axis=1)
        print(f"centre of mass {np.round(center, 2)}, mean speed {np.average(speed, weights=weights):.2f}")

        with open(picture, "wb") as out:
            out.write(density.png(axis="y", size=400))


if __name__ == "__main__":
    main(*sys.argv[1:])
