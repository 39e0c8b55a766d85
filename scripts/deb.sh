#!/bin/sh
# deb.sh [--try [ROOT]]: builds Debian packages of the library, its development files, the program and the Python
# module into build/packages, out of builds of their own that take what other builds have left in ccache.
# --try then makes a minimal Debian 12 with debootstrap (as root; in ROOT, which is kept, and made only where it is
# missing), installs the packages there with the distribution's own alone, runs the program, a project that uses the
# library, and the module, and tells how long the installs took.
# VLN_JOBS limits the parallel jobs, VLN_PYTHON names the interpreter (default: /usr/bin/python3), VLN_MIRROR the mirror
# of Debian (default: the one that this machine's apt uses).
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

try=no
place=
case ${1:-} in
  '') ;;
  --try) try=yes place=${2:-} ;;
  *) echo "usage: deb.sh [--try [ROOT]]" >&2 && exit 2 ;;
esac
python=${VLN_PYTHON:-/usr/bin/python3}
packages=$root/build/packages

build_libraries() { cmake --preset deb >build/deb.log && cmake --build --preset deb -j "$jobs" >>build/deb.log; }

# As the wheel's, in the same folder as scripts/python.sh uses.
build_module() {
  (cd python/packaging && VLN_JOBS=$jobs "$python" -B -c '
import pathlib, sys, build_wheel
build_wheel.build_extension(pathlib.Path(sys.argv[1]))' "$root/build/python") >build/deb-python.log
}

pack() {
  rm -rf "$packages"
  for tree in deb python; do
    cpack --config "build/$tree/CPackConfig.cmake" -B "$packages" >"build/deb-$tree.log" || { cat "build/deb-$tree.log"; return 1; }
  done
  rm -rf "$packages/_CPack_Packages"
  [ "$(ls "$packages" | wc -l)" -eq 5 ]
  (cd "$packages" && ls -s --block-size=K -- *.deb)
}

make_root() {
  [ ! -x "$place/bin/sh" ] || return 0
  mirror=${VLN_MIRROR:-$(apt-get indextargets --format '$(CODENAME) $(REPO_URI)' 'Created-By: Packages' |
    sed -n 's/^bookworm //p' | head -n 1)}
  debootstrap --variant=minbase bookworm "$place" "$mirror" >build/debootstrap.log 2>&1 ||
    { tail -n 20 build/debootstrap.log; return 1; }
}

inside() { chroot "$place" env LC_ALL=C.UTF-8 DEBIAN_FRONTEND=noninteractive "$@"; }

# The packages of those names as they lie inside.
ours() {
  for name in "$@"; do
    (cd "$place" && ls packages/${name}_*.deb) | sed 's,^,/,'
  done
}
# install WITH-RECOMMENDS? PACKAGE...
install() {
  recommends=$1
  shift
  inside apt-get install -y -q -o "APT::Install-Recommends=$recommends" "$@" >>build/deb-install.log 2>&1 ||
    { tail -n 20 build/deb-install.log; return 1; }
}
install_users() {
  inside apt-get update -q >build/deb-install.log 2>&1
  # shellcheck disable=SC2046
  install false $(ours vln 'libgeometryvolume[0-9]*' 'libgeometryvolume-interop*' python3-vln)
}
install_developers() { install true $(ours libgeometryvolume-dev) g++ cmake ninja-build; }

try_program() {
  inside sh -euxc '
    cd "$(mktemp -d)"
    vln --version
    vln make cloud cloud.vdb --voxels 1000000
    vln info cloud.vdb
    vln slice cloud.vdb --channel density --axis z -o slice.png
    vln render cloud.vdb --size 256x256 --spp 4 -o picture.png
    vln flatten cloud.vdb cloud.nvtt
    ls -l
    test -f /usr/share/man/man1/vln.1'
}
try_module() {
  inside python3 -c '
import importlib.metadata, numpy, vln
assert importlib.metadata.version("vln") == vln.__version__, "the package tells another version than the module"
volume = vln.Volume.from_numpy(numpy.arange(512, dtype=numpy.float32).reshape(8, 8, 8), voxel_size=0.5)
volume.save("/tmp/a.vdb")
with vln.open("/tmp/a.vdb") as file:
    print("vln", vln.__version__, file, file["density"].sample([1, 1, 1]))
    assert file["density"].to_numpy().sum() == 511 * 256'
}
try_library() {
  cp -r tests/package "$place/tmp/package"
  for interop in OFF ON; do
    inside sh -euc "
      cmake -G Ninja -S /tmp/package -B /tmp/consumer-$interop -DCONSUMER_INTEROP=$interop >/tmp/consumer.log
      cmake --build /tmp/consumer-$interop >>/tmp/consumer.log || { cat /tmp/consumer.log; exit 1; }
      /tmp/consumer-$interop/consumer"
  done
  rm -rf "$place/tmp/package" "$place"/tmp/consumer-*
}
try_removal() {
  inside apt-get purge -y -q vln python3-vln 'libgeometryvolume*' >>build/deb-install.log 2>&1
  ! find "$place/usr" -iname '*geometryvolume*' -o -name '*vln*' | grep .
}

leave() {
  umount "$place/packages" "$place/proc" 2>/dev/null || true
  rmdir "$place/packages" 2>/dev/null || true
  [ -z "$temporary" ] || rm -rf --one-file-system "$temporary"
}

step "install dependencies" sh scripts/install-deps.sh --packages
if [ "$try" = yes ] && ! command -v debootstrap >/dev/null; then
  echo "deb.sh: --try needs debootstrap" >&2
  exit 1
fi
step "build the libraries and the program" build_libraries
step "build the module" build_module
step "packages" pack
if [ "$try" = yes ]; then
  temporary=
  if [ -z "$place" ]; then
    temporary=$(mktemp -d)
    place=$temporary/root
  fi
  trap leave EXIT
  step "a minimal Debian 12" make_root
  mkdir -p "$place/packages"
  mount -t proc proc "$place/proc"
  mount --bind "$packages" "$place/packages"
  step "install the program and the module" install_users
  step "run the program" try_program
  step "run the module" try_module
  step "install the development files, a compiler and CMake" install_developers
  step "build and run a project that uses the library" try_library
  step "remove the packages" try_removal
fi
