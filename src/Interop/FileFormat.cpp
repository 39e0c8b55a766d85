#include "Interop/FileFormat.h"

#include "Interop/FileError.h"
#include "Interop/OmeZarrWrite.h"
#include "Interop/OutputFile.h"
#include "Interop/OutputFolder.h"
#include "Interop/OutputTargetImpl.h"
#include "Interop/VtkHdfWrite.h"

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <vector>

namespace VLN::Interop {

namespace {

struct Row {
  FileFormat format;
  char const* suffix;
  FileContent read, written; ///< any number of bits
};
// By suffix: the order of lists.
constexpr Row kTable[] = {
    {FileFormat::kCsv, ".csv", {}, FileContent::kValues},
    {FileFormat::kExr, ".exr", {}, FileContent::kRenderings},
    {FileFormat::kHtml, ".html", {}, FileContent::kPages},
    {FileFormat::kJson, ".json", {}, FileContent::kParameters},
    {FileFormat::kNpz, ".npz", FileContent::kVolumes, FileContent::kDense | FileContent::kExports},
    {FileFormat::kNvdb, ".nvdb", FileContent::kVolumes, FileContent::kVolumes | FileContent::kExports},
    {FileFormat::kNvtt, ".nvtt", FileContent::kVolumes | FileContent::kFlatBuffers,
     FileContent::kVolumes | FileContent::kFlatBuffers},
    {FileFormat::kObj, ".obj", FileContent::kVolumes, FileContent::kBoxes | FileContent::kPoints},
    {FileFormat::kPly, ".ply", FileContent::kVolumes | FileContent::kPoints,
     FileContent::kVolumes | FileContent::kPoints | FileContent::kPointData | FileContent::kExports},
    {FileFormat::kPng, ".png", {}, FileContent::kPictures | FileContent::kRenderings},
    {FileFormat::kStl, ".stl", FileContent::kVolumes, {}},
    {FileFormat::kUsda, ".usda", {}, FileContent::kVolumes | FileContent::kExports},
    {FileFormat::kVdb, ".vdb", FileContent::kVolumes | FileContent::kGrids | FileContent::kPoints,
     FileContent::kVolumes | FileContent::kGrids | FileContent::kPoints | FileContent::kPointData |
         FileContent::kExports},
    {FileFormat::kVti, ".vti", FileContent::kVolumes, FileContent::kDense | FileContent::kExports},
    {FileFormat::kVtkHdf, ".vtkhdf", {}, FileContent::kVolumes | FileContent::kExports},
    {FileFormat::kZarr, ".zarr", {}, FileContent::kDense | FileContent::kExports},
};

Row const* rowOf(FileFormat format) {
  for (Row const& row : kTable)
    if (row.format == format) return &row;
  return nullptr;
}

char const* nameOf(FileContent content) {
  switch (content) {
  case FileContent::kVolumes:
  case FileContent::kExports:
    return "volumes";
  case FileContent::kGrids:
    return "grids";
  case FileContent::kFlatBuffers:
    return "flat buffers";
  case FileContent::kPoints:
    return "points";
  case FileContent::kBoxes:
    return "boxes";
  case FileContent::kPictures:
  case FileContent::kRenderings:
    return "pictures";
  case FileContent::kParameters:
    return "parameters";
  case FileContent::kValues:
    return "values";
  case FileContent::kDense:
    return "dense boxes";
  case FileContent::kPointData:
    return "points";
  case FileContent::kPages:
    return "pages";
  }
  return "";
}

std::string lowerSuffix(std::string const& path) {
  // Names of folders may end with slashes.
  std::string suffix =
      std::filesystem::path(path.substr(0, path.find_last_not_of('/') + 1)).extension().string();
  std::transform(suffix.begin(), suffix.end(), suffix.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return suffix;
}

std::vector<char const*> suffixes(FileContent content, FileContent Row::*set) {
  std::vector<char const*> list;
  for (Row const& row : kTable)
    if (row.*set & content) list.push_back(row.suffix);
  return list;
}
std::string listOf(std::vector<char const*> const& suffixes) {
  std::string list;
  for (std::size_t n = 0; n < suffixes.size(); ++n)
    list += (n == 0 ? "" : n + 1 == suffixes.size() ? " or " : ", ") + std::string(suffixes[n]);
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
  Row const* const row = rowOf(format);
  return row ? row->suffix : "";
}

bool isRead(FileFormat format, FileContent content) {
  Row const* const row = rowOf(format);
  return row && row->read & content;
}
bool isWritten(FileFormat format, FileContent content) {
  Row const* const row = rowOf(format);
  return row && row->written & content;
}
std::string suffixesRead(FileContent content) { return listOf(suffixes(content, &Row::read)); }
std::string suffixesWritten(FileContent content) { return listOf(suffixes(content, &Row::written)); }

FileFormat checkOutputFor(FileContent content, std::string const& path) {
  FileFormat const format = formatOf(path);
  bool const fits = isWritten(format, content);
  auto const possible = suffixes(content, &Row::written);
  // What names without a suffix, pipes and devices get.
  FileFormat const standard = content == FileContent::kRenderings ? FileFormat::kPng
                              : content == FileContent::kExports  ? FileFormat::kVdb
                              : possible.size() == 1 ? formatOf(std::string("a") + possible.front())
                                                     : FileFormat::kUnknown;
  if (!fits &&
      (standard == FileFormat::kUnknown || !(lowerSuffix(path).empty() || findOutputTarget(path).straight)))
    throw FileError(path, std::string(nameOf(content)) + " are written as " + listOf(possible));
  if (fits && format == FileFormat::kVtkHdf && !writesVtkHdf())
    throw FileError(path, "this build writes no .vtkhdf files: it was made without HDF5");
  if (fits && format == FileFormat::kZarr)
    checkOutputFolder(path, kZarrMark);
  else
    checkOutput(path);
  return fits ? format : standard;
}

} // namespace VLN::Interop
