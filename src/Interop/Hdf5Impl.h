// Hdf5: the calls into HDF5. For the writer of .vtkhdf files alone.
//
// The library is looked for when a file is written. Linked, it would bring thirty others along (for files on
// servers), and every start of a program would wait for them.
#pragma once

#include <string>

#include <hdf5.h>

// Macros of its header that call it, where constants are asked for.
#undef H5OPEN
#define H5OPEN
#undef H5CHECK
#define H5CHECK

#define VLN_FOR_EACH_HDF5_FUNCTION(X)                                                                        \
  X(H5Aclose)                                                                                                \
  X(H5Acreate2)                                                                                              \
  X(H5Awrite)                                                                                                \
  X(H5Dclose)                                                                                                \
  X(H5Dcreate2)                                                                                              \
  X(H5Dwrite)                                                                                                \
  X(H5Eget_auto2)                                                                                            \
  X(H5Eset_auto2)                                                                                            \
  X(H5Fclose)                                                                                                \
  X(H5Fcreate)                                                                                               \
  X(H5Fflush)                                                                                                \
  X(H5Fget_file_image)                                                                                       \
  X(H5Fget_vfd_handle)                                                                                       \
  X(H5Gclose)                                                                                                \
  X(H5Gcreate2)                                                                                              \
  X(H5Pclose)                                                                                                \
  X(H5Pcreate)                                                                                               \
  X(H5Pset_chunk)                                                                                            \
  X(H5Pset_deflate)                                                                                          \
  X(H5Pset_fapl_core)                                                                                        \
  X(H5Pset_obj_track_times)                                                                                  \
  X(H5Sclose)                                                                                                \
  X(H5Screate)                                                                                               \
  X(H5Screate_simple)                                                                                        \
  X(H5Sselect_hyperslab)                                                                                     \
  X(H5Tclose)                                                                                                \
  X(H5Tcopy)                                                                                                 \
  X(H5Tset_size)                                                                                             \
  X(H5Tset_strpad)                                                                                           \
  X(H5get_libversion)                                                                                        \
  X(H5open)

/// Identifiers, which have values once the library is open.
#define VLN_FOR_EACH_HDF5_ID(X)                                                                              \
  X(H5P_CLS_DATASET_CREATE_ID_g)                                                                             \
  X(H5P_CLS_FILE_ACCESS_ID_g)                                                                                \
  X(H5P_CLS_GROUP_CREATE_ID_g)                                                                               \
  X(H5T_C_S1_g)                                                                                              \
  X(H5T_IEEE_F64LE_g)                                                                                        \
  X(H5T_NATIVE_DOUBLE_g)                                                                                     \
  X(H5T_NATIVE_FLOAT_g)                                                                                      \
  X(H5T_NATIVE_INT8_g)                                                                                       \
  X(H5T_NATIVE_INT16_g)                                                                                      \
  X(H5T_NATIVE_INT32_g)                                                                                      \
  X(H5T_NATIVE_INT64_g)                                                                                      \
  X(H5T_NATIVE_UINT8_g)                                                                                      \
  X(H5T_NATIVE_UINT16_g)                                                                                     \
  X(H5T_NATIVE_UINT32_g)                                                                                     \
  X(H5T_NATIVE_UINT64_g)                                                                                     \
  X(H5T_STD_I32LE_g)                                                                                         \
  X(H5T_STD_I64LE_g)

namespace VLN::Interop {

/// The names of the library's own, so that code of a class derived from this reads as if it were linked.
struct Hdf5 {
#define VLN_MEMBER(name) decltype(&::name) name;
  VLN_FOR_EACH_HDF5_FUNCTION(VLN_MEMBER)
#undef VLN_MEMBER
#define VLN_MEMBER(name) hid_t name;
  VLN_FOR_EACH_HDF5_ID(VLN_MEMBER)
#undef VLN_MEMBER

  /// Finds the library at the first call.
  /// @param path The file that it is for.
  /// @error FileError where it is not there, or is not the one that this was compiled for.
  static Hdf5 const& load(std::string const& path);
};

} // namespace VLN::Interop
