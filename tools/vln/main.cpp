// vln: looks at volumes from the command line.
//
// Whatever goes wrong at the edges ends in one line on standard error and exit code 1.
#include "Commands.h"
#include "GeometryVolume/core/Version.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbFile.h"
#include "Interop/VdbMake.h"

#include <CLI/CLI.hpp>

#include <csignal>
#include <cstdio>
#include <exception>
#include <iostream>
#include <new>

#include <unistd.h>

namespace {

std::string versionText() {
  auto const& v = VLN::versionInfo();
  return "vln " + std::to_string(v.majorNumber) + "." + std::to_string(v.minorNumber) + "." +
         std::to_string(v.patchNumber) + " (commit " + v.commit + ", " + v.buildDate + ", OpenVDB " +
         VLN::Interop::openvdbVersion() + ")";
}

int fail(std::string const& message) {
  std::cerr << "vln: " << VLN::Interop::oneLine(message, 1000) << std::endl;
  return 1;
}

// An interrupted run leaves nothing half-written behind.
extern "C" void onInterrupt(int number) {
  VLN::Interop::removeUnfinishedOutput();
  signal(number, SIG_DFL);
  raise(number);
}

void addMemoryLimit(CLI::App& command, VLN::Interop::VdbReadLimits& limits) {
  command
      .add_option_function<std::uint64_t>(
          "--max-memory", [&limits](std::uint64_t const& mb) { limits.memoryBytes = mb * 1000000; },
          "Most memory in MB that reading the file may take (default: three quarters of what is available)")
      ->check(CLI::Range(std::uint64_t(1), std::uint64_t(1) << 40))
      ->type_name("MB");
}

struct Options {
  Vln::InfoOptions info;
  Vln::SliceOptions slice;
  Vln::ConvertOptions convert;
  Vln::ProbeOptions probe;
  Vln::MakeOptions make;
  Vln::ChurnOptions churn;
  Vln::PointsOptions points;
  Vln::TilesOptions tiles;
  Vln::AdvectOptions advect;
};

void addInfo(CLI::App& app, Vln::InfoOptions& o) {
  auto* command = app.add_subcommand("info", "Report what a volume file holds");
  command->add_option("FILE", o.file, "A .vdb or .ply file")->required();
  auto* json = command->add_flag("--json", o.json, "One JSON object instead of tables");
  command->add_flag("--memory", o.memory, "Also what accounts for memory: objects, their data, and the pools")
      ->excludes(json);
  addMemoryLimit(*command, o.limits);
  command->footer("Example:\n  vln info smoke.vdb");
  command->callback([&o] { Vln::info(o); });
}

void addSlice(CLI::App& app, Vln::SliceOptions& o) {
  auto* command = app.add_subcommand("slice", "Draw a channel on a plane as a PNG picture");
  command->add_option("FILE", o.file, "A .vdb file")->required();
  command->add_option("--channel", o.channel, "Name of the channel, as info tells it")
      ->required()
      ->type_name("NAME");
  command
      ->add_option_function<std::string>(
          "--axis", [&o](std::string const& axis) { o.plane.axis = axis[0] - 'x'; },
          "Axis that the plane stands across: x, y or z")
      ->required()
      ->check(CLI::IsMember({"x", "y", "z"}))
      ->type_name("AXIS");
  command->add_option("--at", o.plane.at, "World position on the axis (default: middle of the active voxels)")
      ->type_name("W");
  command->add_option("--size", o.plane.size, "Pixels along the longer side")
      ->check(CLI::Range(VLN::Interop::kSmallestSlice, VLN::Interop::kLargestSlice))
      ->capture_default_str()
      ->type_name("N");
  command->add_option("--depth", o.plane.depth, "Draw no tile deeper than this (default: the deepest)")
      ->check(CLI::Range(0, 28))
      ->type_name("D");
  command->add_flag("--nearest", o.plane.nearest, "Draw the nearest sample instead of blending linearly");
  command->add_flag("--gradient", o.plane.gradient, "Draw the length of the gradient")->excludes("--nearest");
  command->add_option("-o,--output", o.output, "The PNG file to write")->required()->type_name("OUT.png");
  addMemoryLimit(*command, o.limits);
  command->footer("Example:\n  vln slice smoke.vdb --channel density --axis z -o slice.png");
  command->callback([&o] { Vln::slice(o); });
}

void addConvert(CLI::App& app, Vln::ConvertOptions& o) {
  auto* command = app.add_subcommand("convert", "Write a volume file again, through the tree and back");
  command->add_option("IN", o.file, "A .vdb file")->required()->type_name("IN.vdb");
  command->add_option("OUT", o.output, "The .vdb file to write")->required()->type_name("OUT.vdb");
  addMemoryLimit(*command, o.limits);
  command->footer("Example:\n  vln convert smoke.vdb copy.vdb");
  command->callback([&o] { Vln::convert(o); });
}

void addProbe(CLI::App& app, Vln::ProbeOptions& o) {
  auto* command =
      app.add_subcommand("probe", "Print value and gradient of a channel at world positions as CSV");
  command->add_option("FILE", o.file, "A .vdb file")->required();
  command->add_option("X Y Z", o.positions, "World positions, three numbers each")->type_name("...");
  command->add_option("--channel", o.channel, "Name of the channel, as info tells it")
      ->required()
      ->type_name("NAME");
  command->add_option("--points", o.points, "A file with a line x,y,z for each position, without header")
      ->type_name("FILE.csv");
  addMemoryLimit(*command, o.limits);
  command->footer("Example:\n  vln probe smoke.vdb --channel density 0.5 1.25 -3");
  command->callback([&o] { Vln::probe(o); });
}

void addMake(CLI::App& app, Vln::MakeOptions& o) {
  auto* command = app.add_subcommand("make", "Write a generated volume");
  command->add_option("SHAPE", o.shape, "cloud (fog volume \"density\") or torus (level set \"surface\")")
      ->required()
      ->check(CLI::IsMember({"cloud", "torus"}))
      ->type_name("cloud|torus");
  command->add_option("OUT", o.output, "The .vdb file to write")->required()->type_name("OUT.vdb");
  command->add_option("--voxels", o.voxels, "About how many active voxels")
      ->check(CLI::Range(VLN::Interop::kFewestMadeVoxels, VLN::Interop::kMostMadeVoxels))
      ->capture_default_str()
      ->type_name("N");
  command->footer("Example:\n  vln make cloud cloud.vdb --voxels 1000000");
  command->callback([&o] { Vln::make(o); });
}

void addChurn(CLI::App& app, Vln::ChurnOptions& o) {
  auto* command =
      app.add_subcommand("churn", "Measure repeated work on a volume with memory pools and without");
  command->add_option("FILE", o.file, "A .vdb file")->required();
  command
      ->add_option("--limit", o.limitBytes,
                   "Resident memory that the pools hold the process to, such as 512MB (1 KB is 1024 bytes)")
      ->required()
      ->transform(CLI::AsSizeValue(false))
      ->check(CLI::Range(std::uint64_t(1) << 20, std::uint64_t(1) << 50))
      ->type_name("SIZE");
  command->add_option("--rounds", o.rounds, "How often the volume is loaded, copied, edited and dropped")
      ->check(CLI::Range(1, 1000000))
      ->capture_default_str()
      ->type_name("N");
  command->add_flag("--json", o.json, "One JSON object instead of a table");
  command->add_option("--only", o.only)->check(CLI::IsMember({"with", "without"}))->group("");
  addMemoryLimit(*command, o.limits);
  command->footer(
      "The file is read once in each run; each round builds its channels anew from what was read.\n\n"
      "Example:\n  vln churn smoke.vdb --limit 512MB --rounds 30");
  command->callback([&o] { Vln::churn(o); });
}

void addPointsInput(CLI::App& command, Vln::PointsInput& o) {
  command.add_option("FILE", o.file, "A .ply file, or a .vdb file with points")->required();
  command.add_option("--grid", o.grid, "Points grid of a .vdb file that has more than one")
      ->type_name("NAME");
  auto* size = command.add_option("--voxel-size", o.voxelSize, "World length of a voxel, for .ply files")
                   ->check(CLI::PositiveNumber)
                   ->type_name("W");
  command
      .add_option("--points-per-tile", o.pointsPerTile,
                  "Choose the voxel size of a .ply file so that a tile holds about so many points")
      ->check(CLI::Range(2.0, 1e9))
      ->capture_default_str()
      ->excludes(size)
      ->type_name("N");
  addMemoryLimit(command, o.limits);
}

void addPoints(CLI::App& app, Vln::PointsOptions& o) {
  auto* command = app.add_subcommand("points", "Write points as boxes, or into another format");
  addPointsInput(*command, o.input);
  command->add_option("-o,--output", o.output, "The file to write: .obj, .ply or .vdb")
      ->required()
      ->type_name("OUT");
  command
      ->add_option("--size", o.size,
                   "Half-width of the cubes of an .obj file (default: a quarter of a voxel)")
      ->check(CLI::PositiveNumber)
      ->type_name("W");
  command->footer("Example:\n  vln points scan.ply -o scan.vdb");
  command->callback([&o] { Vln::points(o); });
}

void addTiles(CLI::App& app, Vln::TilesOptions& o) {
  auto* command = app.add_subcommand("tiles", "Write the tiles of a depth as boxes");
  addPointsInput(*command, o.input);
  command->add_option("--depth", o.depth, "Depth of the tiles, as info tells them")
      ->required()
      ->check(CLI::Range(0, 28))
      ->type_name("D");
  command->add_option("-o,--output", o.output, "The file to write; tile_tree.mtl goes beside it")
      ->required()
      ->type_name("OUT.obj");
  command->footer("Example:\n  vln tiles smoke.vdb --depth 28 -o tiles.obj");
  command->callback([&o] { Vln::tiles(o); });
}

void addAdvect(CLI::App& app, Vln::AdvectOptions& o) {
  auto* command =
      app.add_subcommand("advect", "Move points, each step into the tiles where they then belong");
  addPointsInput(*command, o.input);
  command->add_option("--velocity", o.velocity, "World vector of a step")
      ->required()
      ->expected(3)
      ->type_name("X Y Z");
  command->add_option("--steps", o.steps, "Number of steps")
      ->check(CLI::Range(0, 1000000))
      ->capture_default_str()
      ->type_name("N");
  command->add_option("-o,--output", o.output, "Write the moved points: .obj, .ply or .vdb")
      ->type_name("OUT");
  command->add_flag("--json", o.json, "One JSON object instead of text");
  command->footer("Example:\n  vln advect scan.ply --velocity 0.1 0 0 --steps 100");
  command->callback([&o] { Vln::advect(o); });
}

} // namespace

