// vln render as people call it: every real file, options, and what goes wrong.
#include "GeometryVolume/volume/Volume.h"
#include "Interop/VolumeIo.h"
#include "support/PngReader.h"
#include "support/RealVolumes.h"
#include "support/TempFolder.h"
#include "support/TurnedRamp.h"
#include "support/VlnProgram.h"

#include <cmath>
#include <cstring>
#include <filesystem>
#include <fstream>

namespace VLN::Test {
namespace {

using Interop::Image;
using Interop::Rgb;

constexpr Rgb kNeutral{0x6b, 0x72, 0x7a};

std::string bytesOf(std::string const& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

// Pixels that differ from the background, and their box.
struct Drawn {
  int count = 0, left = 1 << 20, right = -1, top = 1 << 20, bottom = -1;
};
Drawn drawn(Image const& image, Rgb background = kNeutral) {
  Drawn d;
  for (int y = 0; y < image.height(); ++y)
    for (int x = 0; x < image.width(); ++x) {
      Rgb const c = image(x, y);
      if (std::abs(c.r - background.r) + std::abs(c.g - background.g) + std::abs(c.b - background.b) < 6)
        continue;
      ++d.count;
      d.left = std::min(d.left, x), d.right = std::max(d.right, x);
      d.top = std::min(d.top, y), d.bottom = std::max(d.bottom, y);
    }
  return d;
}

class RenderProgramTest : public testing::Test {
protected:
  std::string torus() {
    std::string const path = m_folder / "torus.vdb";
    EXPECT_EQ(vln({"make", "torus", path, "--voxels", "20000"}).code, 0);
    return path;
  }
  std::string cloud() {
    std::string const path = m_folder / "cloud.vdb";
    EXPECT_EQ(vln({"make", "cloud", path, "--voxels", "20000"}).code, 0);
    return path;
  }
  RunResult render(std::string const& file, std::vector<std::string> more, std::string const& out = "p.png") {
    more.insert(more.begin(), {"render", file, "--size", "96x80", "-o", m_folder / out});
    RunResult run = vln(more);
    EXPECT_EQ(run.code, 0) << run.err;
    return run;
  }
  Image picture(std::string const& file, std::vector<std::string> more = {}) {
    render(file, std::move(more));
    return readPng(m_folder / "p.png");
  }

  TempFolder m_folder;
};

class RenderRealTest : public RenderProgramTest, public testing::WithParamInterface<char const*> {};
INSTANTIATE_TEST_SUITE_P(Files, RenderRealTest, realVolumes(), volumeName);

// requirement: with no option but its name every file shows something that fills its picture
TEST_P(RenderRealTest, RequirementShowsSomething) {
  std::string const data = VLN_TEST_DATA_DIR;
  if (data.empty()) GTEST_SKIP() << "no real input files";
  Image const image = picture(data + "/vdb/" + GetParam());
  Drawn const d = drawn(image);
  EXPECT_GT(d.count, 96 * 80 / 20);
  EXPECT_GT(std::max((d.right - d.left) / 96.0, (d.bottom - d.top) / 80.0), 0.7);
  EXPECT_GT(d.left, 0);
  EXPECT_LT(d.right, 95);
}

// requirement: the camera that is printed puts the picture back
TEST_F(RenderProgramTest, RequirementCameraCanBeRepeated) {
  std::string const file = torus();
  RunResult const first = render(file, {"--camera-azimuth-angle", "33", "--camera-elevation-angle", "20",
                                        "--camera-zoom-factor", "1.25"});
  std::string const before = bytesOf(m_folder / "p.png");
  auto const at = first.out.find("camera: ");
  ASSERT_NE(at, std::string::npos);
  std::istringstream words(first.out.substr(at + 8));
  std::vector<std::string> camera;
  for (std::string word; words >> word;) camera.push_back(word);
  ASSERT_EQ(camera.size(), 8u);
  Image const a = readPng(m_folder / "p.png"), b = picture(file, camera);
  int differ = 0;
  for (int y = 0; y < a.height(); ++y)
    for (int x = 0; x < a.width(); ++x) differ += std::abs(a(x, y).g - b(x, y).g) > 8;
  EXPECT_LT(differ, 8);
}

// requirement: the same bytes at any number of threads
TEST_F(RenderProgramTest, RequirementSameForAnyNumberOfThreads) {
  for (std::string const& file : {torus(), cloud()})
    for (std::string const quality : {"preview", "final"}) {
      std::string first;
      for (std::string const threads : {"1", "2", "8"}) {
        render(file, {"--threads", threads, "--quality", quality, "--spp", "2"});
        std::string const bytes = bytesOf(m_folder / "p.png");
        if (first.empty()) first = bytes;
        EXPECT_EQ(bytes, first) << file << " " << quality << " " << threads;
      }
    }
}

// requirement: a .nvtt file shows what the file that it came from shows
TEST_F(RenderProgramTest, RequirementFlatFilesLookTheSame) {
  std::string const file = torus(), flat = m_folder / "torus.nvtt";
  Image const expected = picture(file, {"--camera-position", "2,1,6", "--camera-focal-point", "0,0,0"});
  for (std::vector<std::string> const& options : {std::vector<std::string>{},
                                                  {"--halo", "1"},
                                                  {"--coalesce"},
                                                  {"--halo", "1", "--textures"},
                                                  {"--quantise", "fp16"}}) {
    std::vector<std::string> flatten{"flatten", file, flat};
    flatten.insert(flatten.end(), options.begin(), options.end());
    ASSERT_EQ(vln(flatten).code, 0);
    Image const got = picture(flat, {"--camera-position", "2,1,6", "--camera-focal-point", "0,0,0"});
    int differ = 0;
    for (int y = 0; y < got.height(); ++y)
      for (int x = 0; x < got.width(); ++x) differ += std::abs(got(x, y).g - expected(x, y).g) > 8;
    EXPECT_LT(differ, 40) << (options.empty() ? "" : options.back());
  }
}

// requirement: voxels that are no cubes and turned grids are drawn as they stand in the world
TEST_F(RenderProgramTest, RequirementAnyTransform) {
  auto const grid = turnedRamp(); // 24 x 16 x 16 voxels of 0.5 x 1 x 0.25, turned by 0.6 about z
  std::string const path = m_folder / "ramp.vdb";
  openvdb::io::File(path).write({grid});
  Drawn const d = drawn(picture(path, {"--camera-direction", "-z", "--opacity", "constant", "--background",
                                       "#000000", "--opacity-unit", "0.2"}),
                        {0, 0, 0});
  // Of the box of 12 x 16 turned, as wide as its corners stand apart.
  double const wide = 12 * std::cos(0.6) + 16 * std::sin(0.6), tall = 12 * std::sin(0.6) + 16 * std::cos(0.6);
  EXPECT_NEAR(double(d.right - d.left) / (d.bottom - d.top), wide / tall, 0.08);
}

// requirement
TEST_F(RenderProgramTest, RequirementKeepsOpacity) {
  std::string const file = cloud();
  render(file, {"--background", "none"});
  std::string const png = bytesOf(m_folder / "p.png");
  EXPECT_EQ(png[25], 6); // colour type: RGBA
  render(file, {});
  EXPECT_EQ(bytesOf(m_folder / "p.png")[25], 2);
}

// requirement: each mode, map and opacity draws something of its own
TEST_F(RenderProgramTest, RequirementModesDiffer) {
  std::string const file = cloud();
  std::vector<std::string> seen;
  for (std::vector<std::string> const& options : {std::vector<std::string>{},
                                                  {"--mode", "mip"},
                                                  {"--mode", "mean"},
                                                  {"--mode", "isosurface"},
                                                  {"--iso", "0.2"},
                                                  {"--cmap", "inferno"},
                                                  {"--cmap", "turbo"},
                                                  {"--opacity", "sigmoid"},
                                                  {"--opacity", "0:0,0.5:1"},
                                                  {"--clim", "0.2,0.5"},
                                                  {"--log", "--clim", "0.01,1"},
                                                  {"--opacity-unit", "0.5"},
                                                  {"--light", "1,0,0"},
                                                  {"--background", "white"},
                                                  {"--axes"},
                                                  {"--cmap", "magma", "--scalar-bar"},
                                                  {"--quality", "final", "--spp", "2"},
                                                  {"--camera-view-up", "z"},
                                                  {"--camera-direction", "1,0,0"}}) {
    render(file, options);
    std::string const bytes = bytesOf(m_folder / "p.png");
    EXPECT_EQ(std::count(seen.begin(), seen.end(), bytes), 0) << (options.empty() ? "" : options.back());
    seen.push_back(bytes);
    Drawn const d = drawn(readPng(m_folder / "p.png"));
    EXPECT_GT(d.count, 200) << (options.empty() ? "" : options.back());
  }
}

// requirement
TEST_F(RenderProgramTest, RequirementTurntableAndParameters) {
  std::string const file = torus(), json = m_folder / "p.json";
  render(file, {"--turntable", "3", "--parameters", json, "--mode", "surface"});
  std::string last;
  for (std::string const name : {"p_0001.png", "p_0002.png", "p_0003.png"}) {
    std::string const bytes = bytesOf(m_folder / name);
    EXPECT_GT(bytes.size(), 500u) << name;
    EXPECT_NE(bytes, last);
    last = bytes;
  }
  EXPECT_FALSE(std::filesystem::exists(m_folder / "p.png"));
  auto const parameters = nlohmann::json::parse(bytesOf(json));
  EXPECT_EQ(parameters["mode"], "surface");
  EXPECT_EQ(parameters["channel"], "surface");
  EXPECT_EQ(parameters["size"][1], 80);
  EXPECT_EQ(parameters["camera"]["position"].size(), 3u);
  for (char const* name : {"component", "depth", "light", "occlusion_rays", "samples_asked", "time_limit",
                           "scalar_bar", "axes", "turntable"})
    EXPECT_TRUE(parameters.contains(name)) << name;
  EXPECT_EQ(parameters["turntable"], 3);
  EXPECT_NEAR(parameters["light"][0].get<double>() * parameters["light"][0].get<double>() +
                  parameters["light"][1].get<double>() * parameters["light"][1].get<double>() +
                  parameters["light"][2].get<double>() * parameters["light"][2].get<double>(),
              1, 1e-6);
}

// requirement: an .exr file holds light, opacity, normals and depth
TEST_F(RenderProgramTest, RequirementOpenExr) {
  std::string const file = torus();
  render(file, {"--camera-direction", "-z"}, "p.exr");
  std::string const exr = bytesOf(m_folder / "p.exr");
  auto const word = [&](std::size_t at) {
    std::int32_t v = 0;
    std::memcpy(&v, exr.data() + at, 4);
    return v;
  };
  ASSERT_GT(exr.size(), 96u * 80 * 8 * 4);
  EXPECT_EQ(word(0), 20000630);
  EXPECT_EQ(word(4), 2);
  std::size_t const names = exr.find("chlist");
  std::string const list = exr.substr(names, 180);
  std::size_t at = 0;
  for (std::string const name : {"A", "B", "G", "N.X", "N.Y", "N.Z", "R", "Z"}) {
    std::size_t const found = list.find(name + std::string(1, '\0'), at);
    EXPECT_NE(found, std::string::npos) << name;
    at = found;
  }
  // The last line is 80 pixels of eight channels, the tenth from the end of the file on.
  std::size_t const line = 8 + 96 * 8 * 4, first = exr.size() - 80 * line;
  EXPECT_EQ(word(first), 0);
  EXPECT_EQ(word(first + 4), 96 * 8 * 4);
  std::size_t const row = first + 40 * line;
  EXPECT_EQ(word(row), 40);
  int solid = 0;
  for (std::size_t x = 0; x < 96; ++x) {
    float v[8];
    for (std::size_t c = 0; c < 8; ++c) std::memcpy(&v[c], exr.data() + row + 8 + (c * 96 + x) * 4, 4);
    if (v[0] == 0) {
      EXPECT_TRUE(std::isinf(v[7]));
      continue;
    }
    EXPECT_NEAR(v[3] * v[3] + v[4] * v[4] + v[5] * v[5], 1, 1e-3);
    EXPECT_TRUE(v[7] > 1 && v[7] < 20) << v[7];
    ++solid;
  }
  EXPECT_GT(solid, 20);
}

// requirement
TEST_F(RenderProgramTest, RequirementPointsAreDiscs) {
  std::string const path = m_folder / "two.ply";
  std::ofstream(path)
      << "ply\nformat ascii 1.0\nelement vertex 3\nproperty float x\nproperty float y\nproperty float z\n"
         "property uchar red\nproperty uchar green\nproperty uchar blue\nend_header\n"
         "0 0 0 255 0 0\n4 0 0 0 255 0\n0 0 4 0 0 255\n";
  Image const image = picture(path, {"--camera-direction", "y", "--background", "black"});
  int red = 0, green = 0, blue = 0;
  for (int y = 0; y < image.height(); ++y)
    for (int x = 0; x < image.width(); ++x) {
      Rgb const c = image(x, y);
      red += c.r > 200 && c.g<50, green += c.g> 200 && c.r<50, blue += c.b> 200 && c.r < 50;
    }
  for (int count : {red, green, blue}) EXPECT_NEAR(count, red, 0.3 * red);
  EXPECT_GT(red, 20);
}

// regression: names that are filters, or none, or longer than a flat buffer keeps
TEST_F(RenderProgramTest, RegressionChannelsMayHaveAnyName) {
  for (std::string const& name :
       {std::string("a b"), std::string("my-density"), std::string("a*"), std::string(300, 'n')}) {
    TileTree3D::Volume volume;
    auto other = volume.addField<float>("a", 0), field = volume.addField<float>(name, 0);
    other.set(0, 0, 0, 1);
    for (int i = 0; i < 8; ++i) field.set(i, i, 0, 1);
    std::string const path = m_folder / "names.vdb";
    Interop::save(volume, path);
    EXPECT_GT(drawn(picture(path, {"--channel", name})).count, 20) << name;
  }
}

// regression: final paths and marches that stood still, a scalar bar without height
TEST_F(RenderProgramTest, RegressionExtremesEnd) {
  TileTree3D::Volume volume;
  volume.addField<float>("density", 0).set(0, 0, 0, 1);
  std::string const path = m_folder / "one.vdb", out = m_folder / "p.png";
  Interop::save(volume, path);
  for (std::string const unit : {"0.001", "0.01", "1e9"})
    for (std::string const quality : {"preview", "final"})
      EXPECT_EQ(
          vln({"render", path, "--opacity-unit", unit, "--quality", quality, "--size", "8x8", "-o", out})
              .code,
          0)
          << unit;
  EXPECT_EQ(vln({"render", path, "--opacity-unit", "1e-30", "-o", m_folder / "q.png"}).code, 1);
  EXPECT_EQ(vln({"render", path, "--mode", "mip", "--scalar-bar", "--size", "2x2", "-o", out}).code, 0);
  EXPECT_EQ(render(path, {"--mode", "mip", "--log"}).code, 0);
}

// regression: points that are nowhere left the camera nowhere
TEST_F(RenderProgramTest, RegressionPointsThatAreNowhereAreLeftOut) {
  std::string const path = m_folder / "points.ply";
  auto const write = [&](std::string const& rows) {
    std::ofstream(path) << "ply\nformat ascii 1.0\nelement vertex 3\nproperty double x\nproperty double y\n"
                           "property double z\nend_header\n" +
                               rows;
  };
  write("nan 0 0\n0 0 0\n1 1 1\n");
  EXPECT_GT(drawn(picture(path, {})).count, 4);
  write("nan 0 0\ninf 0 0\n0 1e308 0\n");
  expectFailure(vln({"render", path, "-o", m_folder / "q.png"}),
                path + ": has no points that could be drawn");
}

// regression: devices were refused, and JSON was mixed with remarks
TEST_F(RenderProgramTest, RegressionStandardOutput) {
  std::string const file = torus();
  RunResult const image = vln({"render", file, "--size", "16x16", "-o", "/dev/stdout"});
  EXPECT_EQ(image.code, 0) << image.err;
  EXPECT_EQ(image.out.substr(1, 3), "PNG");
  RunResult const json =
      vln({"render", file, "--size", "16x16", "-o", m_folder / "p.png", "--parameters", "/dev/stdout"});
  EXPECT_EQ(json.out.front(), '{');
  EXPECT_EQ(json.out.substr(json.out.size() - 2), "}\n");
  expectFailure(vln({"render", file, "--turntable", "2", "-o", "/dev/stdout"}),
                "/dev/stdout: several pictures are written as .exr or .png files");
}

// negative: one line, exit code 1, and no picture
TEST_F(RenderProgramTest, NegativeWhatCannotBeDrawn) {
  std::string const file = torus(), out = m_folder / "p.png";
  auto const refused = [&](std::vector<std::string> more, std::string const& says) {
    more.insert(more.begin(), {"render", file, "-o", out});
    RunResult const run = vln(more);
    EXPECT_EQ(run.code, 1) << says;
    EXPECT_EQ(run.out, "");
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
    EXPECT_NE(run.err.find(says), std::string::npos) << run.err;
    EXPECT_FALSE(std::filesystem::exists(out)) << says;
  };
  refused({"--channel", "none"}, "has no channel 'none'; it has surface");
  refused({"--component", "y"}, "no component");
  refused({"--iso", "99"}, "no surface");
  refused({"--size", "0x5"}, "is no size");
  refused({"--size", "99999x5"}, "is no size");
  refused({"--size", "12"}, "is no size");
  refused({"--clim", "2,1"}, "is no range");
  refused({"--clim", "nan,1"}, "is no range");
  refused({"--log", "--clim", "-1,1", "--mode", "mip"}, "above 0");
  refused({"--opacity", "0:0,1"}, "is no opacity");
  refused({"--background", "mauve"}, "is no background");
  refused({"--background", "#12345g"}, "is no background");
  refused({"--camera-position", "1,2"}, "is no vector");
  refused({"--camera-direction", "0,0,0"}, "has no length");
  refused({"--camera-direction", "y"}, "up direction");
  refused({"--camera-position", "1,1,1", "--camera-focal-point", "1,1,1"}, "stands where it looks");
  refused({"--camera-view-angle", "180"}, "--camera-view-angle");
  refused({"--camera-zoom-factor", "nan"}, "not a finite number");
  refused({"--spp", "0"}, "--spp");
  refused({"--cmap", "rainbow"}, "--cmap");
  refused({"--mode", "xray"}, "--mode");
  expectFailure(vln({"render", file, "-o", m_folder / "p.jpg"}),
                m_folder / "p.jpg" + std::string(": pictures are written as .exr or .png"));
  EXPECT_EQ(vln({"render", m_folder / "nothing.vdb", "-o", out}).code, 1);
}

} // namespace
} // namespace VLN::Test
