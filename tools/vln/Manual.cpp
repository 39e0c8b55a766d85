// The manual page and shell completions, out of the options that the commands declare.
#include "Declare.h"
#include "GeometryVolume/core/Version.h"
#include "StandardOutput.h"

#include <CLI/CLI.hpp>

#include <memory>
#include <string>
#include <vector>

#include <fmt/format.h>

namespace Vln {

namespace {

bool shown(CLI::App const* command) { return !command->get_group().empty(); }
std::vector<CLI::App*> commandsOf(CLI::App const& program) {
  return const_cast<CLI::App&>(program).get_subcommands([](CLI::App* command) { return shown(command); });
}
std::vector<CLI::Option const*> optionsOf(CLI::App const& command, bool positional) {
  return command.get_options([=](CLI::Option const* option) {
    return !option->get_group().empty() && option->get_positional() == positional;
  });
}

// "-o", "--output".
std::vector<std::string> flagsOf(CLI::Option const& option) {
  std::vector<std::string> flags;
  for (auto const& name : option.get_snames()) flags.push_back("-" + name);
  for (auto const& name : option.get_lnames()) flags.push_back("--" + name);
  return flags;
}
bool takesValue(CLI::Option const& option) {
  return option.get_expected_max() > 0 && option.get_type_size() != 0;
}

// "MB", without the limits that the parser adds.
std::string typeOf(CLI::Option const& option) {
  std::string const name = option.get_type_name();
  return name.substr(0, name.find(':'));
}

std::string replaced(std::string text, std::string const& what, std::string const& by) {
  for (std::size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
    text.replace(at, what.size(), by);
  return text;
}

// Text for troff: hyphens that are to be typed, and no line that begins with a command.
std::string roff(std::string const& text) {
  std::string result = replaced(replaced(text, "\\", "\\e"), "-", "\\-");
  result = replaced(result, "\n", "\n.br\n");
  return replaced(result, "\n.br\n\n.br\n", "\n.PP\n");
}

void printManual(CLI::App const& program) {
  auto const& v = VLN::versionInfo();
  out() << fmt::format(".TH VLN 1 \"\" \"vln {}.{}.{}\" \"User Commands\"\n", v.majorNumber, v.minorNumber,
                       v.patchNumber)
        << ".SH NAME\nvln \\- look at sparse volumes\n"
        << ".SH SYNOPSIS\n.B vln\n.I COMMAND\n.RI [ OPTIONS ]\n"
        << ".SH DESCRIPTION\n"
        << roff(program.get_description()) << "\n"
        << ".PP\nResults go to standard output. Whatever goes wrong ends in one line on standard error. A "
           "file is\n"
           "written whole or not at all.\n"
        << ".SH COMMANDS\n";
  for (CLI::App const* command : commandsOf(program)) {
    out() << ".SS vln " << command->get_name();
    for (auto const* option : optionsOf(*command, true))
      out() << " " << (option->get_required() ? option->get_name() : "[" + option->get_name() + "]");
    out() << " [OPTIONS]\n" << roff(command->get_description()) << ".\n";
    for (bool const positional : {true, false})
      for (auto const* option : optionsOf(*command, positional)) {
        std::string names = positional ? option->get_name() : "";
        for (auto const& flag : flagsOf(*option)) names += (names.empty() ? "" : ", ") + flag;
        out() << ".TP\n.B " << roff(names);
        if (!positional && takesValue(*option)) out() << " \\fI" << roff(typeOf(*option)) << "\\fR";
        out() << "\n" << roff(option->get_description());
        if (auto const standard = option->get_default_str(); !standard.empty())
          out() << " (default: " << roff(standard) << ")";
        out() << (option->get_required() && !positional ? " (required)" : "") << "\n";
      }
    out() << ".PP\n" << roff(command->get_footer()) << "\n";
  }
  out() << ".SH EXIT STATUS\n0 when all went well, 1 otherwise.\n";
}

std::string words(std::vector<std::string> const& list) {
  std::string text;
  for (auto const& word : list) text += (text.empty() ? "" : " ") + word;
  return text;
}

std::vector<std::string> namesOf(CLI::App const& program) {
  std::vector<std::string> names;
  for (CLI::App const* command : commandsOf(program)) names.push_back(command->get_name());
  return names;
}

void printBash(CLI::App const& program) {
  out() << "# bash completion for vln\n_vln() {\n"
           "  local word=\"${COMP_WORDS[COMP_CWORD]}\" options=\"--help\"\n"
           "  if [ \"$COMP_CWORD\" -eq 1 ]; then\n    COMPREPLY=($(compgen -W \""
        << words(namesOf(program)) << " --help --help-all --version\" -- \"$word\"))\n    return\n  fi\n"
        << "  case \"${COMP_WORDS[1]}\" in\n";
  for (CLI::App const* command : commandsOf(program)) {
    std::vector<std::string> flags;
    for (auto const* option : optionsOf(*command, false))
      for (auto const& flag : flagsOf(*option)) flags.push_back(flag);
    out() << "  " << command->get_name() << ") options=\"" << words(flags) << "\" ;;\n";
  }
  out() << "  esac\n  case \"$word\" in\n  -*) COMPREPLY=($(compgen -W \"$options\" -- \"$word\")) ;;\n"
           "  *) COMPREPLY=($(compgen -f -- \"$word\")) ;;\n  esac\n}\n"
           "complete -o filenames -F _vln vln\n";
}

// Within the quotes of zsh's option lists.
std::string zsh(std::string const& text) {
  std::string result = text;
  for (char const* special : {"[", "]", ":"}) result = replaced(result, special, std::string("\\") + special);
  return replaced(result, "'", "'\\''");
}

void printZsh(CLI::App const& program) {
  out() << "#compdef vln\nlocal -a commands\ncommands=(\n";
  for (CLI::App const* command : commandsOf(program))
    out() << "  '" << command->get_name() << ":" << zsh(command->get_description()) << "'\n";
  out() << ")\nif (( CURRENT == 2 )); then\n  _describe command commands\n  return\nfi\ncase $words[2] in\n";
  for (CLI::App const* command : commandsOf(program)) {
    out() << command->get_name() << ")\n  _arguments";
    for (auto const* option : optionsOf(*command, false))
      for (auto const& flag : flagsOf(*option)) {
        out() << " \\\n    '" << flag << "[" << zsh(option->get_description()) << "]";
        if (takesValue(*option)) out() << ":" << zsh(typeOf(*option)) << ":_files";
        out() << "'";
      }
    out() << " \\\n    '*:file:_files' ;;\n";
  }
  out() << "esac\n";
}

void printFish(CLI::App const& program) {
  auto const quoted = [](std::string const& text) {
    return "'" + replaced(replaced(text, "\\", "\\\\"), "'", "\\'") + "'";
  };
  out() << "# fish completion for vln\n";
  for (CLI::App const* command : commandsOf(program)) {
    out() << "complete -c vln -n __fish_use_subcommand -f -a " << command->get_name() << " -d "
          << quoted(command->get_description()) << "\n";
    for (auto const* option : optionsOf(*command, false)) {
      out() << "complete -c vln -n '__fish_seen_subcommand_from " << command->get_name() << "'";
      for (auto const& name : option->get_snames()) out() << " -s " << name;
      for (auto const& name : option->get_lnames()) out() << " -l " << name;
      out() << (takesValue(*option) ? " -r" : "") << " -d " << quoted(option->get_description()) << "\n";
    }
  }
}

} // namespace

void declareManual(CLI::App& self) {
  self.callback([&self] { printManual(*self.get_parent()); });
}

void declareCompletions(CLI::App& self) {
  auto const shell = std::make_shared<std::string>();
  self.add_option("SHELL", *shell, "bash, zsh or fish")
      ->required()
      ->check(CLI::IsMember({"bash", "zsh", "fish"}))
      ->type_name("bash|zsh|fish");
  self.callback([&self, shell] {
    CLI::App const& program = *self.get_parent();
    if (*shell == "bash")
      printBash(program);
    else if (*shell == "zsh")
      printZsh(program);
    else
      printFish(program);
  });
}

} // namespace Vln
