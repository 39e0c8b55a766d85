// vln churn: the same work with pools and without, each in a process of its own, so that neither inherits the
// other's memory.
//
//   vln churn FILE ── vln churn FILE --only with ──────> one line of figures
//                  └─ vln churn FILE --only without ───> one line of figures
#include "ChurnRounds.h"
#include "Commands.h"
#include "GeometryVolume/pools/PoolUtils.h"
#include "Interop/FileError.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <array>
#include <cstdio>
#include <iostream>
#include <stdexcept>

#include <fmt/format.h>
#include <nlohmann/json.hpp>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace Vln {

namespace {

using Json = nlohmann::ordered_json;

/// Runs this program again and returns what it wrote to standard output. Its errors are ours.
std::string runAgain(std::vector<std::string> arguments) {
  std::vector<char*> argv;
  for (auto& a : arguments) argv.push_back(a.data());
  argv.push_back(nullptr);
  int ends[2];
  if (pipe(ends) != 0) throw std::runtime_error("no pipe to a second process");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, ends[1], 1);
  posix_spawn_file_actions_addclose(&actions, ends[0]);
  posix_spawn_file_actions_addclose(&actions, ends[1]);
  pid_t child = 0;
  int const error = posix_spawn(&child, "/proc/self/exe", &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  close(ends[1]);
  std::string text;
  std::array<char, 4096> buffer;
  for (ssize_t n; error == 0 && (n = read(ends[0], buffer.data(), buffer.size())) > 0;)
    text.append(buffer.data(), static_cast<std::size_t>(n));
  close(ends[0]);
  if (error != 0) throw std::runtime_error("the program cannot be started a second time");
  int status = 0;
  waitpid(child, &status, 0);
  if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return text;
  // It has said why, unless it was killed.
  if (WIFEXITED(status)) throw AlreadyTold();
  throw std::runtime_error("a run was ended by signal " + std::to_string(WTERMSIG(status)));
}

Json figuresOf(ChurnOptions const& o, char const* mode) {
  std::vector<std::string> arguments{"vln",
                                     "churn",
                                     o.file,
                                     "--limit",
                                     std::to_string(o.limitBytes),
                                     "--rounds",
                                     std::to_string(o.rounds),
                                     "--only",
                                     mode};
  if (o.limits.memoryBytes) {
    arguments.push_back("--max-memory");
    arguments.push_back(std::to_string(o.limits.memoryBytes / 1000000));
  }
  return Json::parse(runAgain(std::move(arguments)));
}

void printOne(ChurnOptions const& o) {
  ChurnFigures const f = runChurn(o, o.only == "with");
  Json const j = {{"seconds", f.seconds},         {"peak_rss", f.peakResident}, {"voxels", f.voxels},
                  {"channels", f.heldByChannels}, {"arrays", f.heldByArrays},   {"blocks", f.heldByBlocks},
                  {"checksum", f.checksum}};
  out() << j.dump() << "\n";
}

std::string mb(Json const& bytes) { return fmt::format("{:.1f} MB", bytes.get<double>() / 1e6); }

} // namespace

void churn(ChurnOptions const& o) {
  if (!o.only.empty()) return printOne(o);
  Json const with = figuresOf(o, "with"), without = figuresOf(o, "without");
  if (with["checksum"] != without["checksum"])
    throw std::runtime_error("the rounds with pools gave other values than those without");
  if (o.json) {
    auto const part = [](Json const& j) {
      return Json{{"seconds", j["seconds"]}, {"peak_rss", j["peak_rss"]}};
    };
    Json const j = {{"rounds", o.rounds},
                    {"limit", o.limitBytes},
                    {"with_pools", part(with)},
                    {"without_pools", part(without)}};
    out() << j.dump(2) << "\n";
    return;
  }
  out() << fmt::format("{}: {} active voxels, {} rounds, limit {:.1f} MB\n\n", VLN::Interop::oneLine(o.file),
                       with["voxels"].get<std::int64_t>(), o.rounds, double(o.limitBytes) / 1e6);
  out() << fmt::format("  {:<14}  {:>12}  {:>14}  {}\n", "", "time a round", "peak resident",
                       "held by the pools at the end");
  auto const row = [](char const* name, Json const& j, std::string const& held) {
    out() << fmt::format("  {:<14}  {:>9.2f} ms  {:>14}  {}\n", name, 1000 * j["seconds"].get<double>(),
                         mb(j["peak_rss"]), held);
  };
  row("with pools", with,
      fmt::format("channels {}, arrays {}, blocks {}", mb(with["channels"]), mb(with["arrays"]),
                  mb(with["blocks"])));
  row("without pools", without, "-");
  out() << fmt::format("\n  rounds with pools take {:.2f} of the time; their peak is {:.2f} of the limit\n",
                       with["seconds"].get<double>() / without["seconds"].get<double>(),
                       with["peak_rss"].get<double>() / double(o.limitBytes));
}

} // namespace Vln
