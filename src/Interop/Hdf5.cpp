// HDF5, found while the program runs.
#ifdef VLN_HDF5

#include "Interop/FileError.h"
#include "Interop/Hdf5Impl.h"

#include <dlfcn.h>

namespace VLN::Interop {

namespace {

/// VLN_HDF5 is the name that the library has for the loader.
Hdf5 loadNow() {
  // Never closed: it keeps what it has opened in tables of the process.
  void* const library = dlopen(VLN_HDF5, RTLD_NOW | RTLD_LOCAL);
  if (!library) throw std::runtime_error("the library HDF5 (" VLN_HDF5 ") cannot be loaded");
  auto const find = [&](char const* name) {
    if (void* const found = dlsym(library, name)) return found;
    throw std::runtime_error(std::string("the library HDF5 (" VLN_HDF5 ") lacks ") + name);
  };
  Hdf5 out;
#define VLN_FIND(name) out.name = reinterpret_cast<decltype(out.name)>(find(#name));
  VLN_FOR_EACH_HDF5_FUNCTION(VLN_FIND)
#undef VLN_FIND
  unsigned major = 0, minor = 0, release = 0;
  if (out.H5open() < 0 || out.H5get_libversion(&major, &minor, &release) < 0 || major != H5_VERS_MAJOR ||
      minor != H5_VERS_MINOR)
    throw std::runtime_error("the library HDF5 (" VLN_HDF5 ") is version " + std::to_string(major) + "." +
                             std::to_string(minor) + ", not " + std::to_string(H5_VERS_MAJOR) + "." +
                             std::to_string(H5_VERS_MINOR));
#define VLN_FIND(name) out.name = *static_cast<hid_t const*>(find(#name));
  VLN_FOR_EACH_HDF5_ID(VLN_FIND)
#undef VLN_FIND
  return out;
}

} // namespace

Hdf5 const& Hdf5::load(std::string const& path) {
  try {
    static Hdf5 const loaded = loadNow();
    return loaded;
  } catch (std::runtime_error const& e) { throw FileError(path, e.what()); }
}

} // namespace VLN::Interop

#endif
