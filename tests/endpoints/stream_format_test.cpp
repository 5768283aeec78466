// The send side of the stream: the exact bytes a packaged TCP socket puts on
// the wire (read by a raw Linux peer), chunking of large messages, the bare
// stream without the package mechanism, and the send queue's accounting.
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class StreamFormatTest : public TransportTest {};

Bytes readWire(int fd, std::size_t size) {
  Bytes wire(size);
  if (!raw::receiveExactly(fd, wire.data(), size, 10000)) wire.clear();
  return wire;
}

TEST_F(StreamFormatTest, WorkedExamplesAreExactOnTheWire) {
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));

  send(out, Bytes{'h', 'e', 'l', 'l', 'o'});
  EXPECT_EQ(Bytes({0x05, 0x00, 0x00, 0x00, 0x68, 0x65, 0x6C, 0x6C, 0x6F}), readWire(fd, 9));

  send(out, Bytes{0x68, 0x69});
  send(out, Bytes{});
  EXPECT_EQ(Bytes({0x02, 0x00, 0x00, 0x00, 0x68, 0x69, 0x00, 0x00, 0x00, 0x00}), readWire(fd, 10));

  Bytes big = pattern(200000, 1);
  send(out, big);
  Bytes wire = readWire(fd, 200004);
  ASSERT_EQ(200004u, wire.size());
  EXPECT_EQ(Bytes({0x40, 0x0D, 0x03, 0x00}), Bytes(wire.begin(), wire.begin() + 4));
  EXPECT_TRUE(std::equal(big.begin(), big.end(), wire.begin() + 4)) << "payload differs";
  // The chunks of the big message leave no bytes of their own.
  EXPECT_TRUE(raw::receiveFor(fd, 200).empty());
  raw::closeFd(fd);
}

TEST_F(StreamFormatTest, WithoutPackageTheStreamCarriesBareBytes) {
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));
  out.disablePackage();
  send(out, Bytes{1, 2, 3});
  send(out, Bytes{});
  send(out, Bytes{4});
  EXPECT_EQ(Bytes({1, 2, 3, 4}), readWire(fd, 4));
  EXPECT_TRUE(raw::receiveFor(fd, 200).empty());

  // Back on: the next message has its prefix again.
  out.enablePackage();
  send(out, Bytes{9});
  EXPECT_EQ(Bytes({1, 0, 0, 0, 9}), readWire(fd, 5));
  raw::closeFd(fd);
}

TEST_F(StreamFormatTest, CallerMayReuseItsBufferAsSoonAsSendReturns) {
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));
  Bytes message = pattern(100000, 7);
  Bytes original = message;
  send(out, message);
  std::fill(message.begin(), message.end(), 0xEE);
  Bytes wire = readWire(fd, original.size() + 4);
  ASSERT_EQ(original.size() + 4, wire.size());
  EXPECT_TRUE(std::equal(original.begin(), original.end(), wire.begin() + 4));
  raw::closeFd(fd);
}

TEST_F(StreamFormatTest, SendsBeforeTheConnectCompletesLeaveInOrderAfterIt) {
  std::uint16_t port = 0;
  int listening = raw::listenOn("127.0.0.1", port);
  ASSERT_GE(listening, 0);
  N_Socket out;
  out.construct(loopback(), port, N_Socket::SOCKET_TCP);
  Bytes a = pattern(10, 1), b = pattern(70000, 2), c = pattern(0, 3);
  send(out, a);
  send(out, b);
  send(out, c);
  int fd = raw::acceptOne(listening, 5000);
  ASSERT_GE(fd, 0);
  Bytes expected = concat({framed(a), framed(b), framed(c)});
  EXPECT_EQ(expected, readWire(fd, expected.size()));
  raw::closeFd(fd);
  raw::closeFd(listening);
}

