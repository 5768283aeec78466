// Shared pieces of the transport tests: a running runtime on 127.0.0.1 with an
// allocation balance check at its stop, connected socket pairs, message
// patterns, and a socket that records what its receive() gets.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Listener.h"
#include "N_Socket.h"
#include "Q_Memory.h"
#include "Q_System.h"
#include "fault.h"
#include "raw_socket.h"
#include "vardel_platform.h"
#include "win32.h"
#include "winsock.h"

// White-box access to the socket's private parts, for cases that the public
// interface can't reach deterministically (a read cut exactly so, an error
// completion). Everything else goes through real loopback sockets.
struct N_SocketTestAccess {
  static void read(N_Socket& socket, const void* bytes, unsigned int size) {
    N_Socket::injectRead(&socket, bytes, size);
  }
  static void readString(N_Socket& socket, const std::vector<unsigned char>& bytes) {
    read(socket, bytes.data(), static_cast<unsigned int>(bytes.size()));
  }
  static void failedRead(N_Socket& socket, platform::DWORD error) {
    N_Socket::injectRead(&socket, nullptr, 0, error);
  }
  static const char* errorName(int code) { return N_Socket::getWSErrorName(code); }
  static bool streamBroken(const N_Socket& socket) { return socket.m_bStreamBroken; }
};

namespace transport_test {

using Bytes = std::vector<unsigned char>;
using Clock = std::chrono::steady_clock;

inline bool waitFor(const std::function<bool()>& done, int milliseconds = 5000) {
  auto deadline = Clock::now() + std::chrono::milliseconds(milliseconds);
  while (!done()) {
    if (Clock::now() > deadline) return false;
    platform::Sleep(1);
  }
  return true;
}

// True if `condition` stays false for the whole time.
inline bool staysFalse(const std::function<bool()>& condition, int milliseconds) {
  return !waitFor(condition, milliseconds);
}

// Bytes that differ from message to message and from position to position,
// so a shifted, cut or mixed-up message can't pass for the right one.
inline Bytes pattern(std::size_t size, unsigned seed) {
  Bytes out(size);
  std::uint32_t x = seed * 2654435761u + 12345u;
  for (std::size_t i = 0; i < size; ++i) {
    x = x * 1103515245u + 12345u;
    out[i] = static_cast<unsigned char>(x >> 16);
  }
  return out;
}

inline Bytes le32(std::uint32_t v) {
  return {static_cast<unsigned char>(v), static_cast<unsigned char>(v >> 8), static_cast<unsigned char>(v >> 16),
          static_cast<unsigned char>(v >> 24)};
}

// A packaged message as it stands on the stream.
inline Bytes framed(const Bytes& payload) {
  Bytes out = le32(static_cast<std::uint32_t>(payload.size()));
  out.insert(out.end(), payload.begin(), payload.end());
  return out;
}

inline Bytes concat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes& p : parts) out.insert(out.end(), p.begin(), p.end());
  return out;
}

inline void send(N_Socket& socket, const Bytes& message) {
  socket.send(const_cast<unsigned char*>(message.data()), static_cast<unsigned int>(message.size()));
}

// The next message that poll() gives within the time, copied out.
inline bool pollMessage(N_Socket& socket, Bytes& out, int milliseconds = 5000) {
  void* data = nullptr;
  unsigned int size = 0;
  if (!waitFor([&] { return socket.poll(data, size); }, milliseconds)) return false;
  const auto* p = static_cast<const unsigned char*>(data);
  out.assign(p, p + size);
  return true;
}

// Keeps a copy of each message its receive() gets, and keeps or frees the
// message by `keep`.
class RecordingSocket : public N_Socket {
 public:
  ~RecordingSocket() { destruct(); }
  bool receive(void* data, unsigned int size) override {
    const auto* p = static_cast<const unsigned char*>(data);
    std::lock_guard<std::mutex> hold(m_lock);
    m_messages.emplace_back(p, p + size);
    return keep.load();
  }
  std::size_t count() {
    std::lock_guard<std::mutex> hold(m_lock);
    return m_messages.size();
  }
  std::vector<Bytes> messages() {
    std::lock_guard<std::mutex> hold(m_lock);
    return m_messages;
  }
  bool waitCount(std::size_t n, int milliseconds = 10000) {
    return waitFor([&] { return count() >= n; }, milliseconds);
  }

  std::atomic<bool> keep{false};

 private:
  std::mutex m_lock;
  std::vector<Bytes> m_messages;
};

