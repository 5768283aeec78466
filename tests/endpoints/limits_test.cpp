// What the receive side and the listeners do under N_Limits: the largest
// length a socket takes, memory that follows what arrived rather than what
// a prefix claims, a receive backlog that makes TCP push back, and accepts
// that rest after a failure instead of spinning.
#include <malloc.h>

#include <cstdlib>
#include <new>
#include <thread>

#include "limits_guard.h"
#include "transport_fixture.h"

using namespace transport_test;

// Heap bytes in use by the whole process, counted at every array
// allocation (the library's buffers are arrays).
static std::atomic<long long> g_arrayBytes{0};

void* operator new[](std::size_t size) {
  void* p = std::malloc(size == 0 ? 1 : size);
  if (p == nullptr) throw std::bad_alloc();
  g_arrayBytes += static_cast<long long>(malloc_usable_size(p));
  return p;
}
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept {
  void* p = std::malloc(size == 0 ? 1 : size);
  if (p != nullptr) g_arrayBytes += static_cast<long long>(malloc_usable_size(p));
  return p;
}
void operator delete[](void* p) noexcept {
  if (p == nullptr) return;
  g_arrayBytes -= static_cast<long long>(malloc_usable_size(p));
  std::free(p);
}
void operator delete[](void* p, std::size_t) noexcept { operator delete[](p); }
void operator delete[](void* p, const std::nothrow_t&) noexcept { operator delete[](p); }

