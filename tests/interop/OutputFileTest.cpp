#include "Interop/OutputFile.h"
#include "Interop/FileError.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <csignal>
#include <string>
#include <thread>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;

void put(std::string const& path, std::string const& content) {
  OutputFile file(path);
  file.write(content);
  file.commit();
}

struct stat statOf(std::string const& path) {
  struct stat info = {};
  EXPECT_EQ(lstat(path.c_str(), &info), 0) << path;
  return info;
}

std::string reasonOf(auto const& body) {
  try {
    body();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

// No file of this process may grow beyond a size meanwhile.
class SizeLimit {
public:
  explicit SizeLimit(rlim_t bytes) {
    getrlimit(RLIMIT_FSIZE, &m_old);
    m_handler = std::signal(SIGXFSZ, SIG_IGN);
    rlimit const limit{bytes, m_old.rlim_max};
    setrlimit(RLIMIT_FSIZE, &limit);
  }
  SizeLimit(SizeLimit const&) = delete;
  SizeLimit& operator=(SizeLimit const&) = delete;
  ~SizeLimit() {
    setrlimit(RLIMIT_FSIZE, &m_old);
    std::signal(SIGXFSZ, m_handler);
  }

private:
  rlimit m_old;
  void (*m_handler)(int);
};

// requirement
TEST(OutputFileTest, NothingIsLeftWithoutACommit) {
  TempFolder folder;
  std::string const path = folder / "out";
  writeAll(path, "old");
  {
    OutputFile file(path);
    file.write("new content", 11);
  }
  EXPECT_EQ(readAll(path), "old");
  put(path, "new content");
  EXPECT_EQ(readAll(path), "new content");
  EXPECT_EQ(folder.names(), std::vector<std::string>{"out"});
}

// requirement: pieces of any size come out in their order
TEST(OutputFileTest, RequirementPiecesFollowEachOther) {
  TempFolder folder;
  std::string all;
  OutputFile file(folder / "out");
  for (std::size_t size : {0, 1, 3, 70000, 262143, 262144, 5, 300000, 1000000, 2}) {
    std::string const piece(size, static_cast<char>('a' + all.size() % 23));
    file.write(piece.data(), piece.size());
    all += piece;
  }
  file.finish();
  EXPECT_FALSE(std::filesystem::exists(folder / "out"));
  file.commit();
  EXPECT_EQ(readAll(folder / "out"), all);
}

// regression: the link was replaced by a file
TEST(OutputFileTest, RegressionLinksAreWrittenThrough) {
  TempFolder folder;
  std::filesystem::create_directory(folder / "deep");
  writeAll(folder / "deep/real", "old");
  std::filesystem::create_symlink("deep/real", folder / "one");
  std::filesystem::create_symlink(folder / "one", folder / "two");
  std::filesystem::create_symlink("deep/new", folder / "dangling");
  put(folder / "two", "through");
  EXPECT_TRUE(S_ISLNK(statOf(folder / "one").st_mode));
  EXPECT_TRUE(S_ISLNK(statOf(folder / "two").st_mode));
  EXPECT_TRUE(S_ISREG(statOf(folder / "deep/real").st_mode));
  EXPECT_EQ(readAll(folder / "deep/real"), "through");
  put(folder / "dangling", "made");
  EXPECT_TRUE(S_ISLNK(statOf(folder / "dangling").st_mode));
  EXPECT_EQ(readAll(folder / "deep/new"), "made");

  std::filesystem::create_symlink("round", folder / "round");
  EXPECT_EQ(reasonOf([&] { checkOutput(folder / "round"); }),
            "cannot be written: Too many levels of symbolic links");
}

// regression: the mode of the old file was lost
TEST(OutputFileTest, RegressionModesAreKept) {
  TempFolder folder;
  std::string const path = folder / "out";
  for (mode_t const mode : {0600, 0640, 0755, 0666}) {
    writeAll(path, "old");
    ASSERT_EQ(chmod(path.c_str(), mode), 0);
    put(path, "new");
    EXPECT_EQ(statOf(path).st_mode & 07777, mode);
  }
  mode_t const old = umask(027);
  put(folder / "fresh", "new");
  umask(old);
  EXPECT_EQ(statOf(folder / "fresh").st_mode & 07777, mode_t(0640));
}

// regression: the other name kept the old content
TEST(OutputFileTest, RegressionHardLinksStayTogether) {
  TempFolder folder;
  writeAll(folder / "a", "the old content, which is longer");
  std::filesystem::create_hard_link(folder / "a", folder / "b");
  put(folder / "a", "new");
  EXPECT_EQ(readAll(folder / "a"), "new");
  EXPECT_EQ(readAll(folder / "b"), "new");
  EXPECT_EQ(statOf(folder / "a").st_nlink, nlink_t(2));
  EXPECT_EQ(folder.names().size(), 2u);
}

// boundary: content that does not fit leaves the old one, whole, under all names
TEST(OutputFileTest, BoundaryWhatDoesNotFitLeavesTheOldContent) {
  TempFolder folder;
  std::string const old(1000, 'o');
  for (bool const linked : {false, true}) {
    std::string const path = folder / (linked ? "linked" : "single");
    writeAll(path, old);
    if (linked) std::filesystem::create_hard_link(path, folder / "other");
    std::string reason;
    {
      SizeLimit const limit(2000);
      reason = reasonOf([&] { put(path, std::string(3000, 'n')); });
    }
    EXPECT_EQ(reason, "cannot be written: File too large");
    EXPECT_EQ(readAll(path), old);
  }
  EXPECT_EQ(readAll(folder / "other"), old);
  EXPECT_EQ(folder.names().size(), 3u);
}

// regression: the temporary name was too long
TEST(OutputFileTest, RegressionNamesOf254Bytes) {
  TempFolder folder;
  for (std::size_t const length : {254, 255}) {
    std::string const name(length, 'n');
    put(folder / name, "content");
    EXPECT_EQ(readAll(folder / name), "content");
  }
  EXPECT_EQ(folder.names().size(), 2u);
}

// regression: the temporary name could be foreseen, and was opened even where it existed
TEST(OutputFileTest, RegressionTemporaryNamesAreNew) {
  TempFolder folder;
  OutputFile const a(folder / "out"), b(folder / "out");
  auto const names = folder.names();
  ASSERT_EQ(names.size(), 2u);
  EXPECT_NE(names[0], names[1]);
  for (auto const& name : names) {
    EXPECT_EQ(name.find(std::to_string(getpid())), std::string::npos);
    EXPECT_EQ(name.find("out"), std::string::npos);
  }
}

// requirement
TEST(OutputFileTest, RequirementPipesAndDevicesAreWrittenStraight) {
  TempFolder folder;
  std::string const pipe = folder / "pipe";
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  checkOutput(pipe); // does not wait for a reader
  std::string read;
  std::thread reader([&] { read = readAll(pipe); });
  put(pipe, std::string(200000, 'p'));
  reader.join();
  EXPECT_EQ(read, std::string(200000, 'p'));
  EXPECT_TRUE(S_ISFIFO(statOf(pipe).st_mode));

  OutputFile null("/dev/null");
  EXPECT_TRUE(null.straight());
  null.write("x", 1);
  null.commit();
  EXPECT_TRUE(S_ISCHR(statOf("/dev/null").st_mode));
  if (std::filesystem::exists("/dev/full")) {
    EXPECT_EQ(reasonOf([&] { put("/dev/full", "x"); }), "cannot be written: No space left on device");
  }
  EXPECT_EQ(folder.names(), std::vector<std::string>{"pipe"});
}

// regression: -o /dev/stdout replaced the link in /dev
TEST(OutputFileTest, RegressionOpenFilesAreWrittenWhereTheyStand) {
  TempFolder folder;
  std::string const path = folder / "log";
  int const fd = open(path.c_str(), O_RDWR | O_CREAT, 0600);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::write(fd, "head ", 5), 5);
  std::filesystem::create_symlink("/dev/fd/" + std::to_string(fd), folder / "link");
  put(folder / "link", "body");
  ASSERT_EQ(::write(fd, " tail", 5), 5);
  close(fd);
  EXPECT_EQ(readAll(path), "head body tail");
}

// negative
TEST(OutputFileTest, NamesWhatCannotBeWritten) {
  TempFolder folder;
  auto reason = [](std::string const& path) { return reasonOf([&] { checkOutput(path); }); };
  EXPECT_EQ(reason(folder.path()), "is a directory");
  EXPECT_EQ(reason(folder.path() + "/"), "is a directory");
  EXPECT_EQ(reason(folder / "none/out"), "cannot be written: No such file or directory");
  EXPECT_EQ(reason(folder / "none/"), "is no name for a file");
  EXPECT_EQ(reason(""), "is no name for a file");
  EXPECT_EQ(reason(folder / std::string(256, 'n')), "cannot be written: File name too long");
  EXPECT_EQ(reason(folder / "out"), "");
  EXPECT_TRUE(folder.names().empty());
}

// negative: a failed file cannot be committed
TEST(OutputFileTest, NegativeAFailureIsFinal) {
  TempFolder folder;
  writeAll(folder / "out", "old");
  {
    OutputFile file(folder / "out");
    std::string reason;
    {
      SizeLimit const limit(1000);
      reason = reasonOf([&] { file.write(std::string(500000, 'n')); });
    }
    EXPECT_NE(reason, "");
    EXPECT_NE(reasonOf([&] { file.write("more", 4); }), "");
    EXPECT_NE(reasonOf([&] { file.commit(); }), "");
  }
  EXPECT_EQ(readAll(folder / "out"), "old");
  EXPECT_EQ(folder.names(), std::vector<std::string>{"out"});
}

// requirement: what an interrupted program leaves is cleaned by its signal handler
TEST(OutputFileTest, AnInterruptRemovesTheTemporaryFile) {
  TempFolder folder;
  OutputFile a(folder / "a"), b(folder / "b");
  EXPECT_EQ(folder.names().size(), 2u);
  removeUnfinishedOutput();
  EXPECT_TRUE(folder.names().empty());
}

} // namespace
