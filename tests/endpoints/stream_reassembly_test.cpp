// The receive side of the stream: a raw Linux peer writes packaged streams
// cut at arbitrary points, and the library socket must hand out the same
// messages whole, in order, however the reads fell. Where the exact cut of a
// read matters, the read is fed to the receive path directly.
#include <algorithm>
#include <random>

#include "raw_peer.h"
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class StreamReassemblyTest : public TransportTest {
 protected:
  // A library socket accepted from a raw writer.
  void open(N_Socket& in, int& fd) {
    m_port = freePort();
    m_listener = std::make_unique<N_Listener>(m_port);
    ASSERT_TRUE(acceptRaw(*m_listener, m_port, in, fd));
    raw_peer::noDelay(fd);
  }
  // Writes one piece and gives the network thread time to read it alone.
  static void write(int fd, const Bytes& piece, int settleMs = 30) {
    ASSERT_TRUE(raw::sendAll(fd, piece.data(), piece.size()));
    platform::Sleep(static_cast<platform::DWORD>(settleMs));
  }
  static Bytes slice(const Bytes& b, std::size_t from, std::size_t to) {
    return Bytes(b.begin() + static_cast<std::ptrdiff_t>(from), b.begin() + static_cast<std::ptrdiff_t>(to));
  }
  void TearDown() override {
    m_listener.reset();
    TransportTest::TearDown();
  }

  int m_port = 0;
  std::unique_ptr<N_Listener> m_listener;
};

// Two messages of 5 and 10 bytes, 23 bytes of stream, in reads of 11, 2 and
// 10 bytes, with the progress of the collection visible in between.
TEST_F(StreamReassemblyTest, ElevenTwoTenTraceOverTheWire) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  Bytes a = pattern(5, 1), b = pattern(10, 2);
  Bytes stream = concat({framed(a), framed(b)});
  ASSERT_EQ(23u, stream.size());

  write(fd, slice(stream, 0, 11));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(a, got);
  EXPECT_EQ(0, in.getReceivePacketSize());  // only part of B's prefix is in
  EXPECT_EQ(0, in.getReceivePacketBytesMissing());

  write(fd, slice(stream, 11, 13));
  ASSERT_TRUE(waitFor([&] { return in.getReceivePacketSize() == 14; })) << in.getReceivePacketSize();
  EXPECT_EQ(10, in.getReceivePacketBytesMissing());
  void* data;
  unsigned int size;
  EXPECT_FALSE(in.poll(data, size));

  write(fd, slice(stream, 13, 23));
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(b, got);
  EXPECT_EQ(0, in.getReceivePacketSize());
  EXPECT_EQ(0, in.getReceivePacketBytesMissing());
  raw::closeFd(fd);
}

// The same trace with each read cut exactly, through the receive path.
TEST_F(StreamReassemblyTest, ElevenTwoTenTraceReadByRead) {
  int refused = freePort();
  N_Socket in(loopback(), refused, N_Socket::SOCKET_TCP);
  Bytes a = pattern(5, 1), b = pattern(10, 2);
  Bytes stream = concat({framed(a), framed(b)});
  Bytes got;

  N_SocketTestAccess::readString(in, slice(stream, 0, 11));
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_EQ(a, got);
  EXPECT_EQ(0, in.getReceivePacketSize());
  EXPECT_EQ(0, in.getReceivePacketBytesMissing());

  N_SocketTestAccess::readString(in, slice(stream, 11, 13));
  EXPECT_EQ(14, in.getReceivePacketSize());
  EXPECT_EQ(10, in.getReceivePacketBytesMissing());

  N_SocketTestAccess::readString(in, slice(stream, 13, 23));
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_EQ(b, got);
  EXPECT_EQ(0, in.getReceivePacketSize());
}

TEST_F(StreamReassemblyTest, CutPrefixesGiveTheSameMessage) {
  int refused = freePort();
  N_Socket in(loopback(), refused, N_Socket::SOCKET_TCP);
  const std::vector<std::vector<std::size_t>> cuts = {{1, 3}, {2, 2}, {3, 1}, {1, 1, 1, 1}};
  unsigned seed = 10;
  for (const auto& cut : cuts) {
    for (std::size_t bodyFirst : {std::size_t(0), std::size_t(100), std::size_t(300)}) {
      SCOPED_TRACE(::testing::Message() << "cut of " << cut.size() << " pieces, " << bodyFirst << " body bytes with it");
      Bytes m = pattern(300, seed++);
      Bytes stream = framed(m);
      std::size_t at = 0;
      for (std::size_t i = 0; i < cut.size(); ++i) {
        std::size_t end = at + cut[i];
        if (i + 1 == cut.size()) end += bodyFirst;
        N_SocketTestAccess::readString(in, slice(stream, at, end));
        at = end;
        if (at < 4) {
          EXPECT_EQ(0, in.getReceivePacketSize()) << "prefix incomplete";
        }
      }
      if (bodyFirst < 300) {
        EXPECT_EQ(304, in.getReceivePacketSize());
        EXPECT_EQ(static_cast<int>(300 - bodyFirst), in.getReceivePacketBytesMissing());
        N_SocketTestAccess::readString(in, slice(stream, at, stream.size()));
      }
      Bytes got;
      ASSERT_TRUE(pollMessage(in, got, 0));
      EXPECT_EQ(m, got);
      EXPECT_EQ(0, in.getReceivePacketSize());
    }
  }
}

