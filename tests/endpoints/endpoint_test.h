// What the endpoint tests share beyond RuntimeTest: message patterns, socket
// pairs against library or raw Linux ends, recording sockets and listeners.
#pragma once

#include <mutex>
#include <vector>

#include "N_Exceptions.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "fault.h"
#include "raw_socket.h"
#include "runtime_test.h"
#include "win32.h"
#include "winsock.h"

// Feeds a read cut exactly so (or an error completion) to the receive path,
// which loopback can't be made to do deterministically.
struct N_SocketTestAccess {
  static void read(N_Socket& s, const void* bytes, unsigned size, platform::DWORD error = 0) {
    N_Socket::injectRead(&s, bytes, size, error);
  }
};

using Bytes = std::vector<unsigned char>;
using platform::fault::Call;

// Differs from message to message and position to position, so a shifted,
// cut or mixed-up message can't pass for the right one.
inline Bytes pattern(std::size_t size, unsigned seed) {
  Bytes out(size);
  std::uint32_t x = seed * 2654435761u + 12345u;
  for (auto& b : out) b = static_cast<unsigned char>((x = x * 1103515245u + 12345u) >> 16);
  return out;
}
inline Bytes le32(std::uint32_t v) { return {Bytes::value_type(v), Bytes::value_type(v >> 8), Bytes::value_type(v >> 16), Bytes::value_type(v >> 24)}; }
inline Bytes concat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes& p : parts) out.insert(out.end(), p.begin(), p.end());
  return out;
}
inline Bytes framed(const Bytes& payload) { return concat({le32(static_cast<std::uint32_t>(payload.size())), payload}); }
inline Bytes slice(const Bytes& b, std::size_t from, std::size_t to) { return Bytes(b.begin() + from, b.begin() + to); }
inline void send(N_Socket& s, const Bytes& m) { s.send(const_cast<unsigned char*>(m.data()), static_cast<unsigned>(m.size())); }
inline void inject(N_Socket& s, const Bytes& read) { N_SocketTestAccess::read(s, read.data(), static_cast<unsigned>(read.size())); }
inline bool rawSend(int fd, const Bytes& b) { return raw::sendAll(fd, b.data(), b.size()); }

// The next message poll() gives within the time is `expected`.
inline ::testing::AssertionResult nextMessage(N_Socket& s, const Bytes& expected, int milliseconds = 5000) {
  void* data = nullptr;
  unsigned size = 0;
  if (!waitFor([&] { return s.poll(data, size); }, milliseconds)) return ::testing::AssertionFailure() << "no message";
  if (Bytes(static_cast<unsigned char*>(data), static_cast<unsigned char*>(data) + size) != expected)
    return ::testing::AssertionFailure() << size << " bytes, not the " << expected.size() << " expected";
  return ::testing::AssertionSuccess();
}
// Nothing more to poll within the time.
inline bool noMessage(N_Socket& s, int milliseconds = 100) {
  void* data = nullptr;
  unsigned size = 0;
  return staysFalse([&] { return s.poll(data, size); }, milliseconds);
}
// The socket of the next disconnect event within the time, null if none.
inline const N_Socket* nextDisconnect(int milliseconds = 5000) {
  const N_Socket* reported = nullptr;
  return waitFor([&] { return N_Socket::pollDisconnect(reported); }, milliseconds) ? reported : nullptr;
}

// Keeps a copy of each message its receive() gets.
class RecordingSocket : public N_Socket {
 public:
  ~RecordingSocket() { destruct(); }
  bool receive(void* data, unsigned size) override {
    std::lock_guard<std::mutex> hold(m_lock);
    m_messages.emplace_back(static_cast<unsigned char*>(data), static_cast<unsigned char*>(data) + size);
    return keep;  // set before the socket is constructed
  }
  std::vector<Bytes> messages() {
    std::lock_guard<std::mutex> hold(m_lock);
    return m_messages;
  }
  bool keep = false;
  std::mutex m_lock;
  std::vector<Bytes> m_messages;
};

class CountingListener : public N_Listener {
 public:
  explicit CountingListener(int port) : N_Listener(port) {}
  ~CountingListener() { destruct(); }
  void receiveConnect(N_Socket::ConnectData* data) override {
    N_Socket::ConnectData* queued = nullptr;
    queuedFirst += pollConnect(queued) && queued == data;  // queued before the call
    ++calls;
  }
  std::atomic<int> calls{0}, queuedFirst{0};
};

class EndpointTest : public RuntimeTest {
 protected:
  // `out` connects to `listener`, `in` takes the accepted end.
  bool connectPair(N_Listener& listener, int port, N_Socket& in, N_Socket& out) {
    out.construct(loopback(), port, N_Socket::SOCKET_TCP);
    N_Socket::ConnectData* data = nullptr;
    if (!waitFor([&] { return listener.pollConnect(data); })) return false;
    in.construct(data);
    return waitFor([&] { return out.isConnected(); });
  }
  // A library socket accepted from a raw client `fd`.
  bool acceptRaw(N_Listener& listener, int port, N_Socket& in, int& fd) {
    fd = raw::connectTo("127.0.0.1", port);
    N_Socket::ConnectData* data = nullptr;
    if (fd < 0 || !waitFor([&] { return listener.pollConnect(data); })) return false;
    in.construct(data);
    return true;
  }
  // A library socket connected to a raw listener; `fd` is the raw end.
  bool connectRaw(N_Socket& out, int& fd) {
    std::uint16_t p = 0;
    int listening = raw::listenOn("127.0.0.1", p);
    out.construct(loopback(), p, N_Socket::SOCKET_TCP);
    fd = raw::acceptOne(listening, 5000);
    raw::closeFd(listening);
    return fd >= 0 && waitFor([&] { return out.isConnected(); });
  }
  static bool portClosed(int port) {
    const int fd = raw::connectTo("127.0.0.1", port);
    return raw::closeFd(fd), fd < 0;
  }
};