// Verbose lines of the library, collected for the tests that check them.
class VerboseCapture {
 public:
  VerboseCapture() {
    clear();
    Sys->setVerboseSink(&VerboseCapture::sink);
  }
  ~VerboseCapture() { Sys->setVerboseSink(nullptr); }
  static std::vector<std::string> lines() {
    std::lock_guard<std::mutex> hold(lock());
    return store();
  }
  static void clear() {
    std::lock_guard<std::mutex> hold(lock());
    store().clear();
  }

 private:
  static void sink(const char* line) {
    std::lock_guard<std::mutex> hold(lock());
    store().emplace_back(line);
  }
  static std::mutex& lock() {
    static std::mutex m;
    return m;
  }
  static std::vector<std::string>& store() {
    static std::vector<std::string> s;
    return s;
  }
};

// A running runtime whose host is 127.0.0.1. At the end every allocation of
// the library must have been given back, once the runtime has stopped.
class TransportTest : public ::testing::Test {
 protected:
  void SetUp() override {
    platform::fault::disarmAll();
    m_iRefusalsSeen = platform::fault::allocationsFailed();
    platform::setLocalHost("127.0.0.1");
    m_iNewBefore = Q_Memory::sm_iNewCount.load();
    m_iDeleteBefore = Q_Memory::sm_iDeleteCount.load();
    m_runtime = std::make_unique<N_Initializer>();
    m_loopback = std::make_unique<N_Address>("127.0.0.1");
  }

  void TearDown() override {
    disarmFaults();
    stopRuntime();
    if (m_bCheckBalance) {
      // An allocation that the fault refused is counted all the same, and
      // never released. Resolver threads that nobody joins may still be
      // giving back their blocks for a moment.
      bool balanced = waitFor([&] { return outstanding() == m_iRefused; }, 5000);
      EXPECT_TRUE(balanced) << "library allocations not given back: " << outstanding() - m_iRefused;
    }
  }

  // The library's `nth` allocation from now gives nothing. Use these two
  // rather than platform::fault directly, so the balance knows of it.
  void failAllocation(int nth) {
    countRefusals();
    platform::fault::failAllocation(nth);  // starts its count anew
    m_iRefusalsSeen = 0;
  }
  void disarmFaults() {
    countRefusals();
    platform::fault::disarmAll();  // leaves the count as it is
  }

  void stopRuntime() {
    m_loopback.reset();
    m_runtime.reset();
  }

  int outstanding() const {
    return (Q_Memory::sm_iNewCount.load() - m_iNewBefore) - (Q_Memory::sm_iDeleteCount.load() - m_iDeleteBefore);
  }

  const N_Address* loopback() const { return m_loopback.get(); }

  // `out` connects to `listener`, `in` takes the accepted end; both are
  // connected on return.
  bool connectPair(N_Listener& listener, int port, N_Socket& in, N_Socket& out) {
    out.construct(loopback(), port, N_Socket::SOCKET_TCP);
    N_Socket::ConnectData* data = nullptr;
    if (!waitFor([&] { return listener.pollConnect(data); })) return false;
    in.construct(data);
    return waitFor([&] { return out.isConnected(); });
  }

  // A library socket accepted from a raw Linux client; `fd` is the client.
  bool acceptRaw(N_Listener& listener, int port, N_Socket& in, int& fd) {
    fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(port));
    if (fd < 0) return false;
    N_Socket::ConnectData* data = nullptr;
    if (!waitFor([&] { return listener.pollConnect(data); })) return false;
    in.construct(data);
    return true;
  }

  // A library socket connected to a raw Linux listener; `fd` is the
  // accepted raw end.
  bool connectRaw(N_Socket& out, int& fd) {
    std::uint16_t port = 0;
    int listening = raw::listenOn("127.0.0.1", port);
    if (listening < 0) return false;
    out.construct(loopback(), port, N_Socket::SOCKET_TCP);
    fd = raw::acceptOne(listening, 5000);
    raw::closeFd(listening);
    return fd >= 0 && waitFor([&] { return out.isConnected(); });
  }

  static int freePort(bool pairWithNext = false) { return raw::freePort(pairWithNext); }

  bool m_bCheckBalance = true;

 private:
  std::unique_ptr<N_Initializer> m_runtime;
  std::unique_ptr<N_Address> m_loopback;
  int m_iNewBefore = 0;
  int m_iDeleteBefore = 0;
  int m_iRefused = 0;
  int m_iRefusalsSeen = 0;

  void countRefusals() {
    int now = platform::fault::allocationsFailed();
    m_iRefused += now - m_iRefusalsSeen;
    m_iRefusalsSeen = now;
  }
};

}  // namespace transport_test
