// Runs a program to its end and keeps what it says, for tests.
#pragma once

#include "support/TempFolder.h"

#include <stdexcept>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace VLN::Test {

struct RunResult {
  int code = -1;   ///< exit code; -1 when a signal ended the program
  int signal = 0;  ///< the signal
  std::string out; ///< standard output
  std::string err; ///< standard error
};

inline RunResult runProgram(std::vector<std::string> arguments) {
  TempFolder folder;
  std::string const out = folder / "out", err = folder / "err";
  std::vector<char*> argv;
  for (auto& a : arguments) argv.push_back(a.data());
  argv.push_back(nullptr);
  pid_t const child = fork();
  if (child < 0) throw std::runtime_error("no process");
  if (child == 0) {
    int const in = open("/dev/null", O_RDONLY);
    int const o = open(out.c_str(), O_WRONLY | O_CREAT, 0600),
              e = open(err.c_str(), O_WRONLY | O_CREAT, 0600);
    dup2(in, 0), dup2(o, 1), dup2(e, 2);
    execv(argv[0], argv.data());
    _exit(127);
  }
  RunResult result;
  int status = 0;
  waitpid(child, &status, 0);
  if (WIFEXITED(status)) result.code = WEXITSTATUS(status);
  if (WIFSIGNALED(status)) result.signal = WTERMSIG(status);
  result.out = readAll(out), result.err = readAll(err);
  return result;
}

} // namespace VLN::Test
