// The threads of this process, as /proc/self/task lists them. The runtime's
// threads have no names, so tests see them only in the count.
#pragma once

#include <dirent.h>

#include <thread>

inline int threadCount() {
  int count = 0;
  if (DIR* dir = ::opendir("/proc/self/task")) {
    while (dirent* entry = ::readdir(dir)) count += entry->d_name[0] != '.';
    ::closedir(dir);
  }
  return count;
}

// Sanitizers start a helper thread with the process's first thread; starting
// one at load makes that happen before any test counts.
inline const bool g_threadsWarmedUp = [] {
  std::thread([] {}).join();
  return true;
}();
