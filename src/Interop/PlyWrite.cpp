#include "Interop/ElementScalar.h"
#include "Interop/OutputFile.h"
#include "Interop/Ply.h"

#include <limits>
#include <type_traits>

namespace VLN::Interop {

namespace {

/// A property as the file has it: a component of an attribute, or of the position.
struct Column {
  PointAttribute const* attribute;
  std::size_t offset, size;
  bool narrow; ///< a 64-bit integer, which the format lacks: written as a double
  bool isSigned;
};

template <class T> char const* plyType() {
  if constexpr (std::is_same_v<T, float>) return "float";
  if constexpr (std::is_same_v<T, double>) return "double";
  if constexpr (std::is_integral_v<T>) {
    constexpr bool kSigned = std::is_signed_v<T>;
    if constexpr (sizeof(T) == 1) return kSigned ? "char" : "uchar";
    if constexpr (sizeof(T) == 2) return kSigned ? "short" : "ushort";
    if constexpr (sizeof(T) == 4) return kSigned ? "int" : "uint";
  }
  return "double";
}

/// Every element type, whether this build has channels of it or not.
template <class Body> void withAnyElementType(std::string const& name, Body&& body) {
#define VLN_TRY_TYPE(type, typeName, ...)                                                                    \
  if (name == #typeName) return body.template operator()<type>();
  VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
}

void addColumns(PointAttribute const& attribute, std::string& header, std::vector<Column>& columns) {
  withAnyElementType(attribute.type, [&]<class T>() {
    using S = typename ScalarOf<T>::type;
    constexpr auto kParts = static_cast<std::size_t>(kComponentsOf<T>);
    for (std::size_t n = 0; n < kParts; ++n) {
      static constexpr char const* kAxes[] = {"_x", "_y", "_z", "_w"};
      std::string const part = kParts == 1 ? "" : kParts <= 4 ? kAxes[n] : "_" + std::to_string(n);
      header += std::string("property ") + plyType<S>() + " " + attribute.name + part + "\n";
      columns.push_back({&attribute, n * sizeof(S), sizeof(S), std::is_integral_v<S> && sizeof(S) == 8,
                         std::is_signed_v<S>});
    }
  });
}

template <class T> void put(std::string& out, T v) {
  out.append(reinterpret_cast<char const*>(&v), sizeof v);
}

} // namespace

void writePly(std::string const& path, PointSet const& points) {
  OutputFile file(path);
  char const* const real = points.doublePositions ? "double" : "float";
  std::string text =
      "ply\nformat binary_little_endian 1.0\nelement vertex " + std::to_string(points.size()) + "\n";
  for (char const axis : {'x', 'y', 'z'}) text += std::string("property ") + real + " " + axis + "\n";
  std::vector<Column> columns;
  for (PointAttribute const& attribute : points.attributes) addColumns(attribute, text, columns);
  text += "end_header\n";
  file.write(text);
  for (std::size_t n = 0; n < points.size(); ++n) {
    text.clear();
    auto const p = points.world(n);
    for (int a = 0; a < 3; ++a) {
      if (points.doublePositions)
        put(text, p[a]);
      else
        put(text, static_cast<float>(p[a]));
    }
    for (Column const& c : columns) {
      auto const* at =
          reinterpret_cast<char const*>(c.attribute->bytes.data()) + n * c.attribute->valueSize + c.offset;
      if (!c.narrow) {
        text.append(at, c.size);
        continue;
      }
      std::int64_t v;
      std::memcpy(&v, at, sizeof v);
      put(text, c.isSigned ? double(v) : double(static_cast<std::uint64_t>(v)));
    }
    file.write(text);
  }
  file.commit();
}

} // namespace VLN::Interop
