// Failures injected into Winsock calls and into the library's allocations:
// sends and reads that fail or go pending must not lose, double or reorder a
// message, and memory that runs out on the network thread must end only the
// connection it hit.
#include "raw_peer.h"
#include "transport_fixture.h"

using namespace transport_test;
using platform::fault::Call;

namespace {

Bytes head(const Bytes& b, std::size_t n) { return Bytes(b.begin(), b.begin() + static_cast<std::ptrdiff_t>(n)); }

class TransportFaultsTest : public TransportTest {
 protected:
  void SetUp() override {
    TransportTest::SetUp();
    m_port = freePort();
    m_listener = std::make_unique<N_Listener>(m_port);
  }
  void TearDown() override {
    m_listener.reset();
    TransportTest::TearDown();
  }
  bool pair(N_Socket& in, N_Socket& out) { return connectPair(*m_listener, m_port, in, out); }
  bool rawPeer(N_Socket& in, int& fd) {
    if (!acceptRaw(*m_listener, m_port, in, fd)) return false;
    raw_peer::noDelay(fd);
    return true;
  }
  // Lets resolver threads and the network thread fall quiet, so that an
  // armed allocation fault hits the allocation the test means.
  static void settle() { platform::Sleep(50); }

  // Sends `count` messages of assorted sizes and expects them all, in order.
  static void exchange(N_Socket& out, RecordingSocket& in, int count, unsigned seed) {
    std::vector<Bytes> sent;
    std::size_t before = in.count();
    for (int i = 0; i < count; ++i) {
      std::size_t size = (i % 5 == 4) ? 70000 + i : static_cast<std::size_t>(i * 37 % 500);
      sent.push_back(pattern(size, seed + static_cast<unsigned>(i)));
      send(out, sent.back());
    }
    ASSERT_TRUE(in.waitCount(before + sent.size())) << in.count() - before << " of " << sent.size();
    platform::Sleep(50);
    std::vector<Bytes> got = in.messages();
    ASSERT_EQ(before + sent.size(), got.size()) << "messages doubled";
    for (std::size_t i = 0; i < sent.size(); ++i) EXPECT_TRUE(sent[i] == got[before + i]) << "message " << i;
  }

  int m_port = 0;
  std::unique_ptr<N_Listener> m_listener;
};

// ---- WSASend ----------------------------------------------------------------

TEST_F(TransportFaultsTest, SendRefusedWithWouldBlockWaitsForWriteAndKeepsOrder) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  platform::fault::arm(Call::WSASend, {1, false, platform::WSAEWOULDBLOCK});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 20, 100));
  EXPECT_EQ(1, platform::fault::fired(Call::WSASend));
  platform::fault::arm(Call::WSASend, {3, false, platform::WSAEWOULDBLOCK});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 20, 200));
  EXPECT_EQ(1, platform::fault::fired(Call::WSASend));
}

TEST_F(TransportFaultsTest, EverySendPendingStillDeliversInOrder) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  platform::fault::arm(Call::WSASend, {1, true, platform::WSA_IO_PENDING});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 40, 300));
  EXPECT_GE(platform::fault::fired(Call::WSASend), 40);
  EXPECT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
}

// Any other failure leaves the entry for a later pass; the entries behind it
// must not overtake it.
TEST_F(TransportFaultsTest, SendFailingOtherwiseIsRetriedWithoutOvertaking) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  for (int countdown : {1, 2, 5}) {
    platform::fault::arm(Call::WSASend, {countdown, false, platform::WSAENOBUFS});
    std::vector<Bytes> sent;
    std::size_t before = in.count();
    for (int i = 0; i < 8; ++i) {
      sent.push_back(pattern(100 + static_cast<std::size_t>(i), static_cast<unsigned>(countdown * 10 + i)));
      send(out, sent.back());
    }
    // A failed entry waits for the next pass; the next send brings one.
    platform::Sleep(50);
    sent.push_back(pattern(1, 99));
    send(out, sent.back());
    ASSERT_TRUE(in.waitCount(before + sent.size()));
    EXPECT_EQ(1, platform::fault::fired(Call::WSASend));
    std::vector<Bytes> got = in.messages();
    for (std::size_t i = 0; i < sent.size(); ++i) EXPECT_TRUE(sent[i] == got[before + i]) << "message " << i;
  }
}

// ---- WSARecv ----------------------------------------------------------------

