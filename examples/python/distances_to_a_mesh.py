"""How far points lie from a mesh, and which way the surface is, out of its level set.

    python3 distances_to_a_mesh.py LEVELSET.vdb MESH.obj NEAR.ply
"""

import sys

import numpy as np

import vln


def vertices_of(path: str) -> np.ndarray:
    with open(path) as file:
        return np.array([line.split()[1:4] for line in file if line.startswith("v ")], dtype=float)


def main(levelset: str, mesh: str, out: str) -> None:
    file = vln.open(levelset)
    sdf = file[file.names[0]]
    voxel = file.volume.voxel_size
    vertices = vertices_of(mesh)

    # Vertices lie on the surface, up to a share of a voxel.
    distance, gradient = sdf.sample(vertices, gradient=True)
    print(f"{len(vertices)} vertices lie {np.abs(distance).mean() / voxel:.3f} voxels off the level set")

    # Points near the surface are moved onto it: against the gradient, by the distance.
    rng = np.random.default_rng(0)
    points = vertices + rng.uniform(-voxel, voxel, vertices.shape)
    for _ in range(3):
        distance, gradient = sdf.sample(points, gradient=True)
        length = np.linalg.norm(gradient, axis=1, keepdims=True)
        points -= distance[:, None] * gradient / np.maximum(length, 0.1) ** 2
    distance = sdf.sample(points)
    print(f"after three steps {np.percentile(np.abs(distance), 99) / voxel:.4f} voxels (99 of 100)")

    vln.Volume.from_points(points, voxel, {"distance": distance}).save(out)


if __name__ == "__main__":
    main(*sys.argv[1:])
