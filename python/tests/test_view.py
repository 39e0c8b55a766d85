"""Pages by the program vln."""

import os
import stat
import subprocess

import numpy as np
import pytest

import vln


def ball():
    x, y, z = np.mgrid[-12:13, -12:13, -12:13]
    values = np.maximum(1 - np.sqrt(x * x + y * y + z * z) / 12, 0).astype(np.float32)
    return vln.Volume.from_numpy(values, name="density")


def stand_in(folder, text):
    program = folder / "vln"
    program.write_text("#!/bin/sh\n" + text)
    program.chmod(program.stat().st_mode | stat.S_IXUSR)
    return program


def test_requirement_program_gets_a_file_that_holds_the_volume(tmp_path):
    # $3 is the file, $5 the page.
    program = stand_in(tmp_path, f'cp "$2" "{tmp_path}/seen.vdb"; printf "<p>%s &amp;</p>" "$*" >"$4"')
    page = ball().view("density", max_size=1000000, program=program)
    assert isinstance(page, vln.Page)
    assert b"--max-size 1000000 --channel density" in page
    with vln.open(tmp_path / "seen.vdb") as file:
        assert file["density"].active() is not None
        assert list(file) == ["density"]
    shown = page._repr_html_()
    assert shown.startswith("<iframe srcdoc=") and "&lt;p&gt;" in shown and "<p>" not in shown
    page.save(tmp_path / "page.html")
    assert (tmp_path / "page.html").read_bytes() == bytes(page)


def test_negative_what_the_program_says_is_raised(tmp_path):
    with pytest.raises(RuntimeError, match="no pages here"):
        ball().view(program=stand_in(tmp_path, "echo no pages here >&2; exit 1"))
    with pytest.raises(FileNotFoundError, match="nothing-of-the-kind"):
        ball().view(program=tmp_path / "nothing-of-the-kind")
    with pytest.raises(KeyError):
        ball().view("velocity", program=stand_in(tmp_path, "exit 0"))


def test_requirement_page_of_the_real_program(tmp_path):
    program = os.environ.get("VLN_PROGRAM", "")
    if not program:
        pytest.skip("VLN_PROGRAM names no program")
    ball().save(tmp_path / "ball.vdb")
    made = subprocess.run([program, "view", str(tmp_path / "ball.vdb"), "-o", str(tmp_path / "page.html")],
                          capture_output=True)
    if made.returncode != 0 and b"VLN_WITH_VIEW" in made.stderr:
        pytest.skip("the program was built without pages")
    page = ball().view()
    assert b"<html" in page and b"WebGL" in page
