// The system as it behaves on a busy host, through the table of Linux calls
// under the platform layer: writes that take a few bytes, reads and waits
// interrupted or refused for the moment, registrations with the wait refused,
// descriptors used up. The streams must come through whole and in order, and
// what can't be made must fail the way the matching Winsock error does, never
// end the process.
// The Winsock-shaped headers first: Linux's socket macros would clash with them.
#include "endpoint_test.h"
#include "syscalls.h"

#include <netinet/in.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <cerrno>

namespace {

// Calls of each kind so far: each fake goes through its own cycle.
std::atomic<int> g_sends{0}, g_receives{0}, g_polls{0}, g_registrations{0};

// The first call of every `cycle` is interrupted, the second refused for
// now (errno set, true); the others go on.
bool interrupted(std::atomic<int>& calls, int cycle) {
  const int turn = calls++ % cycle;
  if (turn > 1) return false;
  errno = turn == 0 ? EINTR : EAGAIN;
  return true;
}

// A stream's message cut to at most `limit` bytes of its buffers (a datagram goes whole).
template <class Call>
long cut(int fd, msghdr* message, std::size_t limit, Call call) {
  int type = 0;
  socklen_t length = sizeof type;
  if (::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) != 0 || type != SOCK_STREAM) return call(message);
  iovec iov[1024];
  msghdr shorter = *message;
  shorter.msg_iov = iov, shorter.msg_iovlen = 0;
  for (std::size_t i = 0; i < message->msg_iovlen && limit > 0; ++i, ++shorter.msg_iovlen) {
    iov[i] = message->msg_iov[i];
    limit -= iov[i].iov_len = std::min(iov[i].iov_len, limit);
  }
  const long got = call(&shorter);
  message->msg_flags = shorter.msg_flags;
  return got;
}
long choppySendmsg(int fd, const msghdr* message, int flags) {
  if (interrupted(g_sends, 4)) return -1;
  return cut(fd, const_cast<msghdr*>(message), 3, [&](msghdr* m) { return ::sendmsg(fd, m, flags); });
}
long choppyRecvmsg(int fd, msghdr* message, int flags) {
  if (interrupted(g_receives, 3)) return -1;
  return cut(fd, message, 5, [&](msghdr* m) { return ::recvmsg(fd, m, flags); });
}
// A wait that wakes with nothing every other time (a look without waiting
// still sees what is ready).
int restlessWait(int epfd, epoll_event* events, int count, int timeout) {
  return timeout != 0 && g_polls++ % 2 == 0 ? 0 : ::epoll_wait(epfd, events, count, timeout);
}
// One change of a registration in five is refused for want of memory.
int forgetfulRegistration(int epfd, int op, int fd, epoll_event* event) {
  if (g_registrations++ % 5 == 4) return errno = ENOMEM, -1;
  return ::epoll_ctl(epfd, op, fd, event);
}
int noDescriptor(int, int, int) { return errno = EMFILE, -1; }
int noDescriptorAccept(int, sockaddr*, unsigned int*, int) { return errno = EMFILE, -1; }
int noEventfd(unsigned int, int) { return errno = EMFILE, -1; }

class SyscallTest : public EndpointTest {
 protected:
  void TearDown() override {
    platform::sys::restore();
    EndpointTest::TearDown();
  }
  // `count` messages each way, each whole and in order.
  static void exchange(N_Socket& a, N_Socket& b, unsigned count) {
    for (unsigned i = 0; i < count; ++i) send(a, pattern(i * 37 % 700, i)), send(b, pattern(i * 37 % 700, i));
    for (N_Socket* to : {&b, &a})
      for (unsigned i = 0; i < count; ++i) ASSERT_TRUE(nextMessage(*to, pattern(i * 37 % 700, i), 20000)) << i;
  }
};

