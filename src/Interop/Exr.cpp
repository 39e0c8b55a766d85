#include "Interop/Exr.h"

#include "Interop/OutputFile.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

namespace VLN::Interop {

namespace {

// The format is little-endian, and so must the machine be: see the flat buffer.
template <class T> void put(std::string& bytes, T const& value) {
  char raw[sizeof(T)];
  std::memcpy(raw, &value, sizeof(T));
  bytes.append(raw, sizeof(T));
}
void putName(std::string& bytes, std::string const& name) { bytes.append(name).push_back('\0'); }
template <class... T>
void attribute(std::string& bytes, char const* name, char const* type, T const&... values) {
  putName(bytes, name), putName(bytes, type);
  std::string content;
  (put(content, values), ...);
  put(bytes, static_cast<std::int32_t>(content.size()));
  bytes += content;
}

} // namespace

void writeExr(std::string const& path, int width, int height, std::vector<ExrChannel> channels) {
  std::sort(channels.begin(), channels.end(), [](auto const& a, auto const& b) { return a.name < b.name; });
  std::string header;
  put(header, std::uint32_t(20000630)), put(header, std::uint32_t(2));
  std::string list;
  for (ExrChannel const& c : channels) {
    putName(list, c.name);
    put(list, std::int32_t(2)); // float
    put(list, std::int32_t(0)); // perceptually linear: no matter
    put(list, std::int32_t(1)), put(list, std::int32_t(1));
  }
  list.push_back('\0');
  putName(header, "channels"), putName(header, "chlist");
  put(header, static_cast<std::int32_t>(list.size()));
  header += list;
  std::int32_t const last[2] = {width - 1, height - 1}, zero = 0;
  attribute(header, "compression", "compression", std::uint8_t(0));
  attribute(header, "dataWindow", "box2i", zero, zero, last[0], last[1]);
  attribute(header, "displayWindow", "box2i", zero, zero, last[0], last[1]);
  attribute(header, "lineOrder", "lineOrder", std::uint8_t(0));
  attribute(header, "pixelAspectRatio", "float", 1.0f);
  attribute(header, "screenWindowCenter", "v2f", 0.0f, 0.0f);
  attribute(header, "screenWindowWidth", "float", 1.0f);
  header.push_back('\0');

  auto const row = static_cast<std::size_t>(width) * 4 * channels.size();
  std::uint64_t const first = header.size() + static_cast<std::uint64_t>(height) * 8;
  for (int y = 0; y < height; ++y) put(header, first + static_cast<std::uint64_t>(y) * (row + 8));
  OutputFile file(path);
  file.write(header);
  std::string line;
  for (int y = 0; y < height; ++y) {
    line.clear();
    put(line, static_cast<std::int32_t>(y)), put(line, static_cast<std::int32_t>(row));
    for (ExrChannel const& c : channels)
      line.append(reinterpret_cast<char const*>(c.values->data() + static_cast<std::size_t>(y) *
                                                                       static_cast<std::size_t>(width)),
                  static_cast<std::size_t>(width) * 4);
    file.write(line);
  }
  file.commit();
}

} // namespace VLN::Interop
