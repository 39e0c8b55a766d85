#include "Interop/DenseReaderImpl.h"
#include "Interop/NpzArchiveImpl.h"

#include <memory>

namespace VLN::Interop {

void writeNpz(std::string const& path, DenseVolume const& volume, Progress const& progress) {
  DensePlan const plan = planDense(path, volume);
  OutputFile out(path);
  auto const zip = std::make_unique<ZipWriter>(out);
  std::set<std::string> taken{"low", "to_world"};
  double work = 0, done = 0;
  for (auto const& reader : plan.readers) work += double(reader->components) * double(plan.count[2]);
  std::vector<std::byte> slice;
  for (std::size_t n = 0; n < plan.readers.size(); ++n) {
    auto const& reader = *plan.readers[n];
    bool const flags =
        std::find(volume.flags.begin(), volume.flags.end(), plan.names[n]) != volume.flags.end();
    std::string const descr = flags ? "|b1"
                                    : std::string(reader.scalarBytes == 1 ? "|" : "<") + reader.kind +
                                          std::to_string(reader.scalarBytes);
    std::vector<std::int64_t> shape(plan.count, plan.count + 3);
    if (reader.components > 1) shape.push_back(reader.components);
    std::string const name = memberName(plan.names[n], taken);
    zip->begin(name + ".npy");
    std::string const header = npyHeader(descr, shape, true);
    zip->write(header.data(), header.size());
    slice.resize(plan.count[0] * plan.count[1] * reader.scalarBytes);
    for (int c = 0; c < reader.components; ++c)
      for (int z = plan.box.min.z; z < plan.box.max.z; ++z) {
        reader.slice(plan.box, z, volume.depth, c, c + 1, slice.data());
        zip->write(slice.data(), slice.size());
        if (progress) progress("writing", done++ / work);
      }
    zip->end();
    auto const background = reader.background();
    shape.erase(shape.begin(), shape.begin() + 3);
    writeSmall(*zip, name + ".background", descr, shape, background.data(), background.size());
  }
  std::int64_t const low[3] = {plan.box.min.x, plan.box.min.y, plan.box.min.z};
  // Of an element's place in the array, not of its index.
  double matrix[4][4] = {};
  for (int row = 0; row < 3; ++row) {
    for (int a = 0; a < 3; ++a) matrix[row][a] = plan.toWorld[row][a];
    matrix[row][3] = plan.toWorld[row][3];
    for (int a = 0; a < 3; ++a) matrix[row][3] += plan.toWorld[row][a] * double(low[a]);
  }
  matrix[3][3] = 1;
  writeSmall(*zip, "low", "<i8", {3}, low, sizeof low);
  writeSmall(*zip, "to_world", "<f8", {4, 4}, matrix, sizeof matrix);
  zip->finish();
  out.commit();
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
