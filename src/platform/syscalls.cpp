// The real entries of the system-call table.
#include "syscalls.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

namespace platform::sys {
namespace {

// Plain functions with the table's exact types (glibc declares some of the
// calls with attributes or typedefs that a pointer can't carry).
int realSocket(int domain, int type, int protocol) { return ::socket(domain, type, protocol); }
int realAccept4(int fd, ::sockaddr* address, unsigned int* length, int flags) {
  return ::accept4(fd, address, length, flags);
}
long realSendmsg(int fd, const ::msghdr* message, int flags) { return ::sendmsg(fd, message, flags); }
long realRecvmsg(int fd, ::msghdr* message, int flags) { return ::recvmsg(fd, message, flags); }
int realPoll(::pollfd* fds, unsigned long count, int timeout) { return ::poll(fds, count, timeout); }
int realEventfd(unsigned int initial, int flags) { return ::eventfd(initial, flags); }
int realEpollCreate1(int flags) { return ::epoll_create1(flags); }
int realEpollCtl(int epfd, int op, int fd, ::epoll_event* event) { return ::epoll_ctl(epfd, op, fd, event); }
int realEpollWait(int epfd, ::epoll_event* events, int count, int timeout) {
  return ::epoll_wait(epfd, events, count, timeout);
}

Calls g_calls{{realSocket},  {realAccept4},      {realSendmsg},  {realRecvmsg},  {realPoll},
              {realEventfd}, {realEpollCreate1}, {realEpollCtl}, {realEpollWait}};

}  // namespace

Calls& calls() { return g_calls; }

void restore() {
  g_calls.socket = realSocket;
  g_calls.accept4 = realAccept4;
  g_calls.sendmsg = realSendmsg;
  g_calls.recvmsg = realRecvmsg;
  g_calls.poll = realPoll;
  g_calls.eventfd = realEventfd;
  g_calls.epoll_create1 = realEpollCreate1;
  g_calls.epoll_ctl = realEpollCtl;
  g_calls.epoll_wait = realEpollWait;
}

}  // namespace platform::sys
