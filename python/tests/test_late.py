"""The module loads behind other large extensions, whose static thread-local storage comes first."""

import subprocess
import sys

PROGRAM = """
import numpy, numpy.linalg, numpy.fft, numpy.random
{others}
import vln
volume = vln.Volume.from_numpy(numpy.ones((8, 8, 8), numpy.float32))
assert volume["density"].sample((1, 1, 1)) == 1
print("loaded")
"""


def run(others):
    lines = "".join(f"try:\n    import {name}\nexcept ImportError:\n    print('without {name}')\n" for name in others)
    program = PROGRAM.format(others=lines)
    return subprocess.run([sys.executable, "-c", program], capture_output=True, text=True, timeout=120)


def test_requirement_the_module_loads_behind_other_extensions():
    done = run(["scipy.linalg", "scipy.sparse.linalg", "scipy.spatial", "scipy.ndimage", "pandas", "pyopenvdb"])
    assert done.returncode == 0, done.stderr
    assert done.stdout.splitlines()[-1] == "loaded"


def test_requirement_the_module_asks_for_no_room_that_late_loading_lacks():
    """Static thread-local storage is marked in the extension itself: jemalloc would leave the flag."""
    import vln

    path = vln._vln.__file__
    flags = subprocess.run(["readelf", "-d", path], capture_output=True, text=True)
    if flags.returncode == 0:
        assert "STATIC_TLS" not in flags.stdout
