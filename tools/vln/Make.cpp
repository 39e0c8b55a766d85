#include "Commands.h"
#include "Interop/FileFormat.h"
#include "Interop/VdbMake.h"
#include "ProgressBar.h"

namespace Vln {

void make(MakeOptions const& options) {
  VLN::Interop::checkOutputAs(options.output, "grids", {VLN::Interop::FileFormat::kVdb});
  ProgressBar bar;
  if (options.shape == "cloud")
    VLN::Interop::makeCloud(options.output, options.voxels, bar.progress());
  else
    VLN::Interop::makeTorus(options.output, options.voxels, bar.progress());
}

} // namespace Vln
