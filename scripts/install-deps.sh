#!/bin/sh
# install-deps.sh [--checks|--python|--packages|--view]: installs the Debian packages that the build and the tests need,
# with --checks those of scripts/check.sh too, with --python those of the Python module, with --packages those of
# scripts/deb.sh, with --view those of the page of vln view and its tests. Asks nothing; when all is there it does
# nothing and calls no network.
set -eu

packages="
  g++ binutils cmake ninja-build ccache git ca-certificates python3
  libtbb-dev libjemalloc-dev libnanovdb-dev
  libopenvdb-dev libopenvdb-tools libboost-iostreams-dev libimath-dev
  libcli11-dev nlohmann-json3-dev libpng-dev zlib1g-dev libfmt-dev
  libgtest-dev libgmock-dev libbenchmark-dev
"
case ${1:-} in
  '') ;;
  --checks) packages="$packages clang-format-14 clang-tidy-14" ;;
  --python)
    packages="$packages python3-dev pybind11-dev python3-numpy python3-pip python3-venv python3-pytest mypy"
    # Beside which the tests load the module, and whose readers they ask.
    packages="$packages python3-scipy python3-openvdb python3-vtk9 libhdf5-dev python3-h5py python3-zarr"
    ;;
  --packages) packages="$packages python3-dev pybind11-dev python3-numpy libhdf5-dev dpkg-dev file" ;;
  --view)
    packages="$packages chromium"
    # A node of another origin does as well, and goes with no npm of Debian's.
    command -v node >/dev/null 2>&1 || packages="$packages nodejs"
    command -v npm >/dev/null 2>&1 || packages="$packages npm"
    ;;
  *) echo "install-deps: unknown option '$1'" >&2 && exit 2 ;;
esac

if ! command -v dpkg-query >/dev/null 2>&1; then
  echo "install-deps: this is not a Debian system; install the counterparts of:" >&2
  echo $packages >&2
  exit 1
fi

missing=
for package in $packages; do
  if [ "$(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null || true)" != installed ]; then
    missing="$missing $package"
  fi
done
if [ -z "$missing" ]; then
  echo "install-deps: all packages are there"
  exit 0
fi

echo "install-deps: installing$missing"
as_root=
if [ "$(id -u)" != 0 ]; then
  if ! command -v sudo >/dev/null 2>&1; then
    echo "install-deps: neither root nor sudo; as root run: apt-get install$missing" >&2
    exit 1
  fi
  as_root=sudo
fi
$as_root apt-get update -qq </dev/null
# shellcheck disable=SC2086
$as_root env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends $missing </dev/null
