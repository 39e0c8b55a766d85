// Files when memory ends: .vdb and .nvtt, read and written.
#ifdef VLN_TEST_INTEROP

#include "Faults.h"

#include "GeometryVolume/channels/Channel.h"
#include "Interop/FileError.h"
#include "Interop/Flatten.h"
#include "Interop/NvttRead.h"
#include "Interop/NvttWrite.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbImport.h"
#include "Interop/VdbMake.h"
#include "Interop/VolumeFile.h"
#include "support/TempFolder.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <memory>
#include <string>
#include <unistd.h>

namespace {

using namespace VLN::Interop;
using test::faults::After;
using test::faults::everyAllocation;
using Field = VLN::TileTree3D::Channel<VLN::TileTree3D::PowerOfTwoTraits, float, 4, 0>;

std::string folder() {
  static VLN::Test::TempFolder const temporary;
  return temporary.path();
}
std::string torus() {
  static std::string const path = [] {
    std::string const file = folder() + "/torus.vdb";
    makeTorus(file, kFewestMadeVoxels);
    return file;
  }();
  return path;
}
std::shared_ptr<VdbImport> imported() {
  static auto const content = std::make_shared<VdbImport>(importVdb(torus()));
  return content;
}
std::string stateOf(VdbImport const& content) {
  std::string text;
  for (auto const& v : content.volumes)
    for (auto const& c : v.channels) {
      auto const channel = v.object->component<Field>(c.name);
      double sum = 0;
      if (channel)
        for (float const x : *channel) sum += double(x);
      text += c.name + ' ' + std::to_string(channel ? channel->size() : 0) + ' ' + std::to_string(sum) + ';';
    }
  return text;
}
/// Files in the folder: one that could not be finished leaves none behind.
std::string stateOfFile(std::string const& name) {
  std::string text;
  int others = 0;
  for (auto const& entry : std::filesystem::directory_iterator(folder())) {
    if (entry.path().filename() == name)
      text = std::to_string(std::hash<std::string>()(VLN::Test::readAll(entry.path().string())));
    else
      ++others;
  }
  return text + " beside " + std::to_string(others);
}

TEST(FileFaults, RequirementImport) {
  torus();
  test::faults::OpenVdbSpared const spared;
  struct Read {
    VdbImport content;
  };
  everyAllocation<Read>("import", {[] { return Read(); },
                                   [](Read& r) { r.content = importVdb(torus()); },
                                   [](Read const& r) { return stateOf(r.content); },
                                   After::kUnchanged,
                                   {},
                                   8,
                                   true});
}
TEST(FileFaults, RegressionTheChildThatReadsHasNoMemory) {
  // It tells so, and ends: what is thrown in it must not go on as a second copy of this process.
  torus();
  pid_t const self = getpid();
  std::int64_t refused = 0;
  for (std::int64_t n = 1;; n = test::faults::nextTry(n, 5)) {
    test::faults::ArmedChildren const armed(n);
    try {
      probeVdbFile(torus());
      break;
    } catch (FileError const& error) {
      ++refused;
      EXPECT_FALSE(error.reason().empty());
    }
    if (getpid() != self) _exit(1);
  }
  EXPECT_GT(refused, 5);
}
TEST(FileFaults, RequirementExport) {
  imported();
  test::faults::OpenVdbSpared const spared;
  struct Written {};
  everyAllocation<Written>("export", {[] {
                                        std::filesystem::remove(folder() + "/export.vdb");
                                        return Written();
                                      },
                                      [](Written&) { exportVdb(*imported(), folder() + "/export.vdb"); },
                                      [](Written const&) { return stateOfFile("export.vdb").substr(0, 1); },
                                      After::kUsable,
                                      {},
                                      8,
                                      true});
}
TEST(FileFaults, RequirementFlatFiles) {
  struct Written {};
  auto const flat = std::make_shared<FlatVolume>(flattenVolume(*imported()->volumes[0].object, {}));
  std::string const path = folder() + "/flat.nvtt";
  everyAllocation<Written>("flat file written",
                           {[=] {
                              std::filesystem::remove(path);
                              return Written();
                            },
                            [=](Written&) {
                              writeNvtt(path, {flat->buffer.data(), flat->buffer.size()});
                            },
                            [](Written const&) { return stateOfFile("flat.nvtt"); },
                            After::kUnchanged,
                            {},
                            30,
                            true});
  writeNvtt(path, {flat->buffer.data(), flat->buffer.size()});
  struct Mapped {
    std::unique_ptr<MappedNvtt> file;
  };
  for (auto const check : {NvttCheck::kTables, NvttCheck::kPages})
    everyAllocation<Mapped>(
        "flat file mapped",
        {[] { return Mapped(); },
         [=](Mapped& m) { m.file = std::make_unique<MappedNvtt>(path, check); },
         [](Mapped const& m) { return std::to_string(m.file ? m.file->bufferLength() : 0); },
         After::kUnchanged,
         {},
         30,
         true});
  struct Read {
    VdbImport content;
  };
  everyAllocation<Read>("flat file read", {[] { return Read(); },
                                           [=](Read& r) { r.content = importNvtt(path); },
                                           [](Read const& r) { return stateOf(r.content); },
                                           After::kUnchanged,
                                           {},
                                           30,
                                           true});
  everyAllocation<Read>("flattened", {[] { return Read(); },
                                      [](Read& r) {
                                        FlattenOptions options;
                                        options.neighbors = options.traversal = true;
                                        auto const made =
                                            flattenVolume(*imported()->volumes[0].object, options);
                                        r.content.file = std::to_string(made.buffer.size());
                                      },
                                      [](Read const& r) { return r.content.file; },
                                      After::kUnchanged,
                                      {},
                                      30,
                                      true});
}

} // namespace

#endif
