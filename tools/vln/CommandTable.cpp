#include "Command.h"
#include "Declare.h"

#include <algorithm>

namespace Vln {

std::vector<Command> const& commandTable() {
  static std::vector<Command> const table{
      {"info", "Report what a volume file holds", "vln info smoke.vdb", declareInfo},
      {"slice", "Draw a channel on a plane as a PNG picture",
       "vln slice smoke.vdb --channel density --axis z -o slice.png", declareSlice},
      {"render", "Draw a volume as a picture", "vln render bunny.vdb", declareRender},
      {"view", "Write a page that shows a volume in a browser", "vln view smoke.vdb", declareView},
      {"convert", "Write a volume file again, through the tree and back", "vln convert smoke.vdb copy.vdb",
       declareConvert},
      {"flatten", "Write a volume as one flat buffer that a GPU reads without pointers",
       "vln flatten smoke.vdb smoke.nvtt --quantise fp8", declareFlatten},
      {"validate", "Tell whether a flat buffer is sound, and where it is not", "vln validate smoke.nvtt",
       declareValidate},
      {"probe", "Print value and gradient of a channel at world positions as CSV",
       "vln probe smoke.vdb --channel density 0.5 1.25 -3", declareProbe},
      {"make", "Write a generated volume", "vln make cloud cloud.vdb --voxels 1000000", declareMake},
      {"churn", "Measure repeated work on a volume with memory pools and without",
       "vln churn smoke.vdb --limit 512MB --rounds 30", declareChurn},
      {"points", "Write points as boxes, or into another format", "vln points scan.ply -o scan.vdb",
       declarePoints},
      {"tiles", "Write the tiles of a depth as boxes", "vln tiles smoke.vdb --depth 28 -o tiles.obj",
       declareTiles},
      {"advect", "Move points, each step into the tiles where they then belong",
       "vln advect scan.ply --velocity 0.1 0 0 --steps 100", declareAdvect},
      {"completions", "Print the completions of a shell", "vln completions bash", declareCompletions},
      {"manual", "Print the manual page", "", declareManual},
  };
  return table;
}

std::string nearestWord(std::string const& word, std::vector<std::string> const& words) {
  // Edits that lead from one word to the other; swapped neighbours count as one.
  auto const distance = [](std::string const& a, std::string const& b) {
    std::vector<std::vector<std::size_t>> d(a.size() + 1, std::vector<std::size_t>(b.size() + 1));
    for (std::size_t i = 0; i <= a.size(); ++i)
      for (std::size_t j = 0; j <= b.size(); ++j) {
        if (i == 0 || j == 0) {
          d[i][j] = i + j;
          continue;
        }
        d[i][j] = std::min({d[i - 1][j] + 1, d[i][j - 1] + 1, d[i - 1][j - 1] + (a[i - 1] != b[j - 1])});
        if (i > 1 && j > 1 && a[i - 1] == b[j - 2] && a[i - 2] == b[j - 1])
          d[i][j] = std::min(d[i][j], d[i - 2][j - 2] + 1);
      }
    return d[a.size()][b.size()];
  };
  std::string nearest;
  std::size_t least = ~std::size_t(0);
  for (std::string const& candidate : words)
    if (std::size_t const d = distance(word, candidate); d < least) least = d, nearest = candidate;
  return least <= 1 + nearest.size() / 4 ? nearest : "";
}

} // namespace Vln
