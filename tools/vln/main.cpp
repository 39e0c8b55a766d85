// vln: looks at volumes from the command line.
//
// Whatever goes wrong at the edges ends in one line on standard error and exit code 1.
#include "Command.h"
#include "Commands.h"
#include "GeometryVolume/core/Version.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbFile.h"
#include "StandardOutput.h"

#include <CLI/CLI.hpp>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <exception>
#include <iostream>
#include <new>

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

void prepareSignals() {
  for (int number : {SIGINT, SIGTERM, SIGHUP}) {
    // Who starts the program may want it to go on, as nohup does.
    if (signal(number, onInterrupt) == SIG_IGN) signal(number, SIG_IGN);
  }
  // Both are errors to be told by what could not be written, not deaths.
  signal(SIGPIPE, SIG_IGN);
  signal(SIGXFSZ, SIG_IGN);
}

void declareCommands(CLI::App& program) {
  std::string examples = "Examples:\n";
  for (Vln::Command const& command : Vln::commandTable()) {
    CLI::App* const self = program.add_subcommand(command.name, command.summary);
    command.declare(*self);
    std::string const note = self->get_footer();
    std::string const example = command.example;
    if (example.empty()) {
      self->group("");
      continue;
    }
    std::string footer = note.empty() ? "" : note + "\n\n";
    self->footer(footer.append("Example:\n  ").append(example));
    examples.append("  ").append(example).append("\n");
  }
  program.footer(examples + "\n'vln COMMAND --help' tells the options of a command.");
}

std::vector<std::string> optionNames(CLI::App const& command) {
  std::vector<std::string> names;
  for (CLI::Option const* option : command.get_options())
    for (std::string const& name : option->get_lnames()) names.push_back("--" + name);
  return names;
}

// What a word that the parser did not expect was probably meant to be.
std::string hint(CLI::App const& program, int argc, char** argv) {
  auto const meant = [](std::string const& word, std::vector<std::string> const& words) {
    std::string const nearest = Vln::nearestWord(word, words);
    return nearest.empty() ? "" : "; did you mean '" + nearest + "'?";
  };
  if (argc < 2) return "";
  std::vector<std::string> names;
  for (Vln::Command const& command : Vln::commandTable())
    if (*command.example) names.emplace_back(command.name);
  std::string const first = argv[1];
  bool const known = std::find(names.begin(), names.end(), first) != names.end();
  CLI::App const* const command = known ? program.get_subcommand(first) : nullptr;
  if (!command && first.compare(0, 1, "-") != 0)
    return "there is no command '" + first + "'" + meant(first, names);
  auto const options = optionNames(command ? *command : program);
  for (int n = command ? 2 : 1; n < argc; ++n) {
    std::string const word = std::string(argv[n]).substr(0, std::string(argv[n]).find('='));
    if (word.compare(0, 2, "--") != 0 || std::find(options.begin(), options.end(), word) != options.end())
      continue;
    return "there is no option '" + word + "'" + meant(word, options);
  }
  return "";
}

// A reader that has what it wanted (vln probe ... | head) ends the program as it ends any other.
int finish() {
  int const error = Vln::closeOutput();
  if (error == EPIPE) {
    signal(SIGPIPE, SIG_DFL);
    raise(SIGPIPE);
  }
  return error == 0 ? 0 : fail("standard output cannot be written");
}

int run(int argc, char** argv) {
  prepareSignals();
  VLN::Interop::goOnInReader();
  Vln::ForeignLines const foreign;

  CLI::App app("Looks at sparse volumes: what a file holds, and what it looks like.", "vln");
  app.set_version_flag("--version", versionText());
  app.set_help_flag("-h,--help", "Show this help");
  app.set_help_all_flag("--help-all", "Show the help of all commands");
  app.require_subcommand(1);
  declareCommands(app);

  try {
    app.parse(argc, argv);
    return finish();
  } catch (CLI::Success const& done) { // --help and --version
    app.exit(done, Vln::out());
    return finish();
  } catch (CLI::ParseError const& error) {
    std::string const better = hint(app, argc, argv);
    return fail((better.empty() ? error.what() : better) + " (vln --help tells more)");
  } catch (Vln::AlreadyTold const&) { return 1; } catch (std::bad_alloc const&) {
    return fail("out of memory");
  } catch (std::exception const& error) { return fail(error.what()); }
}

} // namespace

int main(int argc, char** argv) { VLN::Interop::endProgram(run(argc, argv)); }
