"""The examples of the documents run, and say what they should."""

import pathlib
import subprocess
import sys

import numpy as np

import vln

EXAMPLES = pathlib.Path(__file__).resolve().parents[2] / "examples" / "python"


def run(name, *arguments):
    done = subprocess.run([sys.executable, EXAMPLES / f"{name}.py", *map(str, arguments)], capture_output=True, text=True)
    assert done.returncode == 0, done.stderr
    return done.stdout


def test_example_look_at_a_frame(data, tmp_path):
    out = run("look_at_a_frame", data / "vdb" / "mantaflow_smoke_0010.vdb", tmp_path / "a.png")
    assert "39375 active voxels" in out and "centre of mass" in out
    assert (tmp_path / "a.png").read_bytes().startswith(b"\x89PNG")


def test_example_distances_to_a_mesh(data, tmp_path):
    out = run("distances_to_a_mesh", data / "vdb" / "spot_ls_128.vdb", data / "mesh" / "spot.obj", tmp_path / "a.ply")
    numbers = [float(word) for word in out.replace("(", " ").split() if word.replace(".", "").isdigit()]
    assert numbers[0] == 2930 and numbers[1] < 0.1 and numbers[2] < 0.1
    assert (tmp_path / "a.ply").stat().st_size > 2930 * 16


def test_example_particles_to_density(tmp_path):
    out = run("particles_to_density", tmp_path / "a.vdb", tmp_path / "a.vti")
    assert "200000 of 200000 particles" in out
    density = vln.open(tmp_path / "a.vdb")["density"]
    assert density.to_numpy().max() == np.float32(10)
