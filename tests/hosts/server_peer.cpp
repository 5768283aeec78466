// One N_Server host for tests that watch the traffic from outside (a capture):
//   vardel_host_server_peer --host 127.0.0.1 --port P [--hb-frequency F] [--hb-latency L]
// It serves on data port P (and the control port), calls update() about
// every millisecond and prints "ready", "client ADDRESS" for each pairing,
// "recv N TEXT" for each message (TEXT: its first 24 bytes), "done" after a
// command and "bye" at the end. Commands: quit | maximum N
// (setMaximumBandwidthUsage) | burst COUNT PREFIX (COUNT reliable messages
// "PREFIX<i>;" to every client, each flushed on its own while the network
// thread is held, so that they all leave in one write).
#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <sstream>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Initializer.h"
#include "N_Server.h"
#include "Q_Exception.h"
#include "peer_input.h"
#include "vardel_platform.h"
#include "win32.h"

int main(int argc, char** argv) {
  std::string host = "127.0.0.1";
  int port = 3123;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string a = argv[i], value = argv[i + 1];
    if (a == "--host") host = value;
    else if (a == "--port") port = std::atoi(value.c_str());
    else if (a == "--hb-frequency") N_Client::setHeartbeatFrequency(std::strtof(value.c_str(), nullptr));
    else if (a == "--hb-latency") N_Client::setHeartbeatLatency(std::strtof(value.c_str(), nullptr));
    else return std::fprintf(stderr, "server_peer: unknown option %s\n", a.c_str()), 2;
  }
  platform::setLocalHost(host.c_str());
  try {
    N_Initializer network;
    N_Server server(port);
    std::vector<N_Client*> clients;
    CommandInput input;
    say("ready");
    for (; !input.finished(); std::this_thread::sleep_for(std::chrono::milliseconds(1))) {
      server.update();
      for (N_Client* joined; server.pollConnect(joined);) {
        clients.push_back(joined);
        say(std::string("client ") + const_cast<const char*>(joined->getAddress()->getStringNumber()));
      }
      void* message;
      unsigned size;
      for (N_Client* client : clients)
        while (client->poll(message, size))
          say("recv " + std::to_string(size) + " " + std::string(static_cast<char*>(message), std::min(size, 24u)));
      for (std::string line; input.next(line);) {
        std::istringstream in(line);
        std::string command, prefix;
        unsigned value = 0;
        in >> command >> value >> prefix;
        if (command == "quit") {
          input.close();
        } else if (command == "maximum") {
          server.setMaximumBandwidthUsage(value), say("done");
        } else if (command == "burst") {
          // The runtime's mutex is a named one: holding it keeps the network
          // thread from sending until every message is queued.
          platform::HANDLE runtime = platform::CreateMutexA(nullptr, platform::FALSE, "Kelvane network mutex");
          platform::WaitForSingleObject(runtime, platform::INFINITE);
          for (N_Client* client : clients)
            for (unsigned i = 0; i < value; ++i) {
              std::string payload = prefix + std::to_string(i) + ";";
              client->queueReliable(payload.data(), static_cast<unsigned>(payload.size()), 0, 1);
              // The flush gate stays shut for bytes / bandwidth after each message.
              for (auto limit = std::chrono::steady_clock::now() + std::chrono::seconds(5);
                   client->getReliableBytesWaiting() > 0 && std::chrono::steady_clock::now() < limit;)
                client->flushReliable();
            }
          platform::ReleaseMutex(runtime), platform::CloseHandle(runtime), say("done");
        } else if (!command.empty()) {
          say("error unknown command " + command);
        }
      }
    }
    for (N_Client* client : clients) server.disconnectClient(client);
    say("bye");
    return 0;
  } catch (Q_Exception* e) {
    say(std::string("error ") + e->getErrorMessage());
    return 1;
  }
}
