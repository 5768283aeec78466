// A second host for the transport tests, `vardel_host_transport_peer --port P`:
// on 127.0.0.2 it connects over TCP to the test's listener on 127.0.0.1:P,
// opens UDP from its own P + 1 to the test's, and echoes every message on the
// socket it came by until the TCP message "quit". Exit code 0 after a clean
// quit; 2 if the test never showed up or went silent; 3 on bad arguments or
// if the runtime or a socket couldn't be made.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "N_Address.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Socket.h"
#include "vardel_platform.h"
#include "win32.h"

using Clock = std::chrono::steady_clock;

static int run(int port) {
  platform::setLocalHost("127.0.0.2");
  N_Initializer network;
  N_Address test("127.0.0.1");
  N_Socket tcp(&test, port, N_Socket::SOCKET_TCP);
  for (auto start = Clock::now(); !tcp.isConnected(); platform::Sleep(1))
    if (Clock::now() - start > std::chrono::seconds(20)) return 2;
  N_Socket udp(&test, port + 1, N_Socket::SOCKET_UDP);
  for (auto lastHeard = Clock::now();;) {
    void* data = nullptr;
    unsigned size = 0;
    N_Socket* from = tcp.poll(data, size) ? &tcp : udp.poll(data, size) ? &udp : nullptr;
    if (from == &tcp && size == 4 && std::memcmp(data, "quit", 4) == 0) break;
    if (from != nullptr)
      from->send(data, size), lastHeard = Clock::now();
    else if (!tcp.isConnected() || Clock::now() - lastHeard > std::chrono::seconds(30))
      return 2;
    else
      platform::Sleep(1);
  }
  // Everything sent leaves before the connection ends.
  for (auto start = Clock::now(); tcp.getBytesWaitingForSend() > 0 && Clock::now() - start < std::chrono::seconds(20);)
    platform::Sleep(1);
  tcp.disconnect();
  return 0;
}

int main(int argc, char** argv) try {
  return argc == 3 && std::strcmp(argv[1], "--port") == 0 ? run(std::atoi(argv[2])) : 3;
} catch (Q_Exception* e) {
  std::fprintf(stderr, "transport_peer: %s\n", e->getErrorMessage());
  return 3;
}