TEST_F(StreamReassemblyTest, CutPrefixesOverTheWire) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  const std::vector<std::vector<std::size_t>> cuts = {{1, 3}, {2, 2}, {3, 1}, {1, 1, 1, 1}};
  std::vector<Bytes> sent;
  for (const auto& cut : cuts) {
    Bytes m = pattern(1000, static_cast<unsigned>(sent.size()));
    sent.push_back(m);
    Bytes stream = framed(m);
    std::size_t at = 0;
    for (std::size_t piece : cut) {
      write(fd, slice(stream, at, at + piece));
      at += piece;
    }
    write(fd, slice(stream, at, stream.size()));
  }
  for (const Bytes& m : sent) {
    Bytes got;
    ASSERT_TRUE(pollMessage(in, got));
    EXPECT_EQ(m, got);
  }
  raw::closeFd(fd);
}

// A message alone in a read is handed out in place: the read's own buffer
// becomes the message, so only the message's list node is allocated beside
// the read. Messages with bytes behind them are copied out, one block each.
TEST_F(StreamReassemblyTest, SeveralMessagesInOneRead) {
  int refused = freePort();
  N_Socket in(loopback(), refused, N_Socket::SOCKET_TCP);
  Bytes a = pattern(7, 1), b = pattern(0, 2), c = pattern(33, 3);

  // Other threads (a resolver finishing, say) may allocate meanwhile: the
  // least of a few rounds is what the read itself cost.
  auto cost = [&](const Bytes& read) {
    int least = 1 << 30;
    for (int round = 0; round < 3; ++round) {
      int before = Q_Memory::sm_iNewCount.load();
      N_SocketTestAccess::readString(in, read);
      least = std::min(least, Q_Memory::sm_iNewCount.load() - before);
    }
    return least;
  };
  int alone = cost(framed(a));
  int three = cost(concat({framed(a), framed(b), framed(c)}));
  // Two copies and two more nodes than a single message needs.
  EXPECT_EQ(alone + 4, three);

  std::vector<Bytes> expected = {a, a, a, a, b, c, a, b, c, a, b, c};
  for (const Bytes& m : expected) {
    Bytes got;
    ASSERT_TRUE(pollMessage(in, got, 0));
    EXPECT_EQ(m, got);
  }
  void* data;
  unsigned int size;
  EXPECT_FALSE(in.poll(data, size));
}

// Zero-length messages alone, at the end of a read, behind a split prefix
// and between others; receive() and poll() both see them.
TEST_F(StreamReassemblyTest, ZeroLengthMessagesInEveryPosition) {
  int refused = freePort();
  RecordingSocket in;
  in.keep = true;
  in.construct(loopback(), refused, N_Socket::SOCKET_TCP);
  Bytes empty;
  Bytes a = pattern(3, 1);
  N_SocketTestAccess::readString(in, framed(empty));                        // alone
  N_SocketTestAccess::readString(in, concat({framed(a), framed(empty)}));   // at the end
  N_SocketTestAccess::readString(in, Bytes{0, 0});                          // split prefix ...
  N_SocketTestAccess::readString(in, Bytes{0, 0});                          // ... completed
  N_SocketTestAccess::readString(in, concat({framed(a), framed(empty), framed(a)}));  // between
  N_SocketTestAccess::readString(in, concat({framed(empty), framed(empty)}));         // twice
  N_SocketTestAccess::readString(in, Bytes{});  // a zero-byte read makes nothing

  std::vector<Bytes> expected = {empty, a, empty, empty, a, empty, a, empty, empty};
  EXPECT_EQ(expected, in.messages());
  for (const Bytes& m : expected) {
    void* data = nullptr;
    unsigned int size = 99;
    ASSERT_TRUE(in.poll(data, size));
    EXPECT_EQ(m.size(), size);
    EXPECT_NE(nullptr, data);
    if (size > 0) {
      EXPECT_EQ(0, std::memcmp(m.data(), data, size));
    }
  }
  void* data;
  unsigned int size;
  EXPECT_FALSE(in.poll(data, size));
}

