#include "tasks.h"

#include <dirent.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

namespace {

// Sanitizers start a helper thread of their own with the process's first
// thread; one thread started and joined at load makes that happen before any
// test takes its list of threads.
[[maybe_unused]] const bool g_warmedUp = [] {
  std::thread([] {}).join();
  return true;
}();

}  // namespace

namespace tasks {

std::set<int> ids() {
  std::set<int> result;
  DIR* dir = ::opendir("/proc/self/task");
  if (dir == nullptr) return result;
  while (dirent* entry = ::readdir(dir)) {
    if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
    result.insert(std::atoi(entry->d_name));
  }
  ::closedir(dir);
  return result;
}

long cpuTicks(int tid) {
  std::string path = "/proc/self/task/" + std::to_string(tid) + "/stat";
  FILE* f = std::fopen(path.c_str(), "r");
  if (f == nullptr) return -1;
  char line[1024] = {};
  std::size_t got = std::fread(line, 1, sizeof line - 1, f);
  std::fclose(f);
  line[got] = '\0';
  // The command name may hold spaces and parentheses; the fields after it
  // start behind the last ')'. utime and stime are fields 14 and 15, that is
  // the 12th and 13th after the name.
  const char* rest = std::strrchr(line, ')');
  if (rest == nullptr) return -1;
  rest += 2;
  long utime = 0;
  long stime = 0;
  if (std::sscanf(rest, "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %ld %ld", &utime, &stime) != 2) return -1;
  return utime + stime;
}

bool alive(int tid) { return ids().count(tid) != 0; }

long ticksPerSecond() { return ::sysconf(_SC_CLK_TCK); }

bool eventually(const std::function<bool()>& condition, double seconds) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (;;) {
    if (condition()) return true;
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

int theNewThread(const std::set<int>& before, double seconds) {
  int found = -1;
  eventually(
      [&] {
        int count = 0;
        for (int tid : ids()) {
          if (before.count(tid) == 0) {
            found = tid;
            ++count;
          }
        }
        if (count != 1) found = -1;
        return count == 1;
      },
      seconds);
  return found;
}

}  // namespace tasks
