#include "Interop/Obj.h"

#include "Interop/FileError.h"
#include "Interop/OutputFile.h"

#include <charconv>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

// Enough for a hundredth of a millimetre at any place on the earth, and too few to show what binary fractions
// leave behind.
constexpr int kDigits = 12;

constexpr char const* kMaterials = "newmtl RED\nKa 0.914 0.813 0.664\nKd 0.914 0.813 0.664\n"
                                   "Ks 0.914 0.813 0.664\nnewmtl GREEN\nKa 0.828 0.684 0.547\n"
                                   "Kd 0.828 0.684 0.547\nKs 0.828 0.684 0.547\nnewmtl BLUE\n"
                                   "Ka 0.719 0.461 0.297\nKd 0.719 0.461 0.297\nKs 0.719 0.461 0.297\n";
constexpr char const* kMaterialNames[] = {"RED", "GREEN", "BLUE"};
constexpr char const* kMaterialFile = "tile_tree.mtl";

// Collects text for a file.
//
//        7-------8        k
//       /|      /|        |  j
//      5-------6 |        | /
//      | 3-----|-4        |/
//      |/      |/         +---- i
//      1-------2
class ObjLines {
public:
  explicit ObjLines(OutputFile& file)
      : m_file(file) {}

  void line(std::string const& text) { m_file.write(text + "\n"); }
  void vertex(double3 const& p) {
    m_text = "v";
    for (int a = 0; a < 3; ++a) number(p[a] == 0 ? 0.0 : p[a], std::chars_format::general, kDigits);
    line(m_text);
  }
  /// The faces of the box whose first vertex is `base`, counted from 1; its corners have i fastest.
  void boxFaces(std::int64_t base) {
    static constexpr int kFaces[6][4] = {{0, 1, 5, 4}, {1, 3, 7, 5}, {4, 5, 7, 6},
                                         {0, 4, 6, 2}, {1, 0, 2, 3}, {3, 2, 6, 7}};
    for (auto const& face : kFaces) {
      m_text = "f";
      for (int const corner : face) number(base + corner);
      line(m_text);
    }
  }

private:
  template <class... How> void number(How... how) {
    char text[64];
    auto const end = std::to_chars(text, text + sizeof text, how...).ptr;
    m_text += ' ';
    m_text.append(text, end);
  }

  OutputFile& m_file;
  std::string m_text;
};

template <class Body> void forTiles(PointContainer const& tree, int depth, Body const& body) {
  for (std::int64_t n = 0; n < tree.tileCount(depth); ++n)
    if (auto const& tile = tree.tile(n, depth); tile.valid()) body(tile);
}

} // namespace

void writePointsObj(std::string const& path, PointVolume const& volume, double half) {
  OutputFile file(path);
  ObjLines text(file);
  auto const positions = volume.object->component<PositionChannel>(kPositionsName);
  std::int64_t base = 1;
  for (auto const& p : std::as_const(*positions)) {
    for (int corner = 0; corner < 8; ++corner) {
      double3 at;
      for (int a = 0; a < 3; ++a)
        at[a] = volume.origin[a] + volume.voxelSize * double(p[a]) + (corner >> a & 1 ? half : -half);
      text.vertex(at);
    }
    text.boxFaces(base);
    base += 8;
  }
  file.commit();
}

std::int64_t writeTilesObj(std::string const& path, std::vector<PlacedTree> const& trees, int depth) {
  OutputFile file(path);
  ObjLines text(file);
  if (!file.straight()) text.line(std::string("mtllib ") + kMaterialFile);
  std::int64_t base = 1;
  for (PlacedTree const& placed : trees) {
    if (trees.size() > 1) text.line("o " + oneLine(placed.name, 60));
    forTiles(*placed.tree, depth, [&](auto const& t) {
      for (int corner = 0; corner < 8; ++corner) {
        auto const at = [&](int bit, int low) {
          return double(low) + (corner & bit ? t.tileVoxelWidth() : 0);
        };
        text.vertex(placed.indexToWorld.toWorld({at(1, t.ti()), at(2, t.tj()), at(4, t.tk())}));
      }
    });
    forTiles(*placed.tree, depth, [&](auto const& t) {
      // One step along any axis changes the sum by one: tiles that share a face differ.
      auto const place = [&](int c) { return PointTraits::quotient(PointTraits::offset(c), t.depth()); };
      if (!file.straight())
        text.line(std::string("usemtl ") +
                  kMaterialNames[(place(t.ti()) + place(t.tj()) + place(t.tk())) % 3]);
      text.boxFaces(base);
      base += 8;
    });
  }
  if (file.straight()) {
    file.commit();
  } else {
    OutputFile materials(path.substr(0, path.rfind('/') + 1) + kMaterialFile);
    materials.write(kMaterials);
    materials.finish();
    file.finish();
    materials.commit();
    file.commit();
  }
  return (base - 1) / 8;
}

} // namespace VLN::Interop