TEST_F(SyscallTest, StreamsComeThroughShortWritesInterruptionsAndRefusals) {
  N_Listener listener(port());
  N_Socket a, b, c, d;
  ASSERT_TRUE(connectPair(listener, port(), b, a) && connectPair(listener, port(), d, c));
  platform::sys::calls().sendmsg = choppySendmsg;
  platform::sys::calls().recvmsg = choppyRecvmsg;
  platform::sys::calls().epoll_wait = restlessWait;
  platform::sys::calls().epoll_ctl = forgetfulRegistration;
  exchange(a, b, 40);
  exchange(c, d, 10);
  EXPECT_GT(g_sends.load(), 1000);  // the calls did go through the table
  EXPECT_GT(g_receives.load(), 1000);
  EXPECT_GT(g_polls.load(), 10);
  EXPECT_GT(g_registrations.load(), 20);
  EXPECT_TRUE(a.isConnected() && b.isConnected() && c.isConnected() && d.isConnected());

  // Datagrams, to a plain socket on a host of its own and back.
  N_Address other("127.0.0.2");
  const auto udpPort = static_cast<std::uint16_t>(freePort());
  const int peer = raw::udpBound("127.0.0.2", udpPort);
  ASSERT_GE(peer, 0);
  N_Socket u(&other, udpPort, N_Socket::SOCKET_UDP);
  const sockaddr_in back{AF_INET, htons(udpPort), {htonl(INADDR_LOOPBACK)}, {}};
  for (unsigned i = 0; i < 20; ++i) {
    const Bytes m = pattern(1 + i, i);
    Bytes got(m.size());
    send(u, m);
    ASSERT_TRUE(raw::receiveExactly(peer, got.data(), m.size(), 5000)) << i;
    EXPECT_EQ(m, got);
    ASSERT_EQ(long(m.size()),
              ::sendto(peer, m.data(), m.size(), 0, reinterpret_cast<const sockaddr*>(&back), sizeof back));
    ASSERT_TRUE(nextMessage(u, m)) << i;
  }
  raw::closeFd(peer);
}

// Descriptors used up: a socket that can't be made never connects, a
// connection that can't be accepted waits in the system's backlog, and a
// thread that can't get its wake-up descriptor fails its waits until it can.
TEST_F(SyscallTest, UsedUpDescriptorsFailAsWinsockWouldAndRecover) {
  N_Socket::ConnectData* data = nullptr;
  {
    N_Listener listener(port());
    platform::sys::calls().socket = noDescriptor;
    N_Socket never(loopback(), port(), N_Socket::SOCKET_TCP), neverUdp(loopback(), port() + 1, N_Socket::SOCKET_UDP);
    send(neverUdp, Bytes{'x'});  // goes nowhere, and costs nothing else
    EXPECT_TRUE(staysFalse([&] { return never.isConnected() || listener.pollConnect(data); }, 300));
    platform::sys::restore();

    // A failed accept is an entry without a socket, as WSAAccept's failure
    // is; the connection itself waits in the backlog for the next accept.
    platform::sys::calls().accept4 = noDescriptorAccept;
    N_Socket later(loopback(), port(), N_Socket::SOCKET_TCP);
    ASSERT_TRUE(waitFor([&] { return listener.pollConnect(data); }));
    EXPECT_EQ(platform::INVALID_SOCKET, data->socket);
    listener.rejectConnect(data);
    platform::sys::restore();
    ASSERT_TRUE(waitFor([&] {
      while (listener.pollConnect(data) && data->socket == platform::INVALID_SOCKET) listener.rejectConnect(data);
      return listener.pollConnect(data);
    }));
    N_Socket in(data);
    ASSERT_TRUE(waitFor([&] { return later.isConnected() && in.isConnected(); }));
    exchange(later, in, 5);
  }
  // A new runtime whose network thread can't make its wake-up descriptor.
  stopRuntime();
  platform::sys::calls().eventfd = noEventfd;
  N_Initializer runtime;
  N_Address host("127.0.0.1");
  N_Listener second(port());
  N_Socket out(&host, port(), N_Socket::SOCKET_TCP);
  EXPECT_TRUE(staysFalse([&] { return second.pollConnect(data); }, 300));
  platform::sys::restore();
  ASSERT_TRUE(waitFor([&] { return second.pollConnect(data); }, 10000));
  N_Socket accepted(data);
  ASSERT_TRUE(waitFor([&] { return out.isConnected() && accepted.isConnected(); }));
  exchange(out, accepted, 5);
}

}  // namespace
