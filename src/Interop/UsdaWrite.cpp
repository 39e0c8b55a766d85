#include "Interop/UsdaWrite.h"

#include "Interop/FileError.h"
#include "Interop/FreeNameImpl.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbDetails.h"
#include "Interop/VdbExport.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cmath>
#include <filesystem>
#include <map>
#include <set>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

std::string number(double v) {
  char digits[32];
  return {digits, std::to_chars(digits, digits + sizeof digits, v).ptr};
}

/// A name that USD takes for a prim, and that no other in `taken` has.
std::string identifier(std::string const& text, std::set<std::string>& taken) {
  std::string name;
  for (unsigned char const c : text) name += c < 128 && std::isalnum(c) ? static_cast<char>(c) : '_';
  if (name.empty() || std::isdigit(static_cast<unsigned char>(name[0]))) name.insert(0, "_");
  return freeName(name, taken);
}

std::string quoted(std::string const& text) {
  static char const* const hex = "0123456789abcdef";
  std::string result = "\"";
  for (char const c : text) {
    auto const byte = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\')
      result += std::string("\\") + c;
    else if (byte < 32 || byte == 127)
      result += std::string("\\x") + hex[byte >> 4] + hex[byte & 15];
    else
      result += c;
  }
  return result + "\"";
}

/// The box of voxels with the half voxel round their places, in the world; empty without an active voxel.
std::string extentOf(IndexBox const& box, IndexToWorld const& map) {
  if (box.empty()) return {};
  double3 low{0, 0, 0}, high{0, 0, 0};
  for (int corner = 0; corner < 8; ++corner) {
    double3 index;
    for (int a = 0; a < 3; ++a) index[a] = (corner >> a & 1 ? box.max[a] : box.min[a]) - 0.5;
    double3 const world = map.toWorld(index);
    for (int a = 0; a < 3; ++a) {
      low[a] = corner == 0 ? world[a] : std::min(low[a], world[a]);
      high[a] = corner == 0 ? world[a] : std::max(high[a], world[a]);
    }
  }
  auto const point = [](double3 const& p) {
    return "(" + number(p.x) + ", " + number(p.y) + ", " + number(p.z) + ")";
  };
  return "float3[] extent = [" + point(low) + ", " + point(high) + "]\n";
}

std::string dataType(std::string const& type) {
  static std::map<std::string, std::string> const known{
      {"int32", "int"}, {"vec3s", "float3"}, {"vec3d", "double3"}, {"vec3i", "int3"}};
  auto const found = known.find(type);
  return found == known.end() ? type : found->second;
}

std::string fieldClass(std::string const& gridClass) {
  if (gridClass == "level set") return "levelSet";
  if (gridClass == "fog volume") return "fogVolume";
  return gridClass == "staggered" ? gridClass : "unknown";
}

std::string volumeText(VdbVolume const& volume, std::string const& prim, std::string const& at,
                       std::string const& asset, std::map<std::string, int>& indices) {
  std::string relations, fields;
  std::set<std::string> taken;
  auto const details = detailsOf(volume);
  for (std::size_t n = 0; n < volume.channels.size(); ++n) {
    VdbChannel const& channel = volume.channels[n];
    std::string const name = identifier(channel.gridName, taken);
    relations += "        rel field:" + name + " = <" + at + "/" + prim + "/" + name + ">\n";
    fields += "\n        def OpenVDBAsset \"" + name + "\"\n        {\n";
    std::string const inset = "            ";
    fields += inset + "asset filePath = " + asset + "\n";
    fields += inset + "token fieldName = " + quoted(channel.gridName) + "\n";
    fields += inset + "int fieldIndex = " + std::to_string(indices[channel.gridName]++) + "\n";
    fields += inset + "token fieldDataType = \"" + dataType(channel.type) + "\"\n";
    fields += inset + "token fieldClass = \"" + fieldClass(details[n].gridClass) + "\"\n";
    if (auto const extent = extentOf(channel.activeBox, volume.indexToWorld); !extent.empty())
      fields += inset + extent;
    fields += "        }\n";
  }
  std::string text = "\n    def Volume \"" + prim + "\"\n    {\n";
  if (auto const extent = extentOf(volume.activeBox, volume.indexToWorld); !extent.empty())
    text += "        " + extent;
  return text + relations + fields + "    }\n";
}

} // namespace

void writeUsda(std::string const& path, VdbImport const& content, Progress const& progress) {
  if (content.volumes.empty()) throw FileError(path, "there is no grid to be shown");
  OutputFile out(path);
  if (out.straight()) throw FileError(path, "is no name of a file beside which a .vdb file could lie");
  std::filesystem::path beside(path);
  beside.replace_extension(".vdb");
  std::string const name = beside.filename().string();
  if (name.find_first_of("@\n\r") != std::string::npos)
    throw FileError(path, "its name cannot stand in a scene");
  std::set<std::string> top, prims;
  std::string const root = identifier(beside.stem().string(), top);
  std::string text = "#usda 1.0\n(\n    defaultPrim = \"" + root +
                     "\"\n    metersPerUnit = 1\n    upAxis = \"Y\"\n)\n\ndef Xform \"" + root +
                     "\" (\n    kind = \"component\"\n)\n{";
  std::map<std::string, int> indices;
  for (auto const& volume : content.volumes)
    text += volumeText(volume, freeName("volume", prims), "/" + root, "@./" + name + "@", indices);
  text += "}\n";
  out.write(text);
  out.finish();
  std::error_code none;
  if (content.file.empty() || !std::filesystem::equivalent(beside, content.file, none))
    exportVdb(content, beside.string(), progress);
  out.commit();
}

} // namespace VLN::Interop
