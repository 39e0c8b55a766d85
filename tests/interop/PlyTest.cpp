// Points of .ply files: good ones, bad ones, and what a file cannot make the reader do.
#include "Interop/Ply.h"
#include "Interop/FileError.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <random>

using namespace VLN::Interop;
using VLN::Test::TempFolder;

namespace {

PointSet parse(std::string const& content, PlyOptions const& options = {1.0, 64}) {
  return parsePly("test.ply", content.data(), content.size(), options);
}
std::string errorOf(std::string const& content) {
  try {
    parse(content);
  } catch (FileError const& error) {
    EXPECT_EQ(std::string(error.what()), "test.ply: " + error.reason());
    EXPECT_EQ(error.reason().find('\n'), std::string::npos);
    return error.reason();
  }
  return "no error";
}
std::string header(std::string const& format, std::string const& rest) {
  return "ply\nformat " + format + " 1.0\n" + rest + "end_header\n";
}
std::string const kXyz = "property float x\nproperty float y\nproperty float z\n";
template <class T> std::string bytesOf(T v, bool big = false) {
  std::string s(reinterpret_cast<char const*>(&v), sizeof v);
  if (big) std::reverse(s.begin(), s.end());
  return s;
}
template <class T> T number(PointSet const& set, std::size_t attribute, std::size_t point) {
  return set.attributes.at(attribute).value<T>(point);
}

TEST(Ply, TextWithEveryScalarType) {
  auto const set = parse(
      header("ascii", "comment made by hand\nobj_info none\nelement vertex 2\n" + kXyz +
                          "property char a\nproperty uint8 b\nproperty int16 c\nproperty ushort d\n"
                          "property int e\nproperty uint32 f\nproperty float32 g\nproperty double h\n") +
      "1 2.5 -3e2 -128 255 -32768 65535 -2147483648 4294967295 0.1 0.1\n"
      "+4 5 6   127\t0 1 2 3 4\r\n1e-3 -7");
  ASSERT_EQ(set.size(), 2u);
  EXPECT_EQ(set.positions[0], (Velorn::Math::float3{1, 2.5f, -300}));
  EXPECT_EQ(set.positions[1], (Velorn::Math::float3{4, 5, 6}));
  std::vector<std::string> types;
  for (auto const& a : set.attributes) types.push_back(a.name + ":" + a.type);
  EXPECT_EQ(types, (std::vector<std::string>{"a:int8", "b:uint8", "c:int16", "d:uint16", "e:int32",
                                             "f:uint32", "g:float", "h:double"}));
  EXPECT_EQ(number<signed char>(set, 0, 0), -128);
  EXPECT_EQ(number<unsigned char>(set, 1, 0), 255);
  EXPECT_EQ(number<unsigned short>(set, 3, 0), 65535);
  EXPECT_EQ(number<unsigned>(set, 5, 0), 4294967295u);
  EXPECT_EQ(number<float>(set, 6, 0), 0.1f);
  EXPECT_EQ(number<double>(set, 7, 0), 0.1);
  EXPECT_EQ(number<signed char>(set, 0, 1), 127);
  EXPECT_EQ(number<double>(set, 7, 1), -7);
}

TEST(Ply, BinaryOfBothByteOrders) {
  for (bool const big : {false, true}) {
    std::string content = header(
        big ? "binary_big_endian" : "binary_little_endian",
        "element camera 1\nproperty list uchar int path\nproperty double t\nelement vertex 2\nproperty uchar "
        "red\n" +
            kXyz +
            "property list int float weights\nproperty short s\nelement face 1\nproperty list uchar int v\n");
    content += bytesOf<std::uint8_t>(2) + bytesOf(7, big) + bytesOf(8, big) + bytesOf(0.5, big);
    for (int n = 0; n < 2; ++n) {
      content += bytesOf<std::uint8_t>(static_cast<std::uint8_t>(200 + n));
      for (float const c : {1.5f, -2.25f, 3e5f}) content += bytesOf(c + static_cast<float>(n), big);
      content += bytesOf(n, big);
      if (n == 1) content += bytesOf(9.0f, big);
      content += bytesOf(static_cast<short>(-300 - n), big);
    }
    auto const set = parse(content); // the face is missing, and not looked at
    ASSERT_EQ(set.size(), 2u);
    EXPECT_EQ(set.positions[1], (Velorn::Math::float3{2.5f, -1.25f, 300001.0f}));
    EXPECT_EQ(set.attributes.size(), 2u) << "lists are left out";
    EXPECT_EQ(number<unsigned char>(set, 0, 1), 201);
    EXPECT_EQ(number<short>(set, 1, 1), -301);
  }
}

TEST(Ply, NoPoints) {
  EXPECT_EQ(parse(header("ascii", "element vertex 0\n" + kXyz)).size(), 0u);
  EXPECT_EQ(parse(header("binary_little_endian", "element vertex 0\n" + kXyz), {}).voxelSize, 1.0);
}

TEST(Ply, DoublePositionsAreTakenNearAnOrigin) {
  auto const set =
      parse(header("ascii", "element vertex 2\nproperty double x\nproperty double y\nproperty double z\n") +
                "637377.01 851977.02 400.03 637378.01 851979.02 400.53\n",
            {0.25, 64});
  EXPECT_TRUE(set.doublePositions);
  EXPECT_NEAR(set.world(0).x, 637377.01, 1e-6);
  EXPECT_NEAR(set.world(1).y, 851979.02, 1e-6);
  EXPECT_EQ(std::fmod(set.origin.x, 1.0), 0.0) << "tiles stay where they would be";
}

TEST(Ply, TheVoxelSizeGivesAboutSoManyPointsPerTile) {
  std::mt19937 random(1);
  std::uniform_real_distribution<double> unit(0, 100);
  std::vector<Velorn::Math::double3> world;
  for (int n = 0; n < 20000; ++n) world.push_back({unit(random), unit(random), unit(random)});
  for (double const wanted : {4.0, 8.0, 64.0, 1000.0}) {
    double const size = chooseVoxelSize(world, wanted);
    EXPECT_EQ(std::exp2(std::round(std::log2(size))), size) << "a power of two";
    double const held = 20000 * std::pow(4 * size / 100, 3);
    EXPECT_GT(held, wanted / 8);
    EXPECT_LT(held, wanted * 8);
  }
  EXPECT_EQ(chooseVoxelSize({}, 64), 1);
  EXPECT_EQ(chooseVoxelSize({{1, 2, 3}}, 64), 1);
  EXPECT_TRUE(std::isfinite(chooseVoxelSize({{NAN, 0, 0}, {1e308, 0, 0}, {-1e308, 0, 0}}, 1)));
  // A thousand points at one place end somewhere.
  EXPECT_GT(chooseVoxelSize(std::vector<Velorn::Math::double3>(1000, {0.5, 0.5, 0.5}), 1), 0);
  world.assign(1000, {0.5, 0.5, 0.5});
  world.push_back({9, 9, 9});
  EXPECT_GT(chooseVoxelSize(world, 1), 0);
}

// regression: the origin was taken to lie near a coordinate of a point that has another one which is no
// number, and the other points lost their digits
TEST(Ply, PointsThatAreNowhereDoNotMoveTheOrigin) {
  auto const set = parse(header("ascii", "element vertex 3\nproperty double x\nproperty double y\n"
                                         "property double z\n") +
                         "1 2 3.25\nnan 0 1e30\n-1 0.5 inf\n");
  ASSERT_EQ(set.size(), 3u);
  EXPECT_EQ(set.world(0), (Velorn::Math::double3{1, 2, 3.25}));
}

// regression: a voxel so small that its inverse was infinite put points nowhere
TEST(Ply, PointsNextToZeroStaySomewhere) {
  std::string content = header("binary_little_endian", "element vertex 130\nproperty double x\n"
                                                       "property double y\nproperty double z\n");
  for (int n = 0; n < 130; ++n) content += bytesOf(n % 2 ? 5e-324 : 0.0) + bytesOf(0.0) + bytesOf(0.0);
  auto const set = parse(content, {});
  ASSERT_EQ(set.size(), 130u);
  EXPECT_GT(set.voxelSize, 0);
  EXPECT_TRUE(std::isfinite(1 / set.voxelSize));
  for (auto const& p : set.positions) EXPECT_TRUE(std::isfinite(p.x) && std::isfinite(p.y)) << p.x;
}

// regression: a point that a float puts a little further out than the largest double was written as infinite
TEST(Ply, RegressionPointsAtTheEndOfDoublesStaySomewhere) {
  constexpr int kPoints = 200;
  std::string content =
      header("binary_little_endian", "element vertex " + std::to_string(kPoints) +
                                         "\nproperty double x\nproperty double y\nproperty double z\n");
  for (int n = 0; n < kPoints; ++n)
    content += bytesOf(0.0) + bytesOf(n == 0 ? 0.0 : std::numeric_limits<double>::max() * (1 - 1e-9 * n)) +
               bytesOf(0.0);
  auto const set = parse(content, {});
  ASSERT_EQ(set.size(), std::size_t(kPoints));
  for (std::size_t n = 0; n < set.size(); ++n) EXPECT_TRUE(std::isfinite(set.world(n).y)) << n;
}

TEST(Ply, WhatIsWrittenReadsBackExactly) {
  TempFolder folder;
  std::mt19937 random(2);
  std::uniform_real_distribution<float> along(-1e4f, 1e4f);
  std::string content =
      header("binary_little_endian",
             "element vertex 500\n" + kXyz + "property uchar red\nproperty float w\nproperty uint id\n");
  for (unsigned n = 0; n < 500; ++n) {
    for (int a = 0; a < 4; ++a) {
      if (a == 3) content += bytesOf<std::uint8_t>(static_cast<std::uint8_t>(n));
      content += bytesOf(along(random));
    }
    content += bytesOf(n * 8000000u);
  }
  auto const set = parse(content, {}); // a voxel size of its own choice
  writePly(folder / "out.ply", set);
  auto const again = readPly(folder / "out.ply");
  EXPECT_EQ(again.voxelSize, set.voxelSize);
  ASSERT_EQ(again.size(), set.size());
  for (std::size_t n = 0; n < set.size(); ++n) EXPECT_EQ(again.positions[n], set.positions[n]);
  ASSERT_EQ(again.attributes.size(), 3u);
  for (std::size_t a = 0; a < 3; ++a) {
    EXPECT_EQ(again.attributes[a].name, set.attributes[a].name);
    EXPECT_EQ(again.attributes[a].type, set.attributes[a].type);
    EXPECT_EQ(again.attributes[a].bytes, set.attributes[a].bytes);
  }
}

TEST(Ply, MalformedFilesEndInOneLine) {
  std::string const vertex = "element vertex 2\n" + kXyz;
  std::string const text = "1 2 3\n4 5 6\n";
  EXPECT_EQ(errorOf(""), "is empty");
  EXPECT_EQ(errorOf("hello, world"), "is not a .ply file");
  EXPECT_EQ(errorOf("ply\n"), "is truncated: its header does not end");
  EXPECT_EQ(errorOf("ply\nformat ascii 1.0\n" + vertex), "is truncated: its header does not end");
  EXPECT_EQ(errorOf("ply\n" + vertex + "end_header\n" + text), "does not tell its format");
  EXPECT_EQ(errorOf(header("utf8", vertex)), "has the unknown format 'utf8'");
  EXPECT_EQ(errorOf(header("ascii", "wat 3\n")), "has a header line that is not known: 'wat 3'");
  EXPECT_EQ(errorOf(header("ascii", "element face 0\n")), "has no element 'vertex'");
  EXPECT_EQ(errorOf(header("ascii", "property float x\n")), "has a property before the first element");
  EXPECT_EQ(errorOf(header("ascii", "element vertex 1\nproperty quad x\n")),
            "has a property of the unknown type 'quad'");
  EXPECT_EQ(errorOf(header("ascii", "element vertex 1\nproperty float x\nproperty float y\n") + "1 2\n"),
            "has vertices without 'z'");
  EXPECT_EQ(errorOf(header("ascii", "element vertex 1\n" + kXyz + "property int x\n")),
            "has the property 'x' twice");
  EXPECT_EQ(errorOf(header("ascii", vertex + vertex)), "has the element 'vertex' twice");
  for (std::string const count : {"-1", "x", "1e9", "99999999999999999999999", "", "2 2"})
    EXPECT_NE(errorOf(header("ascii", "element vertex " + count + "\n" + kXyz)), "no error") << count;
  std::string const missing = "is truncated: data that its header announces is missing";
  EXPECT_EQ(errorOf(header("ascii", vertex) + "1 2 3\n4 5"), missing);
  EXPECT_EQ(errorOf(header("binary_little_endian", vertex) + std::string(23, '\0')), missing);
  for (std::string const huge : {"1000000000", "18446744073709551615", "9223372036854775807"}) {
    for (char const* format : {"ascii", "binary_little_endian", "binary_big_endian"}) {
      EXPECT_EQ(errorOf(header(format, "element vertex " + huge + "\n" + kXyz) + text), missing);
      EXPECT_EQ(
          errorOf(header(format, "element face " + huge + "\nproperty list uchar int v\n" + vertex) + text),
          missing);
    }
  }
  EXPECT_EQ(errorOf(header("ascii", "element void 1000000000\n" + vertex) + text),
            "has an element without properties: 'void'");
  EXPECT_EQ(errorOf(header("ascii", vertex) + "1 2 3\n4 five 6\n"), "has a value that is no number: 'five'");
  EXPECT_EQ(errorOf(header("ascii", "element vertex 1\n" + kXyz + "property uchar r\n") + "1 2 3 256\n"),
            "has a value that its type does not hold: '256'");
  EXPECT_EQ(errorOf(header("ascii", "element vertex 1\n" + kXyz + "property int r\n") + "1 2 3 1.5\n"),
            "has a value that its type does not hold: '1.5'");
  EXPECT_EQ(errorOf(header("binary_little_endian", "element f 1\nproperty list int int v\n" + vertex) +
                    bytesOf(-5) + std::string(100, '\0')),
            "has a list of a bad length");
  EXPECT_EQ(errorOf(header("binary_little_endian", "element f 1\nproperty list uint double v\n" + vertex) +
                    bytesOf(0xffffffffu) + std::string(100, '\0')),
            missing);
  EXPECT_NE(errorOf("ply\ncomment " + std::string(100000, 'c') + "\n"), "no error");
  std::string many = "element vertex 1\n" + kXyz;
  for (int n = 0; n < 300; ++n) many += "property float p" + std::to_string(n) + "\n";
  EXPECT_EQ(errorOf(header("ascii", many)), "has too many properties");
}

TEST(Ply, FilesThatAreNone) {
  TempFolder folder;
  for (std::string const& path : {folder / "missing.ply", folder.path(), std::string("/dev/zero")})
    EXPECT_THROW(readPly(path), FileError) << path;
}

TEST(Ply, DamagedFilesNeverDoMoreThanFail) {
  std::string const binary =
      header("binary_little_endian", "element f 2\nproperty list uchar int v\nelement vertex 4\n" + kXyz +
                                         "property uchar r\nproperty double t\n") +
      std::string(200, '\x02');
  std::string const text = header("ascii", "element vertex 3\n" + kXyz + "property short s\n") +
                           "1 2 3 4\n5 6 7 8\n-1e3 nan inf 12\n";
  std::mt19937 random(3);
  auto const below = [&](std::size_t n) { return static_cast<std::size_t>(random() % n); };
  int read = 0, refused = 0;
  for (int n = 0; n < 20000; ++n) {
    std::string content = n % 2 ? text : binary;
    for (std::size_t damage = 1 + below(4); damage > 0 && !content.empty(); --damage) {
      switch (below(5)) {
      case 0:
        content[below(content.size())] = static_cast<char>(random());
        break;
      case 1:
        content.resize(below(content.size() + 1));
        break;
      case 2:
        content.erase(below(content.size()), 1 + below(8));
        break;
      case 3:
        content.insert(below(content.size()), std::string(1 + below(20), "0123456789 \n-e.\xff"[below(16)]));
        break;
      case 4: {
        std::size_t const from = below(content.size());
        content.insert(below(content.size()), content.substr(from, below(40)));
        break;
      }
      }
    }
    try {
      auto const set = parse(content, {});
      ++read;
      ASSERT_LE(set.size(), content.size());
      for (auto const& a : set.attributes) ASSERT_EQ(a.bytes.size(), set.size() * a.valueSize);
    } catch (FileError const& error) {
      ++refused;
      ASSERT_EQ(std::string(error.what()).find('\n'), std::string::npos);
    }
  }
  EXPECT_GT(read, 100);
  EXPECT_GT(refused, 100);
}

} // namespace
