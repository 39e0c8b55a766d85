#include "Interop/FileFormat.h"

#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/OutputTargetImpl.h"

#include <algorithm>
#include <cctype>
#include <filesystem>

namespace VLN::Interop {

namespace {

struct Row {
  FileFormat format;
  char const* suffix;
};
constexpr Row kTable[] = {
    {FileFormat::kVdb, ".vdb"},   {FileFormat::kNvtt, ".nvtt"}, {FileFormat::kPly, ".ply"},
    {FileFormat::kObj, ".obj"},   {FileFormat::kPng, ".png"},   {FileFormat::kCsv, ".csv"},
    {FileFormat::kJson, ".json"}, {FileFormat::kExr, ".exr"},
};

std::string lowerSuffix(std::string const& path) {
  std::string suffix = std::filesystem::path(path).extension().string();
  std::transform(suffix.begin(), suffix.end(), suffix.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return suffix;
}

// "as .obj, .ply or .vdb".
std::string listOf(std::initializer_list<FileFormat> formats) {
  std::string list;
  std::size_t left = formats.size();
  for (FileFormat const format : formats) {
    list += suffixOf(format);
    if (--left > 0) list += left == 1 ? " or " : ", ";
  }
  return list;
}

} // namespace

FileFormat formatOf(std::string const& path) {
  std::string const suffix = lowerSuffix(path);
  for (Row const& row : kTable)
    if (suffix == row.suffix) return row.format;
  return FileFormat::kUnknown;
}

char const* suffixOf(FileFormat format) {
  for (Row const& row : kTable)
    if (row.format == format) return row.suffix;
  return "";
}

FileFormat checkOutputAs(std::string const& path, char const* what,
                         std::initializer_list<FileFormat> formats) {
  FileFormat const format = formatOf(path);
  bool const fits = std::find(formats.begin(), formats.end(), format) != formats.end();
  bool const only = formats.size() == 1;
  if (!fits && !(only && (lowerSuffix(path).empty() || findOutputTarget(path).straight)))
    throw FileError(path, std::string(what) + " are written as " + listOf(formats));
  checkOutput(path);
  return fits ? format : *formats.begin();
}

} // namespace VLN::Interop
