// The table of the program's commands. A new one is a line in CommandTable.cpp and a function that declares
// its options; help, manual page, completions and hints for misspelt names follow from there.
#pragma once

#include <string>
#include <vector>

namespace CLI {
class App;
}

namespace Vln {

struct Command {
  char const* name;
  char const* summary;
  char const* example;             ///< a whole line; empty for a command that help does not show
  void (*declare)(CLI::App& self); ///< adds the options, and what is done with them
};
std::vector<Command> const& commandTable();

/// Of these words the one that was probably meant; empty when none is near.
std::string nearestWord(std::string const& word, std::vector<std::string> const& words);

} // namespace Vln