namespace {

class LimitsTest : public TransportTest {};

TEST_F(LimitsTest, ValuesOutsideTheirRangeAreHeldToIt) {
  N_Limits limits = N_Limits::openNetwork();
  for (unsigned asked : {0u, 0x80000000u, 0xFFFFFFFFu}) {
    limits.uMaximumMessageSize = asked;
    LimitsGuard guard(limits);
    EXPECT_EQ(0x7FFFFFFBu, N_Initializer::getLimits().uMaximumMessageSize) << asked;
  }
  EXPECT_EQ(64u << 20, N_Initializer::getLimits().uMaximumMessageSize);
}

// A length up to the cap is collected; one above it ends the connection.
TEST_F(LimitsTest, TheLargestLengthIsTheCap) {
  for (const N_Limits& limits : {N_Limits::defaults(), N_Limits::openNetwork()}) {
    LimitsGuard guard(limits);
    const std::uint32_t cap = limits.uMaximumMessageSize;
    for (std::uint32_t length : {cap, cap + 1}) {
      SCOPED_TRACE(::testing::Message() << "length " << length);
      N_Socket in(loopback(), freePort(), N_Socket::SOCKET_TCP);
      N_SocketTestAccess::readString(in, concat({framed(pattern(8, 1)), le32(length), pattern(100, 2)}));
      Bytes got;
      ASSERT_TRUE(pollMessage(in, got, 0));
      EXPECT_EQ(pattern(8, 1), got);
      EXPECT_EQ(length > cap, N_SocketTestAccess::streamBroken(in));
      EXPECT_EQ(length > cap ? 0 : static_cast<int>(length) + 4, in.getReceivePacketSize());
    }
  }
}

// With compact messages a prefix that claims 16 MiB holds about what came,
// the block grows as the rest comes, and short messages don't keep the
// 64 KiB read buffer. By default the block is the claimed size at once.
TEST_F(LimitsTest, CompactMessagesHoldWhatArrived) {
  for (bool compact : {false, true}) {
    SCOPED_TRACE(compact ? "compact" : "default");
    N_Limits limits = N_Limits::defaults();
    limits.uMaximumMessageSize = 32u << 20;
    limits.bCompactMessages = compact;
    LimitsGuard guard(limits);
    N_Socket in(loopback(), freePort(), N_Socket::SOCKET_TCP);
    const Bytes big = pattern(16u << 20, 3);
    const Bytes stream = framed(big);
    long long before = g_arrayBytes.load();
    N_SocketTestAccess::read(in, stream.data(), 1000);
    long long held = g_arrayBytes.load() - before;
    if (compact)
      EXPECT_LT(held, 64 << 10);
    else
      EXPECT_GT(held, 16 << 20);
    for (std::size_t at = 1000; at < stream.size(); at += 60000)
      N_SocketTestAccess::read(in, stream.data() + at, static_cast<unsigned>(std::min<std::size_t>(60000, stream.size() - at)));
    Bytes got;
    ASSERT_TRUE(pollMessage(in, got, 0));
    EXPECT_TRUE(got == big);

    // 200 short messages, one per read, waiting to be polled.
    before = g_arrayBytes.load();
    for (int i = 0; i < 200; ++i) N_SocketTestAccess::readString(in, framed(pattern(8, i)));
    held = g_arrayBytes.load() - before;
    if (compact)
      EXPECT_LT(held, 200 * 1024);
    else
      EXPECT_GE(held, 200LL * 65536);
    for (int i = 0; i < 200; ++i) {
      ASSERT_TRUE(pollMessage(in, got, 0));
      EXPECT_EQ(pattern(8, i), got);
    }
  }
}

// A peer that writes more than the receive backlog is held back by TCP
// until the application polls; then everything arrives, in order.
TEST_F(LimitsTest, ReceiveBacklogPushesBackOnThePeer) {
  N_Limits limits = N_Limits::openNetwork();
  limits.uReceiveBacklog = 256 << 10;
  LimitsGuard guard(limits);
  int port = freePort();
  N_Listener listener(port);
  N_Socket in;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, in, fd));
  constexpr int kMessages = 12000;  // 12 MiB, beyond what the system buffers of both ends hold
  std::atomic<bool> written{false};
  std::thread writer([&] {
    for (int i = 0; i < kMessages; ++i) {
      Bytes m = framed(pattern(1024, static_cast<unsigned>(i)));
      if (!raw::sendAll(fd, m.data(), m.size())) break;
    }
    written = true;
  });
  // Reading stops near the bound, each message charged for its record (one
  // read may land beyond it).
  const auto cost = [&] {
    return in.getQueuedReceiveBytes() + std::uint64_t{N_Limits::kMessageCharge} * in.getQueuedReceiveMessages();
  };
  EXPECT_TRUE(waitFor([&] { return cost() >= limits.uReceiveBacklog; }));
  EXPECT_TRUE(staysFalse([&] { return written.load(); }, 300));
  EXPECT_EQ(in.getQueuedReceiveBytes(), 1024 * in.getQueuedReceiveMessages());
  EXPECT_LE(cost(), limits.uReceiveBacklog + (65536 + 4096) / 1024 * (1024 + N_Limits::kMessageCharge));
  Bytes got;
  for (int i = 0; i < kMessages; ++i) {
    ASSERT_TRUE(pollMessage(in, got)) << i;
    ASSERT_EQ(pattern(1024, static_cast<unsigned>(i)), got) << i;
  }
  writer.join();
  EXPECT_TRUE(written.load());
  EXPECT_EQ(0u, in.getQueuedReceiveBytes());
  EXPECT_EQ(0u, in.getQueuedReceiveMessages());
  raw::closeFd(fd);
}

// What a peer that doesn't read leaves waiting is counted in bytes, prefixes
// included, and in messages, until it reads.
TEST_F(LimitsTest, WhatWaitsToBeSentIsCountedUntilItLeaves) {
  const int port = freePort();
  N_Listener listener(port);
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(acceptRaw(listener, port, out, fd));
  constexpr int kMessages = 4000;  // 4 MiB, beyond what the system buffers of both ends hold
  for (int i = 0; i < kMessages; ++i) out.send(pattern(1024, static_cast<unsigned>(i)).data(), 1024);
  EXPECT_TRUE(waitFor([&] { return out.getQueuedSendMessages() < kMessages; }));
  EXPECT_TRUE(staysFalse([&] { return out.getQueuedSendMessages() == 0; }, 200));
  EXPECT_EQ((1024u + 4) * out.getQueuedSendMessages(), out.getQueuedSendBytes());
  std::uint64_t received = 0;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (received < std::uint64_t{kMessages} * 1028 && std::chrono::steady_clock::now() < deadline)
    received += raw::receiveFor(fd, 100).size();
  EXPECT_EQ(std::uint64_t{kMessages} * 1028, received);
  EXPECT_TRUE(waitFor([&] { return out.getQueuedSendMessages() == 0; }));
  EXPECT_EQ(0u, out.getQueuedSendBytes());
  raw::closeFd(fd);
}

}  // namespace