// A read that fails at once is dropped; the bytes stay in the socket and the
// next FD_READ reads them.
TEST_F(TransportFaultsTest, ReadFailingAtOnceLosesNothing) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  platform::fault::arm(Call::WSARecv, {1, false, platform::WSAENOBUFS});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 10, 400));
  EXPECT_EQ(1, platform::fault::fired(Call::WSARecv));
}

// WSAEWOULDBLOCK counts as a read under way whose completion never comes;
// its entry stays until the runtime stops, and later reads go on.
TEST_F(TransportFaultsTest, ReadAnsweringWouldBlockDoesNotStopLaterReads) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  platform::fault::arm(Call::WSARecv, {1, false, platform::WSAEWOULDBLOCK});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 10, 500));
  EXPECT_EQ(1, platform::fault::fired(Call::WSARecv));
}

TEST_F(TransportFaultsTest, EveryReadPendingStillDeliversInOrder) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  platform::fault::arm(Call::WSARecv, {1, true, platform::WSA_IO_PENDING});
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 40, 600));
}

// ---- WSAEnumNetworkEvents -------------------------------------------------

// A failed enumeration serves nothing, and in particular not the record an
// earlier call left: no read is posted twice, no message doubled.
TEST_F(TransportFaultsTest, FailedEnumerationServesNoStaleEvents) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 3, 700));
  for (int countdown : {1, 2, 3}) {
    platform::fault::arm(Call::WSAEnumNetworkEvents, {countdown, false, platform::WSAENETDOWN});
    ASSERT_NO_FATAL_FAILURE(exchange(out, in, 5, 710 + static_cast<unsigned>(countdown) * 10));
  }
  // A listener's failed enumeration accepts nothing twice either.
  platform::fault::arm(Call::WSAEnumNetworkEvents, {1, false, platform::WSAENETDOWN});
  int fd = raw::connectTo("127.0.0.1", static_cast<std::uint16_t>(m_port));
  N_Socket::ConnectData* entry = nullptr;
  ASSERT_TRUE(waitFor([&] { return m_listener->pollConnect(entry); }));
  EXPECT_NE(platform::INVALID_SOCKET, entry->socket);
  {
    N_Socket accepted(entry);
    EXPECT_TRUE(staysFalse([&] { return m_listener->pollConnect(entry); }, 100));
  }
  raw::closeFd(fd);

  // And a disconnect is reported once, not again by a failed enumeration.
  platform::fault::arm(Call::WSAEnumNetworkEvents, {2, false, platform::WSAENETDOWN});
  out.destruct();
  ASSERT_TRUE(waitFor([&] { return !in.isConnected(); }));
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  EXPECT_EQ(&in, reported);
  EXPECT_TRUE(staysFalse([&] { return N_Socket::pollDisconnect(reported); }, 200));
}

// ---- Memory running out -----------------------------------------------------

TEST_F(TransportFaultsTest, SendThatCantBeQueuedLeavesNothingBehind) {
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(pair(in, out));
  ASSERT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
  settle();
  // A message of four chunks: its node, block, node, block ...; each can fail.
  Bytes big = pattern(200000, 1);
  for (int nth = 1; nth <= 8; ++nth) {
    failAllocation(nth);
    try {
      send(out, big);
      FAIL() << "allocation " << nth << " didn't fail";
    } catch (Q_MemoryException_Allocation* e) {
      EXPECT_STREQ("Out of system memory resources", e->getErrorMessage());
    }
    EXPECT_EQ(0, out.getBytesWaitingForSend()) << nth;
  }
  disarmFaults();
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 3, 800));
  EXPECT_EQ(3u, in.count());
}

