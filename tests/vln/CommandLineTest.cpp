// How the program takes its command line, and how it behaves towards the shell around it.
#include "support/VlnProgram.h"

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <thread>

#include <pty.h>
#include <sys/stat.h>

namespace {

using namespace VLN::Test;

class CommandLineTest : public testing::Test {
protected:
  std::string torus(std::string const& voxels = "20000") {
    std::string path = m_folder / "torus.vdb";
    EXPECT_EQ(vln({"make", "torus", path, "--voxels", voxels}).code, 0);
    return path;
  }
  static RunResult shell(std::string const& line) { return runProgram({"/bin/sh", "-c", line}); }
  static std::string program() { return std::string("'") + VLN_PROGRAM + "'"; }

  TempFolder m_folder;
};

// requirement: a misspelt word is met with the one that was probably meant
TEST_F(CommandLineTest, RequirementNamesWhatWasProbablyMeant) {
  std::string const more = " (vln --help tells more)";
  expectFailure(vln({"inof", "a.vdb"}), "there is no command 'inof'; did you mean 'info'?" + more);
  expectFailure(vln({"sliec"}), "there is no command 'sliec'; did you mean 'slice'?" + more);
  expectFailure(vln({"frobnicate"}), "there is no command 'frobnicate'" + more);
  expectFailure(vln({"slice", "a.vdb", "--chanel", "d", "--axis", "x", "-o", "p.png"}),
                "there is no option '--chanel'; did you mean '--channel'?" + more);
  expectFailure(vln({"points", "a.ply", "--voxelsize=3", "-o", "p.vdb"}),
                "there is no option '--voxelsize'; did you mean '--voxel-size'?" + more);
}

// regression: nan and infinities were taken as numbers
TEST_F(CommandLineTest, RegressionNumbersAreFinite) {
  for (std::string const bad : {"nan", "inf", "-inf", "NaN", "infinity", "1e999"})
    for (auto const& arguments : std::vector<std::vector<std::string>>{
             {"slice", "a.vdb", "--channel", "d", "--axis", "x", "-o", "p.png", "--at", bad},
             {"probe", "a.vdb", "--channel", "d", "1", "2", bad},
             {"points", "a.ply", "-o", "b.vdb", "--voxel-size", bad},
             {"points", "a.ply", "-o", "b.vdb", "--points-per-tile", bad},
             {"points", "a.ply", "-o", "b.obj", "--size", bad},
             {"advect", "a.ply", "--velocity", "0", bad, "0"}}) {
      RunResult const run = vln(arguments);
      EXPECT_EQ(run.code, 1);
      EXPECT_EQ(run.err.find("No such file"), std::string::npos) << run.err;
      EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
    }
}

// negative: a name that promises another format than the one that would be written
TEST_F(CommandLineTest, NegativeSuffixesFitTheFormat) {
  std::string const path = torus();
  expectFailure(vln({"slice", path, "--channel", "surface", "--axis", "x", "-o", m_folder / "a.jpg"}),
                (m_folder / "a.jpg") + ": pictures are written as .png");
  expectFailure(vln({"convert", path, m_folder / "a.png"}),
                (m_folder / "a.png") +
                    ": volumes are written as .npz, .nvdb, .ply, .usda, .vdb, .vti, .vtkhdf or .zarr");
  expectFailure(vln({"make", "cloud", m_folder / "a.png"}),
                (m_folder / "a.png") + ": grids are written as .vdb");
  expectFailure(vln({"tiles", path, "--depth", "28", "-o", m_folder / "a.stl"}),
                (m_folder / "a.stl") + ": boxes are written as .obj");
  EXPECT_EQ(vln({"convert", path, m_folder / "A.VDB"}).code, 0);
  EXPECT_EQ(vln({"convert", path, m_folder / "bare"}).code, 0);
}

// regression: as root this replaced the link in /dev by a file
TEST_F(CommandLineTest, RegressionStandardOutputTakesAFile) {
  std::string const path = torus(), file = m_folder / "a.png", log = m_folder / "log";
  std::string const slice = program() + " slice '" + path + "' --channel surface --axis z --size 64 -o ";
  ASSERT_EQ(shell(slice + "'" + file + "'").code, 0);
  RunResult const piped = shell(slice + "/dev/stdout | cat > '" + log + "'");
  EXPECT_EQ(piped.code, 0);
  EXPECT_TRUE(readAll(log) == readAll(file));
  EXPECT_EQ(piped.err.rfind("surface at z", 0), 0u) << piped.err;
  RunResult const redirected = shell(slice + "/dev/stdout > '" + log + "'");
  EXPECT_EQ(redirected.code, 0);
  EXPECT_TRUE(readAll(log) == readAll(file));
  struct stat info;
  ASSERT_EQ(lstat("/dev/stdout", &info), 0);
  EXPECT_TRUE(S_ISLNK(info.st_mode));
}

// regression: OBJ files were said to be written where the disk was full
TEST_F(CommandLineTest, RegressionAFullDiskIsTold) {
  std::string const path = torus(), obj = m_folder / "tiles.obj";
  writeAll(obj, "good"), writeAll(m_folder / "tile_tree.mtl", "fine");
  RunResult const run =
      shell("ulimit -f 8; " + program() + " tiles '" + path + "' --depth 28 -o '" + obj + "'");
  EXPECT_EQ(run.code, 1);
  EXPECT_EQ(run.err, "vln: " + obj + ": cannot be written: File too large\n");
  EXPECT_EQ(readAll(obj), "good");
  EXPECT_EQ(readAll(m_folder / "tile_tree.mtl"), "fine");
  if (!std::filesystem::exists("/dev/full")) return;
  std::filesystem::create_symlink("/dev/full", m_folder / "full.obj");
  expectFailure(vln({"tiles", path, "--depth", "28", "-o", m_folder / "full.obj"}),
                (m_folder / "full.obj") + ": cannot be written: No space left on device");
}

// regression: the handler of interrupts took the place of nohup's
TEST_F(CommandLineTest, RegressionNohupIsHonoured) {
  std::string const path = m_folder / "cloud.vdb";
  for (bool const ignored : {false, true}) {
    RunResult const run = shell((ignored ? "trap '' HUP; " : "") + program() + " make cloud '" + path +
                                (ignored ? "' --voxels 300000" : "' --voxels 30000000") +
                                " & p=$!; sleep 0.1; kill -HUP $p; wait $p");
    if (ignored)
      EXPECT_EQ(run.code, 0) << run.err;
    else
      EXPECT_EQ(run.code, 128 + SIGHUP) << run.err;
    EXPECT_EQ(m_folder.names().size(), ignored ? 1u : 0u);
  }
}

// requirement: a reader that has what it wanted gets no complaint
TEST_F(CommandLineTest, RequirementAReaderMayGoAway) {
  std::string const path = torus();
  std::string points;
  for (int n = 0; n < 50000; ++n) points += "0.5,0.25,0\n";
  writeAll(m_folder / "p.csv", points);
  RunResult const run = shell(program() + " probe '" + path + "' --channel surface --points '" +
                              (m_folder / "p.csv") + "' | head -n 1");
  EXPECT_EQ(run.out, "x,y,z,value,gx,gy,gz\n");
  EXPECT_EQ(run.err, "");
}

// requirement: the manual page and the completions know every command and its options
TEST_F(CommandLineTest, RequirementManualAndCompletions) {
  RunResult const manual = vln({"manual"});
  EXPECT_EQ(manual.code, 0) << manual.err;
  EXPECT_EQ(manual.out.rfind(".TH VLN 1", 0), 0u);
  for (std::string const command : {"info", "slice", "render", "view", "convert", "probe", "make", "churn",
                                    "points", "tiles", "advect", "completions"})
    EXPECT_NE(manual.out.find(".SS vln " + command), std::string::npos) << command;
  EXPECT_NE(manual.out.find("\\-\\-percentile \\fIP\\fR"), std::string::npos) << manual.out;
  for (std::string const shell : {"bash", "zsh", "fish"}) {
    RunResult const script = vln({"completions", shell});
    EXPECT_EQ(script.code, 0) << script.err;
    EXPECT_NE(script.out.find("percentile"), std::string::npos);
    EXPECT_EQ(script.out.find("manual"), std::string::npos) << "a command for the build alone";
  }
  std::string const script = m_folder / "completions";
  writeAll(script, vln({"completions", "bash"}).out);
  RunResult const completed =
      runProgram({"/bin/bash", "-c",
                  ". '" + script + "'; COMP_WORDS=(vln slice --chan); COMP_CWORD=2; _vln; " +
                      "echo \"${COMPREPLY[@]}\"; COMP_WORDS=(vln sl); COMP_CWORD=1; _vln; " +
                      "echo \"${COMPREPLY[@]}\""});
  EXPECT_EQ(completed.out, "--channel\nslice\n") << completed.err;
}

// regression: after the import the bar of convert began again
TEST_F(CommandLineTest, RegressionProgressNeverGoesBack) {
  std::string const path = torus("3000000"), copy = m_folder / "copy.vdb";
  int terminal = -1;
  pid_t const child = forkpty(&terminal, nullptr, nullptr, nullptr);
  ASSERT_GE(child, 0);
  if (child == 0) {
    execl(VLN_PROGRAM, "vln", "convert", path.c_str(), copy.c_str(), nullptr);
    _exit(127);
  }
  // The bar shows by the clock: the program is held up again and again, so that a fast machine takes as long.
  std::atomic<bool> ended = false;
  std::thread brake([&] {
    while (!ended) {
      kill(-child, SIGSTOP);
      std::this_thread::sleep_for(std::chrono::milliseconds(55));
      kill(-child, SIGCONT);
      std::this_thread::sleep_for(std::chrono::milliseconds(4));
    }
  });
  std::string shown;
  char block[4096];
  for (ssize_t n; (n = read(terminal, block, sizeof block)) > 0;)
    shown.append(block, static_cast<std::size_t>(n));
  ended = true;
  brake.join();
  int status = 0;
  waitpid(child, &status, 0);
  close(terminal);
  EXPECT_EQ(status, 0) << shown;
  int last = -1, steps = 0;
  for (std::size_t at = 0; (at = shown.find("] ", at)) != std::string::npos; ++at, ++steps) {
    int const percent = std::atoi(shown.c_str() + at + 2);
    EXPECT_GE(percent, last) << shown;
    last = percent;
  }
  // Two can be compared.
  EXPECT_GE(steps, 2) << shown;
}

} // namespace