TEST_F(StreamReassemblyTest, ZeroLengthMessagesOverTheWire) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  Bytes empty, a = pattern(20, 4);
  write(fd, framed(empty));
  write(fd, concat({framed(a), framed(empty)}));
  write(fd, Bytes{0, 0});
  write(fd, Bytes{0, 0, 0});
  write(fd, concat({Bytes{0, 0, 0}, framed(a), framed(empty)}));
  std::vector<Bytes> expected = {empty, a, empty, empty, empty, a, empty};
  for (const Bytes& m : expected) {
    Bytes got{1};
    ASSERT_TRUE(pollMessage(in, got));
    EXPECT_EQ(m, got);
  }
  raw::closeFd(fd);
}

TEST_F(StreamReassemblyTest, MessageSpanningManyReadsShowsItsProgress) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  Bytes m = pattern(300000, 9);
  Bytes stream = framed(m);
  write(fd, slice(stream, 0, 1000));
  ASSERT_TRUE(waitFor([&] { return in.getReceivePacketSize() == 300004; })) << in.getReceivePacketSize();
  EXPECT_EQ(300004 - 1000, in.getReceivePacketBytesMissing());
  // The rest, and a short message behind it in the same write: the read that
  // completes the long one goes on with the next.
  Bytes tail = pattern(17, 10);
  write(fd, concat({slice(stream, 1000, stream.size()), framed(tail)}));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_TRUE(m == got);
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(tail, got);
  EXPECT_EQ(0, in.getReceivePacketSize());
  raw::closeFd(fd);
}

// A long run of messages of mixed sizes, the stream cut at random points.
TEST_F(StreamReassemblyTest, RandomCutsDeliverEveryMessageIntact) {
  RecordingSocket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  std::mt19937 random(1234);
  std::vector<Bytes> sent;
  Bytes stream;
  for (int i = 0; i < 300; ++i) {
    std::size_t size = random() % 8 == 0 ? 60000 + random() % 20000 : random() % 300;
    if (random() % 10 == 0) size = 0;
    sent.push_back(pattern(size, static_cast<unsigned>(i)));
    Bytes f = framed(sent.back());
    stream.insert(stream.end(), f.begin(), f.end());
  }
  std::size_t at = 0;
  while (at < stream.size()) {
    std::size_t piece = 1 + random() % (random() % 3 == 0 ? 9 : 9000);
    piece = std::min(piece, stream.size() - at);
    ASSERT_TRUE(raw::sendAll(fd, stream.data() + at, piece));
    at += piece;
    if (random() % 16 == 0) platform::Sleep(2);
  }
  ASSERT_TRUE(in.waitCount(sent.size(), 20000)) << in.count();
  std::vector<Bytes> got = in.messages();
  ASSERT_EQ(sent.size(), got.size());
  for (std::size_t i = 0; i < sent.size(); ++i) ASSERT_TRUE(sent[i] == got[i]) << "message " << i;
  raw::closeFd(fd);
}

// A length that can't be true ends that connection, and only that one: the
// messages in front of it arrive, the application sees a disconnect, and
// whatever follows on the broken stream is dropped.
TEST_F(StreamReassemblyTest, NonsenseLengthDisconnectsOnlyItsConnection) {
  for (std::uint32_t nonsense : {0xFFFFFFFFu, 0x80000000u, 0x7FFFFFFCu}) {
    for (bool splitPrefix : {false, true}) {
      SCOPED_TRACE(::testing::Message() << std::hex << nonsense << (splitPrefix ? " split" : " whole"));
      int port = freePort();
      N_Listener listener(port);
      N_Socket bad, good;
      int badFd = -1, goodFd = -1;
      ASSERT_TRUE(acceptRaw(listener, port, bad, badFd));
      ASSERT_TRUE(acceptRaw(listener, port, good, goodFd));
      Bytes a = pattern(50, 1), b = pattern(60, 2);
      if (splitPrefix) {
        write(badFd, concat({framed(a), slice(le32(nonsense), 0, 2)}));
        write(badFd, concat({slice(le32(nonsense), 2, 4), pattern(100, 3)}));
      } else {
        write(badFd, concat({framed(a), le32(nonsense), pattern(100, 3)}));
      }
      write(goodFd, framed(b));

      const N_Socket* reported = nullptr;
      ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
      EXPECT_EQ(&bad, reported);
      EXPECT_FALSE(bad.isConnected());
      EXPECT_TRUE(good.isConnected());
      EXPECT_TRUE(N_SocketTestAccess::streamBroken(bad));
      EXPECT_EQ(0, bad.getReceivePacketSize());
      Bytes got;
      ASSERT_TRUE(pollMessage(bad, got));
      EXPECT_EQ(a, got);
      ASSERT_TRUE(pollMessage(good, got));
      EXPECT_EQ(b, got);

      // Valid messages behind the break are not taken for a new start.
      write(badFd, framed(pattern(10, 4)));
      write(goodFd, framed(pattern(10, 5)));
      ASSERT_TRUE(pollMessage(good, got));
      EXPECT_EQ(pattern(10, 5), got);
      EXPECT_FALSE(pollMessage(bad, got, 100));
      EXPECT_FALSE(N_Socket::pollDisconnect(reported)) << "reported twice";
      raw::closeFd(badFd);
      raw::closeFd(goodFd);
      // The bad socket's peer close comes as FD_CLOSE; it reports nothing new.
      EXPECT_TRUE(waitFor([&] { return !good.isConnected(); }));
      ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
      EXPECT_EQ(&good, reported);
      EXPECT_FALSE(N_Socket::pollDisconnect(reported));
    }
  }
}

