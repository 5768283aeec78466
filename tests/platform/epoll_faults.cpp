// The system refusing epoll registrations for the platform tests, through the
// table of Linux calls: a file of its own, as the table's declarations clash
// with the Winsock-shaped names that the tests use unqualified.
#include <sys/epoll.h>

#include <atomic>
#include <cerrno>

#include "syscalls.h"

namespace {
std::atomic<bool> g_refuse{false};
const auto g_control = platform::sys::calls().epoll_ctl.load();
}  // namespace

// While `refuse` holds, every registration change fails with ENOMEM; false
// puts the real call back.
void refuseRegistrations(bool refuse) {
  g_refuse = refuse;
  platform::sys::calls().epoll_ctl = [](int epfd, int op, int fd, epoll_event* event) {
    if (!g_refuse) return g_control(epfd, op, fd, event);
    errno = ENOMEM;
    return -1;
  };
  if (!refuse) platform::sys::restore();
}
