import os
import pathlib

import pytest


@pytest.fixture(scope="session")
def data():
    """The folder of real files; a test that needs it is skipped where there is none."""
    folder = os.environ.get("VLN_TEST_DATA_DIR", "")
    if not folder or not pathlib.Path(folder).is_dir():
        pytest.skip("no folder of real input files")
    return pathlib.Path(folder)


@pytest.fixture()
def bunny(data):
    import vln

    return vln.open(data / "vdb" / "bunny_ls_128.vdb")
