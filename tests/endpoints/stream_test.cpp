// The packaged TCP stream: a 4-byte little-endian length and the payload.
// Raw Linux peers read and write it byte by byte; where the exact cut of a
// read matters, the read is fed to the receive path directly.
#include <algorithm>
#include <random>
#include <utility>

#include "endpoint_test.h"
#include "limits_guard.h"
#include "raw_peer.h"

namespace {

class StreamTest : public EndpointTest {
 protected:
  // A library socket accepted from a raw writer that sends without delay.
  void open(N_Socket& in, int& fd) {
    m_listener = std::make_unique<N_Listener>(port());
    ASSERT_TRUE(acceptRaw(*m_listener, port(), in, fd));
    raw_peer::noDelay(fd);
  }
  // Writes one piece and gives the network thread time to read it alone.
  static void write(int fd, const Bytes& piece) {
    ASSERT_TRUE(rawSend(fd, piece));
    platform::Sleep(30);
  }
  static Bytes readWire(int fd, std::size_t size) {
    Bytes wire(size);
    if (!raw::receiveExactly(fd, wire.data(), size, 10000)) wire.clear();
    return wire;
  }
  void TearDown() override {
    m_listener.reset();
    RuntimeTest::TearDown();
  }
  std::unique_ptr<N_Listener> m_listener;
};

TEST_F(StreamTest, MessagesAreExactOnTheWire) {
  std::uint16_t p = 0;
  const int listening = raw::listenOn("127.0.0.1", p);
  N_Socket out(loopback(), p, N_Socket::SOCKET_TCP);
  send(out, Bytes{'h', 'e', 'l', 'l', 'o'});  // before the connect completes
  send(out, Bytes{'h', 'i'});
  send(out, Bytes{});
  const int fd = raw::acceptOne(listening, 5000);
  raw::closeFd(listening);
  EXPECT_EQ(Bytes({5, 0, 0, 0, 'h', 'e', 'l', 'l', 'o', 2, 0, 0, 0, 'h', 'i', 0, 0, 0, 0}), readWire(fd, 19));

  // A big message leaves in chunks that add no bytes of their own; the
  // caller's buffer is free as soon as send returns.
  Bytes big = pattern(200000, 1), sent = big;
  send(out, big);
  std::fill(big.begin(), big.end(), 0xEE);
  EXPECT_TRUE(concat({Bytes{0x40, 0x0D, 0x03, 0x00}, sent}) == readWire(fd, 200004));
  EXPECT_TRUE(raw::receiveFor(fd, 200).empty());

  // Without the package the stream carries bare bytes, up to the limit.
  out.disablePackage();
  const unsigned s = static_cast<unsigned>(out.getMaximumSendPacketSize());
  EXPECT_EQ(65536u, s);
  send(out, Bytes{1, 2, 3});
  send(out, Bytes{});
  const int waiting = out.getBytesWaitingForSend();
  EXPECT_THROW(send(out, pattern(s + 1, 2)), N_NetException_PacketTooBig*);
  EXPECT_LE(out.getBytesWaitingForSend(), waiting);
  send(out, pattern(s, 3));
  EXPECT_EQ(concat({Bytes{1, 2, 3}, pattern(s, 3)}), readWire(fd, s + 3));
  out.enablePackage();
  send(out, Bytes{9});
  EXPECT_EQ(Bytes({1, 0, 0, 0, 9}), readWire(fd, 5));
  raw::closeFd(fd);
}

// Reads cut at every kind of place: inside a prefix, between prefix and
// body, several messages (zero-length ones too) in one read. receive() and
// poll() see the same messages.
TEST_F(StreamTest, ReadsCutAnywhereGiveTheSameMessages) {
  const Bytes a = pattern(5, 1), b = pattern(10, 2), e, ab = concat({framed(a), framed(b)});
  const Bytes mixed = concat({framed(e), framed(a), framed(e), framed(e), framed(b), framed(e), framed(a), framed(e), framed(e)});
  struct Case { Bytes stream; std::vector<std::size_t> cuts; std::vector<Bytes> messages; };
  for (const Case& c : {Case{ab, {11, 13}, {a, b}}, Case{ab, {1, 4}, {a, b}}, Case{ab, {3, 6, 10}, {a, b}},
                        Case{ab, {2, 4, 9, 12, 14}, {a, b}}, Case{mixed, {4, 17, 19, 21, 48, 48}, {e, a, e, e, b, e, a, e, e}}}) {
    RecordingSocket in;
    in.keep = true;
    in.construct(loopback(), freePort(), N_Socket::SOCKET_TCP);
    std::size_t at = 0;
    for (std::size_t cut : c.cuts) inject(in, slice(c.stream, std::exchange(at, cut), cut));
    inject(in, slice(c.stream, at, c.stream.size()));
    EXPECT_EQ(c.messages, in.messages());
    Bytes got;
    for (const Bytes& m : c.messages) {
      ASSERT_TRUE(nextMessage(in, m, 0));
    }
    EXPECT_FALSE(pollMessage(in, got, 0));
  }
}

// A long run of messages of mixed sizes, the stream cut at random points.
TEST_F(StreamTest, RandomCutsOnTheWireDeliverEveryMessageIntact) {
  RecordingSocket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  std::mt19937 random(1234);
  std::vector<Bytes> sent;
  Bytes stream;
  for (unsigned i = 0; i < 300; ++i) {
    std::size_t size = random() % 10 == 0 ? 0 : random() % 8 == 0 ? 60000 + random() % 20000 : random() % 300;
    sent.push_back(pattern(size, i));
    stream = concat({stream, framed(sent.back())});
  }
  for (std::size_t at = 0, piece; at < stream.size(); at += piece) {
    piece = std::min<std::size_t>(1 + random() % (random() % 3 == 0 ? 9 : 9000), stream.size() - at);
    ASSERT_TRUE(raw::sendAll(fd, stream.data() + at, piece));
    if (random() % 16 == 0) platform::Sleep(2);
  }
  ASSERT_TRUE(in.waitCount(sent.size(), 20000)) << in.messages().size();
  EXPECT_TRUE(sent == in.messages());
  raw::closeFd(fd);
}

// A length with the top bit set or above the cap ends that connection, and
// only that one: the messages in front arrive, the application sees one
// disconnect, and what follows on the broken stream is dropped.
TEST_F(StreamTest, ImpossibleLengthEndsOnlyItsConnection) {
  N_Listener listener(port());
  for (std::uint32_t nonsense : {0xFFFFFFFFu, 0x80000000u, (64u << 20) + 1}) {
    for (bool split : {false, true}) {
      SCOPED_TRACE(::testing::Message() << std::hex << nonsense << (split ? " split" : " whole"));
      N_Socket bad, good;
      int badFd = -1, goodFd = -1;
      ASSERT_TRUE(acceptRaw(listener, port(), bad, badFd));
      ASSERT_TRUE(acceptRaw(listener, port(), good, goodFd));
      raw_peer::noDelay(badFd);
      const Bytes a = pattern(50, 1);
      if (split) write(badFd, concat({framed(a), slice(le32(nonsense), 0, 2)}));
      write(badFd, concat({split ? slice(le32(nonsense), 2, 4) : concat({framed(a), le32(nonsense)}), pattern(100, 3)}));
      const N_Socket* reported = nullptr;
      ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
      EXPECT_EQ(&bad, reported);
      EXPECT_EQ(0, bad.getReceivePacketSize());
      write(badFd, framed(pattern(10, 4)));  // not taken for a new start
      write(goodFd, framed(a));
      Bytes got;
      ASSERT_TRUE(nextMessage(bad, a));
      EXPECT_FALSE(pollMessage(bad, got, 100));
      ASSERT_TRUE(pollMessage(good, got));  // the other connection goes on
      EXPECT_EQ(a, got);
      raw::closeFd(badFd);
      raw::closeFd(goodFd);
      ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
      EXPECT_EQ(&good, reported);  // the bad one's close reports nothing new
      EXPECT_TRUE(staysFalse([&] { return N_Socket::pollDisconnect(reported); }, 50));
    }
  }
}

// A length up to the cap is collected; one above it breaks the stream, so
// that even valid messages behind it are dropped.
TEST_F(StreamTest, TheLargestLengthIsTheCap) {
  for (const N_Limits& limits : {N_Limits::defaults(), N_Limits::openNetwork()}) {
    LimitsGuard guard(limits);
    for (std::uint32_t length : {limits.uMaximumMessageSize, limits.uMaximumMessageSize + 1}) {
      for (std::size_t cut : {2, 4}) {  // inside the prefix or after it
        SCOPED_TRACE(::testing::Message() << length << " cut at " << cut);
        N_Socket in(loopback(), freePort(), N_Socket::SOCKET_TCP);
        inject(in, concat({framed(pattern(8, 1)), slice(le32(length), 0, cut)}));
        inject(in, concat({slice(le32(length), cut, 4), pattern(100, 2)}));
        Bytes got;
        ASSERT_TRUE(nextMessage(in, pattern(8, 1), 0));
        const bool broken = length > limits.uMaximumMessageSize;
        EXPECT_EQ(broken ? 0 : static_cast<int>(length) + 4, in.getReceivePacketSize());
        if (broken) inject(in, framed(pattern(3, 3)));
        EXPECT_FALSE(broken && pollMessage(in, got, 0));
      }
    }
  }
}

// The stream ends (closed or reset) inside a prefix or a body: the messages
// in front stay pollable after the disconnect, the piece never shows.
TEST_F(StreamTest, StreamEndingInsideAMessage) {
  for (bool reset : {false, true}) {
    SCOPED_TRACE(reset ? "reset" : "closed");
    N_Socket in;
    int fd = -1;
    ASSERT_NO_FATAL_FAILURE(open(in, fd));
    const Bytes a = pattern(8, 1), piece = reset ? slice(framed(pattern(5000, 2)), 0, 1000) : Bytes{3, 0};
    write(fd, concat({framed(a), framed(a), piece}));
    ASSERT_TRUE(waitFor([&] { return in.getReceivePacketSize() == (reset ? 5004 : 0) && in.getQueuedReceiveMessages() == 2; }));
    EXPECT_EQ(reset ? 4004 : 0, in.getReceivePacketBytesMissing());
    if (reset) raw::reset(fd); else raw::closeFd(fd);
    const N_Socket* reported = nullptr;
    ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
    EXPECT_EQ(&in, reported);
    Bytes got;
    for (int i = 0; i < 2; ++i) {
      ASSERT_TRUE(nextMessage(in, a));
    }
    EXPECT_FALSE(pollMessage(in, got, 100));
    m_listener.reset();
  }
}

// Without the package a read is a message as it came, prefix-like bytes and
// all, an empty read too. Neither plain reads nor a read that completes with
// an error touch the message in collection.
TEST_F(StreamTest, PlainAndFailedReadsLeaveTheCollectionAlone) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  const Bytes stream = framed(pattern(100, 1));
  inject(in, slice(stream, 0, 50));
  N_SocketTestAccess::read(in, nullptr, 0, 10054);
  EXPECT_TRUE(in.isConnected());
  in.disablePackage();
  write(fd, Bytes{5, 0, 0, 0, 'a'});
  Bytes got;
  ASSERT_TRUE(nextMessage(in, Bytes({5, 0, 0, 0, 'a'})));
  inject(in, Bytes{});
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_TRUE(got.empty());
  EXPECT_EQ(104, in.getReceivePacketSize());
  in.enablePackage();
  inject(in, slice(stream, 50, 104));
  ASSERT_TRUE(nextMessage(in, pattern(100, 1), 0));
  raw::closeFd(fd);
}

}  // namespace