TEST_F(StreamReassemblyTest, PeerResetInTheMiddleOfAMessage) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  Bytes m = pattern(5000, 1);
  write(fd, slice(framed(m), 0, 1000));
  ASSERT_TRUE(waitFor([&] { return in.getReceivePacketSize() == 5004; }));
  raw::reset(fd);
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  EXPECT_EQ(&in, reported);
  Bytes got;
  EXPECT_FALSE(pollMessage(in, got, 100));
  // The half message stays until the socket goes.
  EXPECT_EQ(5004, in.getReceivePacketSize());
}

TEST_F(StreamReassemblyTest, StreamEndingInsideAPrefix) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  Bytes a = pattern(8, 1);
  write(fd, concat({framed(a), Bytes{3, 0}}));
  raw::closeFd(fd);
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  EXPECT_EQ(&in, reported);
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(a, got);
  EXPECT_FALSE(pollMessage(in, got, 100));
}

// Without the package mechanism a read is a message as it came, prefix-like
// bytes and all; an empty read (what a peer's close gives to a read under
// way) is an empty message.
TEST_F(StreamReassemblyTest, PlainReadsAreMessagesAsTheyCame) {
  N_Socket in;
  int fd = -1;
  ASSERT_NO_FATAL_FAILURE(open(in, fd));
  in.disablePackage();
  write(fd, Bytes{5, 0, 0, 0, 'a'});
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got));
  EXPECT_EQ(Bytes({5, 0, 0, 0, 'a'}), got);
  N_SocketTestAccess::readString(in, Bytes{});
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_TRUE(got.empty());
  raw::closeFd(fd);
  EXPECT_TRUE(waitFor([&] { return !in.isConnected(); }));
}

// A message in collection when the package mechanism goes off stays where
// it is; plain reads go their own way meanwhile.
TEST_F(StreamReassemblyTest, DisablingThePackageDuringCollection) {
  int refused = freePort();
  N_Socket in(loopback(), refused, N_Socket::SOCKET_TCP);
  N_SocketTestAccess::readString(in, slice(framed(pattern(100, 1)), 0, 50));
  EXPECT_EQ(104, in.getReceivePacketSize());
  in.disablePackage();
  N_SocketTestAccess::readString(in, Bytes{1, 2, 3});
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_EQ(Bytes({1, 2, 3}), got);
  EXPECT_EQ(104, in.getReceivePacketSize());
}

// A read that completes with an error changes nothing: the message in
// collection goes on with the next read, and the socket stays connected.
TEST_F(StreamReassemblyTest, FailedReadKeepsTheCollection) {
  VerboseCapture verbose;
  int port = freePort();
  N_Listener listener(port);
  N_Socket in, out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  Bytes m = pattern(40, 1);
  Bytes stream = framed(m);
  N_SocketTestAccess::readString(in, slice(stream, 0, 2));
  N_SocketTestAccess::failedRead(in, 10054);
  N_SocketTestAccess::readString(in, slice(stream, 2, stream.size()));
  Bytes got;
  ASSERT_TRUE(pollMessage(in, got, 0));
  EXPECT_EQ(m, got);
  EXPECT_TRUE(in.isConnected());

  std::vector<std::string> lines = VerboseCapture::lines();
  ASSERT_EQ(1u, lines.size());
  const std::string& line = lines[0];
  EXPECT_EQ(0u, line.find("receiveComplete: dwError = WSAECONNRESET (10054),\n"
                          "                 lpOverlapped->hEvent = 0x"))
      << line;
  EXPECT_NE(std::string::npos, line.find("\n                 cbTransferred = 0\n                 dwFlags = 0"))
      << line;
}

}  // namespace