// Message sizes around the chunk limit S - 16 (S = getMaximumSendPacketSize)
// and far beyond it all arrive whole, in order and byte-identical at a
// library receiver.
TEST_F(StreamFormatTest, MessagesOfEverySizeArriveWholeAndInOrder) {
  int port = freePort();
  N_Listener listener(port);
  RecordingSocket in;
  N_Socket out;
  ASSERT_TRUE(connectPair(listener, port, in, out));
  const unsigned s = static_cast<unsigned>(out.getMaximumSendPacketSize());
  EXPECT_EQ(65536u, s);
  std::vector<std::size_t> sizes = {0, 1, s - 17, s - 16, s - 15, s - 12, s, s + 1, 3 * (s - 16), 3 * (s - 16) + 1,
                                    200000, 0, 5u << 20, 4};
  std::vector<Bytes> sent;
  for (std::size_t i = 0; i < sizes.size(); ++i) {
    sent.push_back(pattern(sizes[i], static_cast<unsigned>(i)));
    send(out, sent.back());
  }
  ASSERT_TRUE(in.waitCount(sent.size(), 20000)) << in.count() << " of " << sent.size();
  std::vector<Bytes> got = in.messages();
  ASSERT_EQ(sent.size(), got.size());
  for (std::size_t i = 0; i < sent.size(); ++i) EXPECT_TRUE(sent[i] == got[i]) << "message " << i << " differs";
  EXPECT_TRUE(waitFor([&] { return out.getBytesWaitingForSend() == 0; }));
}

// Entries wait on a socket that never connects, so the queue's sum can be
// read exactly: 4 more than the payload per packaged message, the same from
// every socket of the process, and orphans drop out after the next pump.
TEST_F(StreamFormatTest, BytesWaitingForSendIsOneProcessWideSum) {
  int refused = freePort();  // nothing listens there
  N_Socket a(loopback(), refused, N_Socket::SOCKET_TCP);
  N_Socket b(loopback(), refused, N_Socket::SOCKET_TCP);
  N_Socket probe;  // never constructed: the sum is the process's anyway
  send(a, pattern(5, 1));
  EXPECT_EQ(9, a.getBytesWaitingForSend());
  send(b, Bytes{});
  EXPECT_EQ(13, a.getBytesWaitingForSend());
  EXPECT_EQ(13, b.getBytesWaitingForSend());
  a.disablePackage();
  send(a, pattern(3, 2));
  EXPECT_EQ(16, b.getBytesWaitingForSend());
  a.enablePackage();
  send(a, pattern(200000, 3));
  EXPECT_EQ(16 + 200004, probe.getBytesWaitingForSend());

  // Refused, so never writable: nothing left the queue.
  platform::Sleep(100);
  EXPECT_EQ(16 + 200004, probe.getBytesWaitingForSend());
  EXPECT_FALSE(a.isConnected());

  a.destruct();
  EXPECT_TRUE(waitFor([&] { return probe.getBytesWaitingForSend() == 4; }))
      << probe.getBytesWaitingForSend();
}

TEST_F(StreamFormatTest, UnpackagedSendAboveTheLimitIsRefusedAndChangesNothing) {
  N_Socket out;
  int fd = -1;
  ASSERT_TRUE(connectRaw(out, fd));
  out.disablePackage();
  const int s = out.getMaximumSendPacketSize();
  Bytes tooBig = pattern(static_cast<std::size_t>(s) + 1, 1);
  int waiting = out.getBytesWaitingForSend();
  try {
    send(out, tooBig);
    FAIL() << "no exception";
  } catch (N_NetException_PacketTooBig* e) {
    EXPECT_STREQ(
        ("Packet " + std::to_string(s + 1) + " bytes exceeds " + std::to_string(s) +
         " byte limit when not using distributed packet mechanism")
            .c_str(),
        e->getErrorMessage());
  }
  EXPECT_EQ(waiting, out.getBytesWaitingForSend());
  Bytes exact = pattern(static_cast<std::size_t>(s), 2);
  send(out, exact);
  EXPECT_EQ(exact, readWire(fd, exact.size()));
  raw::closeFd(fd);
}

}  // namespace