int main(int argc, char** argv) {
  for (int number : {SIGINT, SIGTERM, SIGHUP}) signal(number, onInterrupt);
  // A reader that goes away (vln info FILE | head) is an error to be told, not a death.
  signal(SIGPIPE, SIG_IGN);

  CLI::App app("Looks at sparse volumes: what a file holds, and what it looks like.", "vln");
  app.set_version_flag("--version", versionText());
  app.set_help_flag("-h,--help", "Show this help");
  app.set_help_all_flag("--help-all", "Show the help of all commands");
  app.require_subcommand(1);
  app.footer("Examples:\n"
             "  vln info smoke.vdb\n"
             "  vln slice smoke.vdb --channel density --axis z -o slice.png\n"
             "  vln convert smoke.vdb copy.vdb\n"
             "  vln probe smoke.vdb --channel density 0.5 1.25 -3\n"
             "  vln make cloud cloud.vdb --voxels 1000000\n"
             "  vln churn smoke.vdb --limit 512MB --rounds 30\n"
             "\n'vln COMMAND --help' tells the options of a command.");
  Options options;
  addInfo(app, options.info);
  addSlice(app, options.slice);
  addConvert(app, options.convert);
  addProbe(app, options.probe);
  addMake(app, options.make);
  addChurn(app, options.churn);
  addPoints(app, options.points);
  addTiles(app, options.tiles);
  addAdvect(app, options.advect);

  try {
    app.parse(argc, argv);
    std::cout.flush();
    if (!std::cout) return fail("standard output cannot be written");
    return 0;
  } catch (CLI::Success const& done) { // --help and --version
    return app.exit(done);
  } catch (CLI::ParseError const& error) {
    return fail(std::string(error.what()) + " (vln --help tells more)");
  } catch (Vln::AlreadyTold const&) { return 1; } catch (std::bad_alloc const&) {
    return fail("out of memory");
  } catch (std::exception const& error) { return fail(error.what()); }
}
