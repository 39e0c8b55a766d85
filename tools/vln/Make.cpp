#include "Commands.h"
#include "Interop/FileFormat.h"
#include "Interop/VdbMake.h"
#include "ProgressBar.h"

namespace Vln {

void make(MakeOptions const& options) {
  VLN::Interop::checkOutputFor(VLN::Interop::FileContent::kGrids, options.output);
  ProgressBar bar;
  if (options.shape == "cloud")
    VLN::Interop::makeCloud(options.output, options.voxels, bar.progress());
  else
    VLN::Interop::makeTorus(options.output, options.voxels, bar.progress());
}

} // namespace Vln
