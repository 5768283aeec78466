// Starting this program again as a peer process, and stopping it.
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <thread>

#include "demo.h"

namespace demo {
namespace {
std::atomic<bool> g_stop{false};
void onSignal(int) { g_stop.store(true); }
}  // namespace

void installStopHandler() {
  std::signal(SIGINT, onSignal);
  std::signal(SIGTERM, onSignal);
}

bool stopRequested() { return g_stop.load(); }

int spawnSelf(const std::vector<std::string>& args, bool quiet) {
  std::vector<char*> argv;
  static char self[] = "/proc/self/exe";
  argv.push_back(self);
  for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  pid_t pid = ::fork();
  if (pid == 0) {
    if (quiet) {
      int null = ::open("/dev/null", O_WRONLY);
      ::dup2(null, 1);
    }
    ::execv("/proc/self/exe", argv.data());
    ::_exit(127);
  }
  return pid;
}

void stopChild(int pid, int graceMs) {
  if (pid <= 0) return;
  for (int i = 0; i < graceMs / 10; ++i) {
    if (::waitpid(pid, nullptr, WNOHANG) == pid) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ::kill(pid, SIGTERM);
  for (int i = 0; i < 300; ++i) {
    if (::waitpid(pid, nullptr, WNOHANG) == pid) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ::kill(pid, SIGKILL);
  ::waitpid(pid, nullptr, 0);
}

}  // namespace demo
