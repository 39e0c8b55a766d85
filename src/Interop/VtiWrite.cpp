#include "Interop/ArrayGridImpl.h"
#include "Interop/DenseReaderImpl.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"

#include <algorithm>
#include <charconv>
#include <cmath>

namespace VLN::Interop {

namespace {

std::string number(double v) {
  char digits[32];
  return {digits, std::to_chars(digits, digits + sizeof digits, v).ptr};
}

std::string escaped(std::string const& text) {
  std::string result;
  for (char const c : oneLine(text)) {
    switch (c) {
    case '&':
      result += "&amp;";
      break;
    case '<':
      result += "&lt;";
      break;
    case '>':
      result += "&gt;";
      break;
    case '"':
      result += "&quot;";
      break;
    default:
      result += c;
    }
  }
  return result;
}

std::string typeName(DenseReader const& reader) {
  std::string const bits = std::to_string(8 * reader.scalarBytes);
  return (reader.kind == 'f' ? "Float" : reader.kind == 'i' ? "Int" : "UInt") + bits;
}

/// The attributes Origin, Spacing and Direction of the image.
std::string placeOf(std::string const& path, DensePlan const& plan) {
  auto const& m = plan.toWorld;
  double length[3], direction[3][3];
  for (int a = 0; a < 3; ++a) {
    length[a] = std::hypot(m[0][a], m[1][a], m[2][a]);
    for (int row = 0; row < 3; ++row) direction[row][a] = m[row][a] / length[a];
  }
  for (int a = 0; a < 3; ++a) {
    int const b = (a + 1) % 3;
    double dot = 0;
    for (int row = 0; row < 3; ++row) dot += direction[row][a] * direction[row][b];
    if (!(length[a] > 0) || !(std::abs(dot) < 1e-6))
      throw FileError(path, "the transform of the volume is skewed, which .vti files cannot tell");
  }
  std::string turned;
  bool straight = true;
  for (int row = 0; row < 3; ++row)
    for (int a = 0; a < 3; ++a) {
      turned += (turned.empty() ? "" : " ") + number(direction[row][a]);
      straight = straight && direction[row][a] == (row == a ? 1 : 0);
    }
  std::string result = "Origin=\"" + number(m[0][3]) + " " + number(m[1][3]) + " " + number(m[2][3]) +
                       "\" Spacing=\"" + number(length[0]) + " " + number(length[1]) + " " +
                       number(length[2]) + "\"";
  if (!straight) result += " Direction=\"" + turned + "\"";
  return result;
}

/// What holds outside of the image: one value for each array, which readers that do not know them pass by.
std::string backgroundsOf(DensePlan const& plan) {
  std::string result = "<FieldData>\n";
  for (std::size_t n = 0; n < plan.readers.size(); ++n) {
    auto const& reader = *plan.readers[n];
    auto const background = reader.background();
    result += "<DataArray type=\"" + typeName(reader) + "\" Name=\"" + escaped(plan.names[n]) +
              ".background\" NumberOfComponents=\"" + std::to_string(reader.components) +
              "\" NumberOfTuples=\"1\" format=\"ascii\">";
    NumberType const type{reader.kind, reader.scalarBytes};
    for (int c = 0; c < reader.components; ++c) {
      auto const* const at = background.data() + c * reader.scalarBytes;
      result += " " + (reader.kind == 'f' ? number(realOf(at, type)) : std::to_string(wholeOf(at, type)));
    }
    result += " </DataArray>\n";
  }
  return result + "</FieldData>\n";
}

} // namespace

void writeVti(std::string const& path, DenseVolume const& volume, Progress const& progress) {
  DensePlan const plan = planDense(path, volume);
  std::string extent;
  for (int a = 0; a < 3; ++a)
    extent += (a ? " " : "") + std::to_string(plan.box.min[a]) + " " + std::to_string(plan.box.max[a] - 1);
  std::string header = "<?xml version=\"1.0\"?>\n<VTKFile type=\"ImageData\" version=\"1.0\" "
                       "byte_order=\"LittleEndian\" header_type=\"UInt64\">\n<ImageData WholeExtent=\"" +
                       extent + "\" " + placeOf(path, plan) + ">\n" + backgroundsOf(plan) +
                       "<Piece Extent=\"" + extent + "\">\n<PointData>\n";
  std::uint64_t offset = 0;
  auto const bytesOf = [&](DenseReader const& reader) {
    return static_cast<std::uint64_t>(plan.samples()) *
           static_cast<std::uint64_t>(reader.scalarBytes * reader.components);
  };
  for (std::size_t n = 0; n < plan.readers.size(); ++n) {
    auto const& reader = *plan.readers[n];
    header += "<DataArray type=\"" + typeName(reader) + "\" Name=\"" + escaped(plan.names[n]) +
              "\" NumberOfComponents=\"" + std::to_string(reader.components) +
              "\" format=\"appended\" offset=\"" + std::to_string(offset) + "\"/>\n";
    offset += sizeof(std::uint64_t) + bytesOf(reader);
  }
  header += "</PointData>\n</Piece>\n</ImageData>\n<AppendedData encoding=\"raw\">\n_";

  OutputFile out(path);
  out.write(header);
  std::vector<std::byte> slice;
  double const work = double(plan.readers.size()) * double(plan.count[2]);
  for (std::size_t n = 0; n < plan.readers.size(); ++n) {
    auto const& reader = *plan.readers[n];
    std::uint64_t const bytes = bytesOf(reader);
    out.write(&bytes, sizeof bytes);
    slice.resize(bytes / static_cast<std::uint64_t>(plan.count[2]));
    for (int z = plan.box.min.z; z < plan.box.max.z; ++z) {
      reader.slice(plan.box, z, volume.depth, 0, reader.components, slice.data());
      out.write(slice.data(), slice.size());
      if (progress) progress("writing", (double(n) * double(plan.count[2]) + (z - plan.box.min.z)) / work);
    }
  }
  out.write("\n</AppendedData>\n</VTKFile>\n");
  out.commit();
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
