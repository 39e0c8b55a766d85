// Replays the fuzzer's .ply files without the fuzzer: seeds, and mutations of them.
#include "support/FuzzReplay.h"
#include "support/PlyCase.h"

namespace {

using Support::PlyCase;

template <class T> std::string bytesOf(T v, bool big = false) {
  std::string s(reinterpret_cast<char const*>(&v), sizeof v);
  if (big) std::reverse(s.begin(), s.end());
  return s;
}
std::string header(std::string const& format, std::string const& rest) {
  return "ply\nformat " + format + " 1.0\n" + rest + "end_header\n";
}

std::vector<std::string> seeds() {
  std::string const xyz = "property float x\nproperty float y\nproperty float z\n";
  std::vector<std::string> list;
  list.push_back(
      header("ascii", "comment made by hand\nobj_info none\nelement vertex 2\n" + xyz +
                          "property char a\nproperty uint8 b\nproperty int16 c\nproperty ushort d\n"
                          "property int e\nproperty uint32 f\nproperty float32 g\nproperty double "
                          "h\n") +
      "1 2.5 -3e2 -128 255 -32768 65535 -2147483648 4294967295 0.1 0.1\n"
      "+4 5 6   127\t0 1 2 3 4\r\n1e-3 -7");
  list.push_back(
      header("ascii", "element face 2\nproperty list uchar int vertex_indices\nelement vertex 3\n" + xyz +
                          "property list uchar float list\nelement edge 1\nproperty int a\n") +
      "3 0 1 2\n0\n1 2 3 2 0.5 0.5\n-1 -2 -3 0\nnan inf 1e40 1 7\n9\n");
  for (bool const big : {false, true}) {
    for (bool const wide : {false, true}) {
      std::string const real = wide ? "double" : "float";
      std::string bytes = header(big ? "binary_big_endian" : "binary_little_endian",
                                 "element vertex 70\nproperty " + real + " y\nproperty uchar red\nproperty " +
                                     real + " x\nproperty list int short s\nproperty " + real + " z\n");
      auto const number = [&](double v) {
        return wide ? bytesOf(v, big) : bytesOf(static_cast<float>(v), big);
      };
      for (int n = 0; n < 70; ++n)
        bytes += number(n % 7) + bytesOf(static_cast<char>(n)) + number(0.25 * n) +
                 bytesOf(std::int32_t(n % 3), big) + std::string(std::size_t(n % 3) * 2, 's') + number(-n);
      list.push_back(bytes);
    }
  }
  list.push_back(header("ascii", "element vertex 0\n" + xyz));
  list.push_back("ply\r\nformat ascii 1.0\r\nelement vertex 1\r\nproperty double x\r\nproperty double y\r\n"
                 "property double z\r\nend_header\r\n1 2 3\r\n");
  // Found by the fuzzer: points next to each other, and next to points that are nowhere.
  std::string const wide = "property double x\nproperty double y\nproperty double z\n";
  std::string next = header("ascii", "element vertex 130\n" + wide);
  for (int n = 0; n < 130; ++n) next += n % 2 ? "5e-324 0 0\n" : "0 0 0\n";
  list.push_back(next);
  list.push_back(header("ascii", "element vertex 3\n" + wide) + "1 2 3.25\nnan 0 1e30\n-1 0.5 inf\n");
  return list;
}

TEST(PlyFuzz, RequirementSeedsAreReadWrittenAndReadAgain) { Support::replay<PlyCase>("ply", seeds()); }

TEST(PlyFuzz, RequirementMutatedFilesAreReadOrRefusedWithOneLine) {
  Support::replayMutations<PlyCase>(seeds(), 3000, " \n0123456789-.e\xFF\x7F");
}

} // namespace
