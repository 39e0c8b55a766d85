// Readers and writers while the system's calls fail on purpose.
#include "Interop/Ply.h"
#include "support/VlnProgram.h"

#include <algorithm>
#include <cerrno>
#include <map>

namespace {

using namespace VLN::Test;

struct Writer {
  std::string name;
  std::vector<std::string> arguments; ///< OUT stands for the file
};

class FaultTest : public testing::Test {
protected:
  FaultTest() {
    m_vdb = m_inputs / "in.vdb", m_ply = m_inputs / "in.ply";
    EXPECT_EQ(vln({"make", "torus", m_vdb, "--voxels", "2000"}).code, 0);
    VLN::Interop::PointSet set;
    for (int n = 0; n < 300; ++n)
      set.positions.push_back({0.1f * float(n % 7), 0.2f * float(n % 11), 0.01f * float(n)});
    VLN::Interop::writePly(m_ply, set);
    m_writers = {
        {"a.png", {"slice", m_vdb, "--channel", "surface", "--axis", "z", "--size", "32", "-o", "OUT"}},
        {"a.vdb", {"convert", m_vdb, "OUT"}},
        {"b.vdb", {"make", "cloud", "OUT", "--voxels", "2000"}},
        {"a.ply", {"points", m_ply, "-o", "OUT"}},
        {"c.vdb", {"points", m_ply, "-o", "OUT"}},
        {"a.obj", {"points", m_ply, "-o", "OUT"}},
        {"b.obj", {"tiles", m_vdb, "--depth", "28", "-o", "OUT"}},
        {"a.csv", {"probe", m_vdb, "--channel", "surface", "0", "0", "0", "-o", "OUT"}}};
  }

  RunResult run(std::vector<std::string> arguments, std::string const& fault) const {
    // The address sanitizer wants to be the first library of all, but does not need to.
    std::vector<std::string> all{"/usr/bin/env", "LD_PRELOAD=" VLN_FAILING_CALLS,
                                 "ASAN_OPTIONS=verify_asan_link_order=0", "VLN_FAULT=" + fault, VLN_PROGRAM};
    for (auto const& a : arguments) all.push_back(a);
    return runProgram(all);
  }
  RunResult write(Writer const& writer, std::string const& out, std::string const& fault) const {
    auto arguments = writer.arguments;
    std::replace(arguments.begin(), arguments.end(), std::string("OUT"), out);
    return run(arguments, fault);
  }

  TempFolder m_inputs;
  std::string m_vdb, m_ply;
  std::vector<Writer> m_writers;
};

std::map<std::string, std::string> contentOf(TempFolder const& folder) {
  std::map<std::string, std::string> content;
  for (auto const& name : folder.names()) content[name] = readAll(folder / name);
  return content;
}

void expectOneLine(RunResult const& result, std::string const& file) {
  EXPECT_EQ(result.code, 1);
  EXPECT_EQ(result.signal, 0);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err.rfind("vln: " + file, 0), 0u) << result.err;
  EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
}

// requirement: whichever call fails, once or from then on: one line, and all files as they were
TEST_F(FaultTest, RequirementWritersLeaveWhatWasThere) {
  int runs = 0;
  for (Writer const& writer : m_writers)
    for (std::string const call : {"write", "fsync", "close", "rename", "mkostemp", "fchmod"})
      for (char const* once : {"", ":once"}) {
        SCOPED_TRACE(writer.name + " " + call + once);
        TempFolder folder;
        auto const putOld = [&] {
          for (auto const& name : {writer.name, std::string("tile_tree.mtl")}) writeAll(folder / name, "old");
        };
        putOld();
        auto const before = contentOf(folder);
        // Files that are closed first show whether any could be written. They are empty, so that their faults
        // do no harm; nor do those of what the reading child was given and gives back.
        int const harmless = call == "close" && *once ? 12 : 0;
        int n = 1, failures = 0;
        for (; n < 20; ++n, ++runs) {
          int const error = call == "write" && n % 2 ? ENOSPC : EIO;
          RunResult const result = write(writer, folder / writer.name,
                                         call + ":" + std::to_string(n) + ":" + std::to_string(error) + once);
          if (result.code == 0 && n > harmless) break;
          if (result.code == 0) {
            putOld();
            continue;
          }
          ++failures;
          // Of two files that belong together the first may have its name already; it is whole then.
          bool const pair = call == "rename" && n == 2;
          expectOneLine(result, pair ? "" : folder.path());
          if (!pair) { EXPECT_TRUE(contentOf(folder) == before) << n; }
        }
        EXPECT_GT(failures, 0) << "the fault was never met";
        EXPECT_LT(n, 20);
        EXPECT_EQ(folder.names().size(), before.size());
        EXPECT_NE(readAll(folder / writer.name), "old");
      }
  RecordProperty("runs", runs);
  std::cout << runs << " runs failed on purpose\n";
}

// requirement: a file of two names gets its old content back
TEST_F(FaultTest, RequirementHardLinksGetTheirContentBack) {
  Writer const& writer = m_writers[3];
  for (std::string const call : {"write", "fsync", "close", "mkostemp", "ftruncate", "read"}) {
    SCOPED_TRACE(call);
    int const harmless = call == "close" ? 12 : 0; // see above
    int n = 1, failures = 0;
    for (; n < 40; ++n) {
      TempFolder folder;
      writeAll(folder / writer.name, std::string(10000, 'o'));
      std::filesystem::create_hard_link(folder / writer.name, folder / "other");
      RunResult const result = write(writer, folder / writer.name,
                                     call + ":" + std::to_string(n) + ":" + std::to_string(EIO) + ":once");
      std::string const now = readAll(folder / writer.name);
      EXPECT_EQ(now, readAll(folder / "other"));
      EXPECT_EQ(folder.names().size(), 2u);
      if (result.code == 0 && n > harmless) break;
      if (result.code == 0) continue;
      ++failures;
      EXPECT_EQ(std::count(result.err.begin(), result.err.end(), '\n'), 1) << result.err;
      // Closed after all was synced, the file holds either content whole.
      if (call != "close") { EXPECT_EQ(now, std::string(10000, 'o')) << n; }
    }
    EXPECT_GT(failures, 0);
    EXPECT_LT(n, 40);
  }
}

// requirement: reads that fail are one line, reads that are short change nothing
TEST_F(FaultTest, RequirementReadersTellOrGoOn) {
  std::string const csv = m_inputs / "in.csv";
  writeAll(csv, "0,0,0\n1,0,0\n0.5,0.5,0\n");
  for (auto const& arguments :
       std::vector<std::vector<std::string>>{{"info", m_vdb, "--json"},
                                             {"info", m_ply, "--json"},
                                             {"probe", m_vdb, "--channel", "surface", "--points", csv}}) {
    SCOPED_TRACE(arguments[0] + " " + arguments[1]);
    std::string const expected = vln(arguments).out;
    EXPECT_EQ(run(arguments, "short:1:0").out, expected);
    int n = 1;
    for (; n < 200; n = n < 6 ? n + 1 : n * 2) {
      RunResult const result = run(arguments, "read:" + std::to_string(n) + ":" + std::to_string(EIO));
      if (result.code == 0) {
        EXPECT_EQ(result.out, expected);
        break;
      }
      expectOneLine(result, m_inputs.path());
    }
    EXPECT_GT(n, 1);
    EXPECT_LT(n, 200);
  }
}

} // namespace
