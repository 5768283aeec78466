// One N_Client host for the client and server tests, driven line by line:
//   vardel_host_client_peer --host 127.0.0.2 --server 127.0.0.1 --port P [--hb-frequency F] [--hb-latency L]
// It makes its own runtime on --host, connects and calls update() about
// every millisecond. It prints "connected" / "lost" as isConnected() changes,
// "bandwidth N" as it changes, "recv N TEXT" for each
// message, "flushed", "error TEXT", and "bye" at "quit". Commands:
//   bandwidth N | fr | fu (flush reliable / unreliable once)
//   qrn KEY PRIO SIZE CHAR | qun ...   queue SIZE copies of CHAR, reliable / unreliable
//   send-r COUNT PREFIX [MS [stamp]] | send-u ...
//        COUNT payloads "PREFIX<i>;", each once the queue is empty again and
//        MS after the one before (so each leaves in a message of its own),
//        "sent COUNT" after the last; with "stamp" each is "PREFIX<i>@<NS>;",
//        NS the steady clock in nanoseconds (the same in every process).
//   probe MS | probe report | probe stop
//        a payload "#N;" every MS to a server that echoes them; echoes must
//        come back in order. "report" prints "probe-window COUNT P99_MS
//        MAX_MS" of the round trips since the last report; "stop" ends the
//        sending and, once every echo is back (or after 10 s), prints
//        "probe-final SENT ECHOED DISORDER".
#include <algorithm>
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

// Numbered payloads to an echoing server, and their round trips.
struct Probe {
  bool sending = false, stopping = false;
  int spacingMs = 20;
  std::vector<Clock::time_point> sentAt;  // by number
  std::size_t expected = 0, echoed = 0, disorder = 0;
  std::vector<double> window;  // round trips (ms) since the last report
  Clock::time_point last, stoppedAt;

  // Takes the echoes among the payloads of a batch; false if it holds none.
  bool take(const std::string& text) {
    const std::size_t before = echoed;
    for (std::size_t at = 0, end; (end = text.find(';', at)) != std::string::npos; at = end + 1) {
      if (text[at] != '#') continue;
      ++echoed;
      const std::size_t n = std::strtoul(text.c_str() + at + 1, nullptr, 10);
      disorder += n != expected;
      if (n < sentAt.size()) window.push_back(std::chrono::duration<double, std::milli>(Clock::now() - sentAt[n]).count());
      expected = n + 1;
    }
    return echoed > before;
  }
  void step(N_Client& client) {
    const Clock::time_point now = Clock::now();
    if (sending && now - last >= std::chrono::milliseconds(spacingMs))
      queue(client, true, "#" + std::to_string(sentAt.size()) + ";"), sentAt.push_back(last = now);
    if (!stopping || (echoed < sentAt.size() && now - stoppedAt < std::chrono::seconds(10))) return;
    stopping = false;
    say("probe-final " + std::to_string(sentAt.size()) + " " + std::to_string(echoed) + " " + std::to_string(disorder));
  }
  void command(const std::string& what) {
    if (what == "report") {
      std::sort(window.begin(), window.end());
      const double p99 = window.empty() ? 0.0 : window[(window.size() * 99 + 99) / 100 - 1];
      say("probe-window " + std::to_string(window.size()) + " " + std::to_string(p99) + " " +
          std::to_string(window.empty() ? 0.0 : window.back()));
      window.clear();
    } else if (what == "stop") {
      sending = false, stopping = true, stoppedAt = Clock::now();
    } else {
      spacingMs = std::atoi(what.c_str()), sending = true;
    }
  }
};

void run(N_Client& client, std::istringstream& in, const std::string& command, Sender* senders, Probe& probe) {
  if (command == "bandwidth") {
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
  } else if (command == "probe") {
    std::string what;
    in >> what;
    probe.command(what);
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
    CommandInput input;
    Sender senders[2];  // reliable, unreliable
    senders[1].reliable = false;
    Probe probe;
    for (; !input.finished(); std::this_thread::sleep_for(std::chrono::milliseconds(1))) {
      client->update();
      try {
        for (std::string line; input.next(line);) {
          std::istringstream in(line);
          std::string command;
          in >> command;
          if (command == "quit") return client.reset(), say("bye"), 0;
          run(*client, in, command, senders, probe);
        }
        for (Sender& s : senders) s.step(*client);
        probe.step(*client);
        void* message = nullptr;
        unsigned size = 0;
        while (client->poll(message, size))
          if (const std::string text(static_cast<const char*>(message), size); !probe.take(text))
            say("recv " + std::to_string(size) + " " + text);
        if (senders[0].count > 0 || senders[1].count > 0 || probe.sending || probe.stopping)
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
    }
    return 0;
  } catch (Q_Exception* e) {
    say(std::string("error ") + e->getErrorMessage());
    return 1;
  }
}
