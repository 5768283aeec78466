// A second host for the transport tests: on its own loopback address it
// connects to the test's listener on port P over TCP, opens a UDP socket on
// its own address and port P + 1 towards the test's, says "ready" on TCP, and
// then sends back every message it gets, on the socket it came by, until the
// TCP message "quit-transport-peer" arrives.
//
//   vardel_host_transport_peer --port P [--host 127.0.0.2] [--server 127.0.0.1]
//
// Exit code 0 after a clean quit; 2 if the test never showed up or went
// silent; 3 if the runtime or a socket couldn't be made.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Socket.h"
#include "vardel_platform.h"
#include "win32.h"

namespace {

using Clock = std::chrono::steady_clock;

const char kQuit[] = "quit-transport-peer";
const char kReady[] = "ready";

int run(int port, const char* host, const char* server) {
  platform::setLocalHost(host);
  N_Initializer network;
  N_Address peer(server);
  N_Socket tcp(&peer, port, N_Socket::SOCKET_TCP);
  auto deadline = Clock::now() + std::chrono::seconds(20);
  while (!tcp.isConnected()) {
    if (Clock::now() > deadline) {
      std::fprintf(stderr, "transport_peer: no connection to %s:%d\n", server, port);
      return 2;
    }
    platform::Sleep(1);
  }
  N_Socket udp(&peer, port + 1, N_Socket::SOCKET_UDP);
  tcp.send(const_cast<char*>(kReady), sizeof kReady - 1);

  auto lastHeard = Clock::now();
  for (;;) {
    bool idle = true;
    void* data = nullptr;
    unsigned int size = 0;
    if (tcp.poll(data, size)) {
      idle = false;
      if (size == sizeof kQuit - 1 && std::memcmp(data, kQuit, size) == 0) break;
      tcp.send(data, size);
    }
    if (udp.poll(data, size)) {
      idle = false;
      udp.send(data, size);
    }
    if (!idle) {
      lastHeard = Clock::now();
      continue;
    }
    if (!tcp.isConnected() || Clock::now() - lastHeard > std::chrono::seconds(30)) {
      std::fprintf(stderr, "transport_peer: the test went away\n");
      return 2;
    }
    platform::Sleep(1);
  }
  // Everything sent has left before the connection ends.
  deadline = Clock::now() + std::chrono::seconds(20);
  while (tcp.getBytesWaitingForSend() > 0 && Clock::now() < deadline) platform::Sleep(1);
  tcp.disconnect();
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  int port = 0;
  const char* host = "127.0.0.2";
  const char* server = "127.0.0.1";
  for (int i = 1; i + 1 < argc; i += 2) {
    if (std::strcmp(argv[i], "--port") == 0) port = std::atoi(argv[i + 1]);
    if (std::strcmp(argv[i], "--host") == 0) host = argv[i + 1];
    if (std::strcmp(argv[i], "--server") == 0) server = argv[i + 1];
  }
  if (port <= 0) {
    std::fprintf(stderr, "usage: %s --port P [--host A] [--server B]\n", argv[0]);
    return 3;
  }
  try {
    return run(port, host, server);
  } catch (Q_Exception* e) {
    std::fprintf(stderr, "transport_peer: %s\n", e->getErrorMessage());
    return 3;
  }
}
