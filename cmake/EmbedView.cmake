# cmake -DIN=view.js -DLICENSE=lil-gui/LICENSE.md -DOUT=ViewScript.cpp -P EmbedView.cmake: the bytes of a file as a source,
# behind the licence of what is in it beside our own; none where IN is empty.
set(bytes "")
if(IN)
  file(READ "${LICENSE}" license)
  string(CONCAT license "/*! lil-gui, whose licence this is:\n\n" "${license}" "*/\n")
  string(HEX "${license}" head)
  file(READ "${IN}" bytes HEX)
  string(PREPEND bytes "${head}")
  # Rows of 32: not one line for all.
  string(REGEX REPLACE "(................................................................)" "\\1\n" bytes "${bytes}")
  string(REGEX REPLACE "([0-9a-f][0-9a-f])" "0x\\1," bytes "${bytes}")
endif()
file(WRITE "${OUT}" "// Made by cmake/EmbedView.cmake.
#include \"vln/ViewCommand.h\"

namespace Vln {

namespace {
unsigned char const script[] = {
${bytes}0};
} // namespace

std::string_view viewScript() { return {reinterpret_cast<char const*>(script), sizeof(script) - 1}; }

} // namespace Vln
")
