// One N_Client host for the client and server tests, driven line by line:
//   vardel_host_client_peer --host 127.0.0.2 --server 127.0.0.1 --port P [--hb-frequency F] [--hb-latency L]
// It makes its own runtime on --host, connects and calls update() about
// every millisecond. It prints "connected" / "lost" as isConnected() changes,
// "bandwidth N" and "latency X" as they change, "recv N TEXT" for each
// message, "flushed", "error TEXT", and "bye" at "quit". Commands:
//   limits                    prints "limits LARGEST", the largest unreliable size
//   stall SECONDS | bandwidth N | fr | fu (flush reliable / unreliable once)
//   qrn KEY PRIO SIZE CHAR | qun ...   queue SIZE copies of CHAR, reliable / unreliable
//   send-r COUNT PREFIX [MS [stamp]] | send-u ...
//        COUNT payloads "PREFIX<i>;", each once the queue is empty again and
//        MS after the one before (so each leaves in a message of its own),
//        "sent COUNT" after the last; with "stamp" each is "PREFIX<i>@<NS>;",
//        NS the steady clock in nanoseconds (the same in every process).
#include <chrono>
#include <cstdlib>
#include <memory>
#include <sstream>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Initializer.h"
#include "Q_Exception.h"
#include "peer_input.h"
#include "vardel_platform.h"
#include "win32.h"

namespace {

using Clock = std::chrono::steady_clock;

void queue(N_Client& client, bool reliable, std::string text, unsigned key = 0, unsigned priority = 1) {
  (client.*(reliable ? &N_Client::queueReliable : &N_Client::queueUnreliable))(text.data(), unsigned(text.size()), key,
                                                                            priority);
}

struct Sender {
  bool reliable = true, stamp = false;
  int count = 0, next = 0, spacingMs = 0;
  std::string prefix;
  Clock::time_point last;

  void step(N_Client& client) {
    const unsigned waiting = reliable ? client.getReliableBytesWaiting() : client.getUnreliableBytesWaiting();
    if (next >= count || waiting > 0 || Clock::now() - last < std::chrono::milliseconds(spacingMs)) return;
    last = Clock::now();
    std::string payload = prefix + std::to_string(next);
    if (stamp) payload += "@" + std::to_string(std::chrono::nanoseconds(last.time_since_epoch()).count());
    queue(client, reliable, payload + ";");
    if (++next == count) say("sent " + std::to_string(count));
  }
};

void run(N_Client& client, std::istringstream& in, const std::string& command, Sender* senders) {
  if (command == "limits") {
    say("limits " + std::to_string(client.getLargestUnreliablePacketSize()));
  } else if (command == "stall") {
    double seconds = 0;
    in >> seconds;
    std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
  } else if (command == "bandwidth") {
    unsigned value = 0;
    in >> value;
    client.setBandwidth(value);
  } else if (command == "qrn" || command == "qun") {
    unsigned key = 0, priority = 0, size = 0;
    char fill = 'x';
    in >> key >> priority >> size >> fill;
    queue(client, command == "qrn", std::string(size, fill), key, priority);
  } else if (command == "fr" || command == "fu") {
    command == "fr" ? client.flushReliable() : client.flushUnreliable();
    say("flushed");
  } else if (command == "send-r" || command == "send-u") {
    Sender& s = senders[command == "send-r" ? 0 : 1];
    s.next = s.spacingMs = 0;
    std::string flag;
    in >> s.count >> s.prefix >> s.spacingMs >> flag;
    s.stamp = flag == "stamp";
  } else if (!command.empty()) {
    say("error unknown command " + command);
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::string host = "127.0.0.2", server = "127.0.0.1";
  int port = 3123;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string a = argv[i], value = argv[i + 1];
    if (a == "--host") host = value;
    else if (a == "--server") server = value;
    else if (a == "--port") port = std::atoi(value.c_str());
    else if (a == "--hb-frequency") N_Client::setHeartbeatFrequency(std::strtof(value.c_str(), nullptr));
    else if (a == "--hb-latency") N_Client::setHeartbeatLatency(std::strtof(value.c_str(), nullptr));
    else return std::fprintf(stderr, "client_peer: unknown option %s\n", a.c_str()), 2;
  }
  platform::setLocalHost(host.c_str());
  try {
    N_Initializer network;
    N_Address serverAddress(server.c_str());
    auto client = std::make_unique<N_Client>(&serverAddress, port);
    bool connected = false;
    unsigned lastBandwidth = 0;
    float lastLatency = client->getLatency();
    CommandInput input;
    Sender senders[2];  // reliable, unreliable
    senders[1].reliable = false;
    for (; !input.finished(); std::this_thread::sleep_for(std::chrono::milliseconds(1))) {
      client->update();
      try {
        for (std::string line; input.next(line);) {
          std::istringstream in(line);
          std::string command;
          in >> command;
          if (command == "quit") return client.reset(), say("bye"), 0;
          run(*client, in, command, senders);
        }
        for (Sender& s : senders) s.step(*client);
        void* message = nullptr;
        unsigned size = 0;
        while (client->poll(message, size))
          say("recv " + std::to_string(size) + " " + std::string(static_cast<const char*>(message), size));
        if (senders[0].count > 0 || senders[1].count > 0)
          client->flushReliable(), client->flushUnreliable();
      } catch (Q_Exception* e) {
        say(std::string("error ") + e->getErrorMessage());
      }
      if (client->isConnected() != connected) {
        connected = !connected, lastBandwidth = 0;
        say(connected ? "connected" : "lost");
      }
      if (connected && client->getBandwidth() != lastBandwidth)
        say("bandwidth " + std::to_string(lastBandwidth = client->getBandwidth()));
      if (client->getLatency() != lastLatency) say("latency " + std::to_string(lastLatency = client->getLatency()));
    }
    return 0;
  } catch (Q_Exception* e) {
    say(std::string("error ") + e->getErrorMessage());
    return 1;
  }
}
