// Two hosts in two processes: this test on 127.0.0.1 and the transport peer
// program on 127.0.0.2 exchange messages over TCP (port P) and UDP (P + 1 on
// each side's own address). The peer sends back whatever it gets; every
// message must come back whole, in order and byte-identical.
#include "child_process.h"
#include "free_port.h"
#include "transport_fixture.h"

using namespace transport_test;

namespace {

class TransportTwoProcessTest : public TransportTest {};

const std::string kQuit = "quit-transport-peer";

TEST_F(TransportTwoProcessTest, TcpAndUdpExchangeWithAPeerProcess) {
  int port = pickFreePort(true);
  ASSERT_GT(port, 0);
  N_Listener listener(port);
  N_Address peerAddress("127.0.0.2");
  N_Socket udp(&peerAddress, port + 1, N_Socket::SOCKET_UDP);

  ChildProcess peer(VARDEL_HOST_TRANSPORT_PEER, {"--port", std::to_string(port), "--host", "127.0.0.2"});
  ASSERT_TRUE(peer.started()) << peer.startError();

  N_Socket::ConnectData* data = nullptr;
  ASSERT_TRUE(waitFor([&] { return listener.pollConnect(data); }, 20000));
  N_Socket tcp(data);
  ASSERT_NE(nullptr, tcp.getAddress());
  EXPECT_STREQ("127.0.0.2", const_cast<const char*>(tcp.getAddress()->getStringNumber()));

  Bytes got;
  ASSERT_TRUE(pollMessage(tcp, got, 20000));
  EXPECT_EQ(Bytes({'r', 'e', 'a', 'd', 'y'}), got);

  // TCP: sizes around the chunk limit and well past it, then a burst.
  const unsigned s = static_cast<unsigned>(tcp.getMaximumSendPacketSize());
  std::vector<Bytes> sent;
  for (std::size_t size : {std::size_t(0), std::size_t(1), std::size_t(5), std::size_t(s - 16), std::size_t(s - 15),
                           std::size_t(200000), std::size_t(3u << 20)})
    sent.push_back(pattern(size, static_cast<unsigned>(sent.size())));
  for (int i = 0; i < 300; ++i) sent.push_back(pattern(static_cast<std::size_t>(i * 7 % 700), 1000u + i));
  for (const Bytes& m : sent) send(tcp, m);
  for (std::size_t i = 0; i < sent.size(); ++i) {
    ASSERT_TRUE(pollMessage(tcp, got, 20000)) << "echo " << i << " missing";
    ASSERT_TRUE(sent[i] == got) << "echo " << i << " differs";
  }

  // UDP: one datagram at a time, each echoed whole, up to the limit.
  const unsigned u = static_cast<unsigned>(udp.getMaximumSendPacketSize());
  for (std::size_t size : {std::size_t(0), std::size_t(1), std::size_t(100), std::size_t(1400), std::size_t(u)}) {
    Bytes d = pattern(size, static_cast<unsigned>(size) + 5);
    send(udp, d);
    ASSERT_TRUE(pollMessage(udp, got, 5000)) << "datagram of " << size;
    EXPECT_TRUE(d == got) << "datagram of " << size;
  }

  send(tcp, Bytes(kQuit.begin(), kQuit.end()));
  std::optional<int> code = peer.wait(20000);
  ASSERT_TRUE(code.has_value()) << "the peer didn't end";
  EXPECT_EQ(0, *code);
  const N_Socket* reported = nullptr;
  ASSERT_TRUE(waitFor([&] { return N_Socket::pollDisconnect(reported); }));
  EXPECT_EQ(&tcp, reported);
}

}  // namespace
