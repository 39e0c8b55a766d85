"""Builds the wheel: a PEP 517 backend that needs nothing but CMake and what the build itself needs.

    pip install .                       builds and installs
    pip wheel . --no-deps -w FOLDER     builds

The environment may say VLN_PYTHON_BUILD_DIR, a build folder to keep between builds, and CMAKE_ARGS. The version
is the project's, out of CMakeLists.txt. Ninja is taken where it is installed; VLN_JOBS limits the jobs.
"""

import base64
import hashlib
import os
import pathlib
import re
import shlex
import shutil
import subprocess
import sys
import sysconfig
import tempfile
import zipfile

ROOT = pathlib.Path(__file__).resolve().parents[2]
PACKAGE = ROOT / "python" / "vln"
SUMMARY = "Sparse hierarchical volumes: open, sample, change and save them as numpy arrays"


def version():
    text = (ROOT / "CMakeLists.txt").read_text()
    return re.search(r"project\([^)]*VERSION\s+([0-9.]+)", text).group(1)


def tag():
    python = f"cp{sys.version_info.major}{sys.version_info.minor}"
    platform = re.sub(r"[-.]", "_", sysconfig.get_platform())
    return f"{python}-{python}-{platform}"


def metadata():
    return (
        "Metadata-Version: 2.1\n"
        "Name: vln\n"
        f"Version: {version()}\n"
        f"Summary: {SUMMARY}\n"
        "Requires-Python: >=3.9\n"
        "Requires-Dist: numpy\n"
        "Description-Content-Type: text/markdown\n"
        "\n" + (ROOT / "docs" / "python.md").read_text()
    )


def wheel_file():
    return f"Wheel-Version: 1.0\nGenerator: vln build_wheel\nRoot-Is-Purelib: false\nTag: {tag()}\n"


def build_extension(folder):
    """Configures and builds in `folder`; returns the extension's path."""
    generator = ["-G", "Ninja"] if shutil.which("ninja") else []
    jobs = os.environ.get("VLN_JOBS") or str(os.cpu_count() or 2)
    options = {
        "CMAKE_BUILD_TYPE": "Release",
        "BUILD_SHARED_LIBS": "OFF",
        "VLN_ALLOCATOR": "system",
        "VLN_BUILD_PYTHON": "ON",
        "VLN_BUILD_TOOLS": "OFF",
        "VLN_BUILD_TESTS": "OFF",
        "VLN_BUILD_EXAMPLES": "OFF",
        "Python3_EXECUTABLE": sys.executable,
    }
    arguments = [f"-D{key}={value}" for key, value in options.items()]
    arguments += shlex.split(os.environ.get("CMAKE_ARGS", ""))
    subprocess.run(["cmake", "-S", str(ROOT), "-B", str(folder), *generator, *arguments], check=True)
    subprocess.run(["cmake", "--build", str(folder), "--target", "_vln", "-j", jobs], check=True)
    suffix = sysconfig.get_config_var("EXT_SUFFIX")
    return folder / "python" / "vln" / f"_vln{suffix}"


# The hooks of PEP 517


def get_requires_for_build_wheel(config_settings=None):
    return []


def prepare_metadata_for_build_wheel(metadata_directory, config_settings=None):
    folder = pathlib.Path(metadata_directory) / f"vln-{version()}.dist-info"
    folder.mkdir(parents=True)
    (folder / "METADATA").write_text(metadata())
    (folder / "WHEEL").write_text(wheel_file())
    return folder.name


def build_wheel(wheel_directory, config_settings=None, metadata_directory=None):
    kept = os.environ.get("VLN_PYTHON_BUILD_DIR")
    with tempfile.TemporaryDirectory() as temporary:
        extension = build_extension(pathlib.Path(kept).resolve() if kept else pathlib.Path(temporary))
        info = f"vln-{version()}.dist-info"
        name = f"vln-{version()}-{tag()}.whl"
        contents = {f"vln/{f.name}": f.read_bytes() for f in sorted(PACKAGE.iterdir()) if f.is_file()}
        contents[f"vln/{extension.name}"] = extension.read_bytes()
        contents[f"{info}/METADATA"] = metadata().encode()
        contents[f"{info}/WHEEL"] = wheel_file().encode()
        write(pathlib.Path(wheel_directory) / name, contents, f"{info}/RECORD")
    return name


def write(path, contents, record):
    lines = []
    with zipfile.ZipFile(path, "w", zipfile.ZIP_DEFLATED) as wheel:
        for name, content in contents.items():
            digest = base64.urlsafe_b64encode(hashlib.sha256(content).digest()).rstrip(b"=").decode()
            lines.append(f"{name},sha256={digest},{len(content)}")
            # A fixed date: the same sources make the same wheel.
            wheel.writestr(zipfile.ZipInfo(name, (1980, 1, 1, 0, 0, 0)), content, zipfile.ZIP_DEFLATED)
        wheel.writestr(zipfile.ZipInfo(record, (1980, 1, 1, 0, 0, 0)), "\n".join([*lines, f"{record},,"]) + "\n")


def build_sdist(sdist_directory, config_settings=None):
    """The files that git knows."""
    import tarfile

    name = f"vln-{version()}"
    files = subprocess.run(["git", "ls-files", "-z"], cwd=ROOT, check=True, capture_output=True, text=True).stdout
    with tarfile.open(pathlib.Path(sdist_directory) / f"{name}.tar.gz", "w:gz") as archive:
        for file in filter(None, files.split("\0")):
            archive.add(ROOT / file, f"{name}/{file}")
        with tempfile.NamedTemporaryFile("w", suffix="PKG-INFO") as info:
            info.write(metadata())
            info.flush()
            archive.add(info.name, f"{name}/PKG-INFO")
    return f"{name}.tar.gz"
