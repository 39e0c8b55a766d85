#include "Interop/SupervisorImpl.h"

#include "Interop/VdbFile.h"

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <string>

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

int threadsAtFirst = 0; ///< 0: nothing goes on
bool isChild = false;
std::atomic<pid_t> supervised{0};

extern "C" void passOn(int number, siginfo_t* info, void*) {
  if (info->si_code <= 0) kill(supervised.load(), number); // by a process, not by the terminal
}

int threadCount() {
  std::ifstream in("/proc/self/status");
  for (std::string line; std::getline(in, line);)
    if (line.rfind("Threads:", 0) == 0) return std::stoi(line.substr(8));
  return 0;
}

} // namespace

void goOnInReader() { threadsAtFirst = threadCount(); }

bool mayGoOn() { return threadsAtFirst > 0 && threadCount() <= threadsAtFirst; }

void goneOn() {
  threadsAtFirst = 0;
  isChild = true;
}

void endProgram(int code) {
  if (!isChild) std::exit(code);
  // Libraries that had threads when they were loaded would wait for them.
  std::fflush(nullptr);
  std::cerr.flush();
  _exit(code);
}

void endAs(pid_t child, int end) {
  supervised = child;
  for (int number : {SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGUSR1, SIGUSR2}) {
    struct sigaction action = {};
    sigaction(number, nullptr, &action);
    if (action.sa_handler == SIG_IGN) continue;
    action = {};
    action.sa_sigaction = passOn;
    action.sa_flags = SA_SIGINFO | SA_RESTART;
    sigaction(number, &action, nullptr);
  }
  char const go = 1;
  while (write(end, &go, 1) < 0 && errno == EINTR) {}
  close(end);
  int status = 0;
  while (waitpid(child, &status, 0) < 0 && errno == EINTR) {}
  if (!WIFSIGNALED(status)) _exit(WEXITSTATUS(status));
  int const number = WTERMSIG(status);
  rlimit const none = {0, 0};
  setrlimit(RLIMIT_CORE, &none); // the child has left its own
  signal(number, SIG_DFL);
  raise(number);
  _exit(128 + number);
}

} // namespace VLN::Interop
