#include "Interop/RegularFileImpl.h"

#include "Interop/FileError.h"

#include <cerrno>
#include <cstring>
#include <fstream>

#include <sys/stat.h>

namespace VLN::Interop {

namespace {

std::uint64_t openRegular(std::string const& path, std::ifstream& in) {
  struct stat info;
  if (stat(path.c_str(), &info) != 0) throw FileError(path, std::strerror(errno));
  if (S_ISDIR(info.st_mode)) throw FileError(path, "is a directory");
  // A pipe or a device might never end, and cannot be read twice.
  if (!S_ISREG(info.st_mode)) throw FileError(path, "is not a regular file");
  in.open(path, std::ios::binary);
  if (!in) throw FileError(path, std::string("cannot be opened: ") + std::strerror(errno));
  return static_cast<std::uint64_t>(info.st_size);
}

} // namespace

std::uint64_t regularFileSize(std::string const& path) {
  std::ifstream in;
  std::uint64_t const size = openRegular(path, in);
  if (size == 0) throw FileError(path, "is empty");
  return size;
}

std::string regularFileContent(std::string const& path) {
  std::ifstream in;
  std::string content(openRegular(path, in), '\0');
  in.read(content.data(), static_cast<std::streamsize>(content.size()));
  content.resize(in.gcount());
  return content;
}

} // namespace VLN::Interop
