// The system refusing epoll for the platform tests, through the table of
// Linux calls: a file of its own, as the table's declarations clash with the
// Winsock-shaped names that the tests use unqualified.
#include <sys/epoll.h>

#include <atomic>
#include <cerrno>

#include "syscalls.h"

namespace {

std::atomic<bool> g_refuse{false};
std::atomic<int> g_refused{0};
const auto g_create = platform::sys::calls().epoll_create1.load();
const auto g_control = platform::sys::calls().epoll_ctl.load();

bool refuseNow(int error) {
  if (!g_refuse) return false;
  ++g_refused;
  errno = error;
  return true;
}

}  // namespace

// While `refuse` holds, a new epoll descriptor fails with EMFILE and a
// registration with ENOMEM; false puts the real calls back.
void refuseEpoll(bool refuse) {
  g_refuse = refuse;
  platform::sys::calls().epoll_create1 = [](int flags) { return refuseNow(EMFILE) ? -1 : g_create(flags); };
  platform::sys::calls().epoll_ctl = [](int epfd, int op, int fd, epoll_event* event) {
    return refuseNow(ENOMEM) ? -1 : g_control(epfd, op, fd, event);
  };
  if (!refuse) platform::sys::restore();
}

int epollRefusals() { return g_refused; }