TEST_F(TransportFaultsTest, SocketThatCantBeMadeIsLeftUnconstructed) {
  settle();
  // Towards a port nobody listens on, so that a fault still armed after the
  // success can't hit the network thread's work for the connection.
  int refused = freePort();
  N_Socket out;
  int nth = 1;
  for (;; ++nth) {
    failAllocation(nth);
    bool made = false;
    try {
      out.construct(loopback(), refused, N_Socket::SOCKET_UDP);
      made = true;
    } catch (Q_MemoryException_Allocation*) {
      EXPECT_EQ(nullptr, N_Socket::getFirstSocket());
    }
    disarmFaults();
    if (made) break;
    ASSERT_LT(nth, 20);
  }
  EXPECT_GT(nth, 1);
  EXPECT_TRUE(out.isConnected());  // a UDP socket is from the start
  send(out, pattern(5, 1));
  Bytes got;
  ASSERT_TRUE(pollMessage(out, got));
  EXPECT_EQ(pattern(5, 1), got);

  // An accepted connection whose socket can't be made stays queued.
  out.construct(loopback(), m_port, N_Socket::SOCKET_TCP);
  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return m_listener->pollConnect(data); }));
  RecordingSocket in;
  settle();
  failAllocation(1);
  EXPECT_THROW(in.construct(data), Q_MemoryException_Allocation*);
  disarmFaults();
  N_Socket::ConnectData* again = nullptr;
  ASSERT_TRUE(m_listener->pollConnect(again));
  EXPECT_EQ(data, again);
  in.construct(again);
  ASSERT_TRUE(waitFor([&] { return out.isConnected(); }));
  ASSERT_NO_FATAL_FAILURE(exchange(out, in, 3, 900));
}

// At FD_READ the network thread makes a list node and a 64 KiB buffer; if
// either can't be had, that connection ends as a disconnect.
TEST_F(TransportFaultsTest, ReadThatCantBePostedDisconnects) {
  for (int nth : {1, 2}) {
    SCOPED_TRACE(nth);
    N_Socket victim, bystander;
    int victimFd = -1, bystanderFd = -1;
    ASSERT_TRUE(rawPeer(victim, victimFd));
    ASSERT_TRUE(rawPeer(bystander, bystanderFd));
    settle();
    failAllocation(nth);
    Bytes m = framed(pattern(10, 1));
    ASSERT_TRUE(raw::sendAll(victimFd, m.data(), m.size()));
    const N_Socket* reported = nullptr;
    ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
    EXPECT_EQ(&victim, reported);
    EXPECT_EQ(1, platform::fault::allocationsFailed());
    disarmFaults();
    ASSERT_TRUE(raw::sendAll(bystanderFd, m.data(), m.size()));
    Bytes got;
    ASSERT_TRUE(pollMessage(bystander, got));
    EXPECT_EQ(pattern(10, 1), got);
    EXPECT_TRUE(bystander.isConnected());
    raw::closeFd(victimFd);
    raw::closeFd(bystanderFd);
    ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
    EXPECT_EQ(&bystander, reported);
  }
}

// Inside a read: the block of a split prefix, of a spanning message, the
// copy of a message with bytes behind it, a message's list node. Each
// failure ends that connection; the stream behind it is dropped.
TEST_F(TransportFaultsTest, ReassemblyThatRunsOutOfMemoryDisconnects) {
  Bytes a = pattern(20, 1);
  struct Case {
    const char* what;
    Bytes stream;
    int nth;  // 1 and 2 are the read's node and buffer
  };
  std::vector<Case> cases = {
      {"split prefix", Bytes{9, 0}, 3},
      {"spanning message", head(framed(pattern(100000, 2)), 5000), 3},
      {"copy of a message", concat({framed(a), framed(a)}), 3},
      {"node of the copy", concat({framed(a), framed(a)}), 4},
      {"node of a message in place", framed(a), 3},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    RecordingSocket victim;
    N_Socket bystander;
    int victimFd = -1, bystanderFd = -1;
    ASSERT_TRUE(rawPeer(victim, victimFd));
    ASSERT_TRUE(rawPeer(bystander, bystanderFd));
    settle();
    failAllocation(c.nth);
    ASSERT_TRUE(raw::sendAll(victimFd, c.stream.data(), c.stream.size()));
    const N_Socket* reported = nullptr;
    ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
    EXPECT_EQ(&victim, reported);
    disarmFaults();
    EXPECT_EQ(0, victim.getReceivePacketSize());
    EXPECT_TRUE(N_SocketTestAccess::streamBroken(victim));
    EXPECT_EQ(0u, victim.count());
    // What comes after is dropped; the other connection goes on.
    Bytes more = framed(a);
    ASSERT_TRUE(raw::sendAll(victimFd, more.data(), more.size()));
    ASSERT_TRUE(raw::sendAll(bystanderFd, more.data(), more.size()));
    Bytes got;
    ASSERT_TRUE(pollMessage(bystander, got));
    EXPECT_EQ(a, got);
    platform::Sleep(50);
    EXPECT_EQ(0u, victim.count());
    raw::closeFd(victimFd);
    raw::closeFd(bystanderFd);
    ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  }
}

}  // namespace
