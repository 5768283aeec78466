// The system as it behaves on a busy host, through the table of Linux calls
// under the platform layer: writes that take a few bytes, reads and waits
// interrupted or refused for the moment, registrations with the wait refused,
// descriptors used up. The streams must come through whole and in order, and
// what can't be made must fail the way the matching Winsock error does, never
// end the process.
#include <netinet/in.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_System.h"
#include "raw_socket.h"
#include "runtime_test.h"
#include "syscalls.h"

namespace {

// Calls of each kind so far: each fake goes through its own cycle.
std::atomic<int> g_sends{0}, g_receives{0}, g_polls{0}, g_registrations{0};

// At most `limit` bytes of the message's buffers.
msghdr cut(const msghdr* message, iovec* iov, std::size_t limit) {
  msghdr shorter = *message;
  std::size_t n = 0;
  for (std::size_t i = 0; i < message->msg_iovlen && limit > 0; ++i, ++n) {
    iov[i] = message->msg_iov[i];
    iov[i].iov_len = std::min(iov[i].iov_len, limit);
    limit -= iov[i].iov_len;
  }
  shorter.msg_iov = iov;
  shorter.msg_iovlen = n;
  return shorter;
}

bool isStream(int fd) {
  int type = 0;
  socklen_t length = sizeof type;
  return ::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) == 0 && type == SOCK_STREAM;
}

// The first call of every `cycle` is interrupted, the second refused for
// now (errno set, true); the others go on.
bool interrupted(std::atomic<int>& calls, int cycle) {
  const int turn = calls++ % cycle;
  if (turn > 1) return false;
  errno = turn == 0 ? EINTR : EAGAIN;
  return true;
}

// The rest write three bytes at most of a stream (a datagram goes whole or
// not).
long choppySendmsg(int fd, const msghdr* message, int flags) {
  if (interrupted(g_sends, 4)) return -1;
  if (!isStream(fd)) return ::sendmsg(fd, message, flags);
  iovec iov[1024];
  msghdr shorter = cut(message, iov, 3);
  return ::sendmsg(fd, &shorter, flags);
}

long choppyRecvmsg(int fd, msghdr* message, int flags) {
  if (interrupted(g_receives, 3)) return -1;
  if (!isStream(fd)) return ::recvmsg(fd, message, flags);
  iovec iov[8];
  msghdr shorter = cut(message, iov, 5);
  long got = ::recvmsg(fd, &shorter, flags);
  message->msg_flags = shorter.msg_flags;
  return got;
}

// A wait that wakes with nothing every other time (a look without waiting
// still sees what is ready).
int restlessWait(int epfd, epoll_event* events, int count, int timeout) {
  if (timeout != 0 && g_polls++ % 2 == 0) return 0;
  return ::epoll_wait(epfd, events, count, timeout);
}

// One change of a registration in five is refused for want of memory.
int forgetfulRegistration(int epfd, int op, int fd, epoll_event* event) {
  if (g_registrations++ % 5 == 4) {
    errno = ENOMEM;
    return -1;
  }
  return ::epoll_ctl(epfd, op, fd, event);
}

int noDescriptor(int, int, int) {
  errno = EMFILE;
  return -1;
}
int noDescriptorAccept(int, sockaddr*, unsigned int*, int) {
  errno = EMFILE;
  return -1;
}
int noEventfd(unsigned int, int) {
  errno = EMFILE;
  return -1;
}

class SyscallTest : public RuntimeTest {
 protected:
  void TearDown() override {
    platform::sys::restore();
    RuntimeTest::TearDown();
  }
  // A connected pair through `listener` on `port`, packaged at both ends.
  bool connectPair(N_Listener& listener, int port, N_Socket& in, N_Socket& out) {
    out.construct(loopback(), port, N_Socket::SOCKET_TCP);
    N_Socket::ConnectData* data = nullptr;
    if (!waitFor([&] { return listener.pollConnect(data); })) return false;
    in.construct(data);
    return waitFor([&] { return out.isConnected() && in.isConnected(); });
  }
  static std::string payload(int i) { return std::string(static_cast<std::size_t>(i * 37 % 700), char('a' + i % 26)); }
  // Sends `count` messages each way and expects each whole and in order.
  static void exchange(N_Socket& a, N_Socket& b, int count) {
    for (int i = 0; i < count; ++i) {
      std::string m = payload(i);
      a.send(m.data(), static_cast<unsigned>(m.size()));
      b.send(m.data(), static_cast<unsigned>(m.size()));
    }
    for (N_Socket* to : {&b, &a}) {
      for (int i = 0; i < count; ++i) {
        void* data = nullptr;
        unsigned size = 0;
        ASSERT_TRUE(waitFor([&] { return to->poll(data, size); }, 20000)) << "message " << i;
        ASSERT_EQ(payload(i), std::string(static_cast<char*>(data), size)) << "message " << i;
      }
    }
  }
};

TEST_F(SyscallTest, StreamsComeThroughShortWritesInterruptionsAndRefusals) {
  N_Listener listener(port());
  N_Socket a, b, c, d;
  ASSERT_TRUE(connectPair(listener, port(), b, a));
  ASSERT_TRUE(connectPair(listener, port(), d, c));
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
  const std::uint16_t udpPort = static_cast<std::uint16_t>(freePort());
  const int peer = raw::udpBound("127.0.0.2", udpPort);
  ASSERT_GE(peer, 0);
  N_Socket u(&other, udpPort, N_Socket::SOCKET_UDP);
  sockaddr_in back{};
  back.sin_family = AF_INET;
  back.sin_port = htons(udpPort);
  back.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  for (int i = 0; i < 20; ++i) {
    std::string m = "d" + std::to_string(i);
    u.send(m.data(), static_cast<unsigned>(m.size()));
    char got[64] = {};
    ASSERT_TRUE(raw::receiveExactly(peer, got, m.size(), 5000)) << i;
    EXPECT_EQ(m, std::string(got, m.size()));
    ASSERT_EQ(static_cast<long>(m.size()),
              ::sendto(peer, m.data(), m.size(), 0, reinterpret_cast<sockaddr*>(&back), sizeof back));
    void* data = nullptr;
    unsigned size = 0;
    ASSERT_TRUE(waitFor([&] { return u.poll(data, size); })) << i;
    EXPECT_EQ(m, std::string(static_cast<char*>(data), size));
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
    N_Socket never(loopback(), port(), N_Socket::SOCKET_TCP);
    N_Socket neverUdp(loopback(), port() + 1, N_Socket::SOCKET_UDP);
    char byte = 'x';
    neverUdp.send(&byte, 1);  // goes nowhere, and costs nothing else
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
    auto accepted = [&] {
      while (listener.pollConnect(data)) {
        if (data->socket != platform::INVALID_SOCKET) return true;
        listener.rejectConnect(data);
      }
      return false;
    };
    ASSERT_TRUE(waitFor(accepted));
    N_Socket in(data);
    ASSERT_TRUE(waitFor([&] { return later.isConnected() && in.isConnected(); }));
    exchange(later, in, 5);
  }
  // A new runtime whose network thread can't make its wake-up descriptor.
  stopRuntime();
  platform::sys::calls().eventfd = noEventfd;
  {
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
}

}  // namespace
