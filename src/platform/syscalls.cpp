// The real entries of the system-call table.
#include "syscalls.h"

#include <poll.h>
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

Calls g_calls{{realSocket}, {realAccept4}, {realSendmsg}, {realRecvmsg}, {realPoll}, {realEventfd}};

}  // namespace

Calls& calls() { return g_calls; }

void restore() {
  g_calls.socket = realSocket;
  g_calls.accept4 = realAccept4;
  g_calls.sendmsg = realSendmsg;
  g_calls.recvmsg = realRecvmsg;
  g_calls.poll = realPoll;
  g_calls.eventfd = realEventfd;
}

}  // namespace platform::sys
