// One N_Client host for the client and server tests, driven line by line.
//
//   vardel_host_client_peer --host 127.0.0.2 --server 127.0.0.1 --port P
//       [--hb-frequency F] [--hb-latency L] [--bandwidth B] [--seed S]
//       [--loss X] [--delay MIN MAX] [--no-read]
//
// It makes its own runtime on --host, connects to the server and calls
// update() in a loop of about a millisecond. It prints, one per line:
//   ready                          runtime up, client constructed
//   connected                      isConnected() became true
//   lost                           isConnected() became false after that
//   bandwidth N                    getBandwidth() changed (once connected)
//   latency X                      getLatency() changed
//   recv N TEXT                    a message of N bytes (payloads are text)
//   sync OK SECONDS                result and duration of updateWorldTimer()
//   time AGE                       the world timer's age
//   queued / flushed / error TEXT  results of the queue commands
//   bye                            at "quit", after the client is gone
// Commands on standard input:
//   quit | sync | time | stall SECONDS | disconnect | bandwidth N
//   heartbeat F L | loss X | delay MIN MAX | seed S
//   qr KEY PRIO TEXT | qu KEY PRIO TEXT    queue a reliable/unreliable payload
//   qrn KEY PRIO SIZE CHAR | qun ...       the same with SIZE copies of CHAR
//   limits                                 prints "limits LARGEST_UNRELIABLE"
//   fr | fu                                flush once
//   send-r COUNT PREFIX [MS [stamp]] | send-u COUNT PREFIX [MS [stamp]]
//        queue COUNT payloads "PREFIX<i>;" (i from 0), each once the queue
//        is empty again and at least MS milliseconds (default 0) after the
//        one before, so each leaves in a message of its own; flushing every
//        pass. Prints "sent COUNT" when the last is queued. With "stamp" each
//        is "PREFIX<i>@<NS>;", NS the steady clock in nanoseconds when queued
//        (the same clock in every process of the machine).
//   pump on|off                            flush both queues every pass
//   echo on|off                            queue every message back, reliably
//   read on|off                            poll and print messages
//   probe MS | probe report | probe stop
//        queue a numbered payload "#N;" every MS milliseconds, for a server
//        that echoes them back; echoes are taken out of the read (not
//        printed) and must come back in order. "report" prints
//        "probe-window COUNT P99_MS MAX_MS" for the round trips since the
//        last report; "stop" ends the sending and, once every echo is back
//        (or after 10 s), prints "probe-final SENT ECHOED DISORDER".
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "Q_Exception.h"
#include "Q_Timer.h"
#include "vardel_platform.h"
#include "win32.h"

namespace {

void say(const std::string& line) {
  std::fputs(line.c_str(), stdout);
  std::fputc('\n', stdout);
  std::fflush(stdout);
}

// A line of standard input if one is complete; never blocks.
bool readCommand(std::string& pending, std::string& line, bool& inputClosed) {
  for (;;) {
    std::size_t end = pending.find('\n');
    if (end != std::string::npos) {
      line = pending.substr(0, end);
      pending.erase(0, end + 1);
      return true;
    }
    if (inputClosed) return false;
    pollfd p{0, POLLIN, 0};
    if (::poll(&p, 1, 0) <= 0) return false;
    char buffer[4096];
    ssize_t got = ::read(0, buffer, sizeof buffer);
    if (got <= 0) {
      inputClosed = true;
      return false;
    }
    pending.append(buffer, static_cast<std::size_t>(got));
  }
}

struct Sender {
  bool reliable = true;
  int count = 0;
  int next = 0;
  int spacingMs = 0;
  bool stamp = false;
  std::string prefix;
  std::chrono::steady_clock::time_point last;
};

std::string errorText(Q_Exception* e) { return e->getErrorMessage(); }

// Numbered payloads to an echoing server, and their round trips.
struct Probe {
  using Clock = std::chrono::steady_clock;
  bool sending = false;
  bool stopping = false;
  int spacingMs = 20;
  std::vector<Clock::time_point> sentAt;  // by number
  std::size_t expected = 0;               // the number whose echo is due
  std::size_t echoed = 0;
  std::size_t disorder = 0;
  std::vector<double> window;  // round trips (ms) since the last report
  Clock::time_point last;
  Clock::time_point stoppedAt;

  // Takes the echoes out of a received batch; false if it holds none.
  bool take(const std::string& text) {
    if (text.empty() || text[0] != '#') return false;
    const Clock::time_point now = Clock::now();
    for (std::size_t at = 0, end; (end = text.find(';', at)) != std::string::npos; at = end + 1) {
      const std::size_t n = std::strtoul(text.c_str() + at + 1, nullptr, 10);
      disorder += n != expected;
      if (n < sentAt.size()) window.push_back(std::chrono::duration<double, std::milli>(now - sentAt[n]).count());
      expected = n + 1;
      ++echoed;
    }
    return true;
  }
  // Queues the next payload when it is due; the final line once the
  // stopping is over, else nothing.
  std::string step(N_Client& client) {
    const Clock::time_point now = Clock::now();
    if (sending && now - last >= std::chrono::milliseconds(spacingMs)) {
      std::string payload = "#" + std::to_string(sentAt.size()) + ";";
      client.queueReliable(payload.data(), static_cast<unsigned>(payload.size()), 0, 1);
      sentAt.push_back(now);
      last = now;
    }
    if (!stopping || (echoed < sentAt.size() && now - stoppedAt < std::chrono::seconds(10))) return "";
    stopping = false;
    return "probe-final " + std::to_string(sentAt.size()) + " " + std::to_string(echoed) + " " +
           std::to_string(disorder);
  }
  std::string report() {
    std::sort(window.begin(), window.end());
    const double p99 = window.empty() ? 0.0 : window[(window.size() * 99 + 99) / 100 - 1];
    char text[96];
    std::snprintf(text, sizeof text, "probe-window %zu %.3f %.3f", window.size(), p99,
                  window.empty() ? 0.0 : window.back());
    window.clear();
    return text;
  }
};

}  // namespace

int main(int argc, char** argv) {
  std::string host = "127.0.0.2";
  std::string server = "127.0.0.1";
  int port = 3123;
  long bandwidth = -1;
  bool read = true;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    auto next = [&]() -> const char* { return i + 1 < argc ? argv[++i] : ""; };
    if (a == "--host") host = next();
    else if (a == "--server") server = next();
    else if (a == "--port") port = std::atoi(next());
    else if (a == "--hb-frequency") N_Client::setHeartbeatFrequency(std::strtof(next(), nullptr));
    else if (a == "--hb-latency") N_Client::setHeartbeatLatency(std::strtof(next(), nullptr));
    else if (a == "--bandwidth") bandwidth = std::atol(next());
    else if (a == "--seed") platform::srand(static_cast<unsigned>(std::atol(next())));
    else if (a == "--loss") N_Client::simulatePacketLoss(std::strtof(next(), nullptr));
    else if (a == "--delay") {
      unsigned lo = static_cast<unsigned>(std::atol(next()));
      unsigned hi = static_cast<unsigned>(std::atol(next()));
      N_Client::simulateLatency(lo, hi);
    } else if (a == "--no-read") read = false;
    else {
      std::fprintf(stderr, "client_peer: unknown option %s\n", a.c_str());
      return 2;
    }
  }

  platform::setLocalHost(host.c_str());
  try {
    N_Initializer network;
    N_Address serverAddress(server.c_str());
    if (serverAddress.getIdentifier() == 0) {
      say("error server address");
      return 3;
    }
    auto client = std::make_unique<N_Client>(&serverAddress, port);
    if (bandwidth >= 0) client->setBandwidth(static_cast<unsigned>(bandwidth));
    say("ready");

    bool connected = false;
    bool everConnected = false;
    unsigned lastBandwidth = client->getBandwidth();
    float lastLatency = client->getLatency();
    bool pump = false;
    bool echo = false;
    bool inputClosed = false;
    std::string pending;
    Sender senders[2];  // reliable, unreliable
    senders[1].reliable = false;
    Probe probe;

    for (;;) {
      client->update();

      std::string line;
      while (readCommand(pending, line, inputClosed)) {
        std::istringstream in(line);
        std::string command;
        in >> command;
        try {
          if (command == "quit") {
            client.reset();
            say("bye");
            return 0;
          } else if (command == "sync") {
            Q_Timer took;
            bool ok = client->updateWorldTimer();
            char text[64];
            std::snprintf(text, sizeof text, "sync %d %.6f", ok ? 1 : 0, static_cast<double>(took.getAge()));
            say(text);
          } else if (command == "time") {
            char text[64];
            std::snprintf(text, sizeof text, "time %.6f", static_cast<double>(client->getWorldTimer().getAge()));
            say(text);
          } else if (command == "stall") {
            double seconds = 0;
            in >> seconds;
            std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
            say("resumed");
          } else if (command == "disconnect") {
            client->disconnect();
          } else if (command == "bandwidth") {
            unsigned value = 0;
            in >> value;
            client->setBandwidth(value);
          } else if (command == "heartbeat") {
            float f = 0, l = 0;
            in >> f >> l;
            N_Client::setHeartbeatFrequency(f);
            N_Client::setHeartbeatLatency(l);
          } else if (command == "loss") {
            float loss = 0;
            in >> loss;
            N_Client::simulatePacketLoss(loss);
          } else if (command == "delay") {
            unsigned lo = 0, hi = 0;
            in >> lo >> hi;
            N_Client::simulateLatency(lo, hi);
          } else if (command == "seed") {
            unsigned seed = 0;
            in >> seed;
            platform::srand(seed);
          } else if (command == "qr" || command == "qu") {
            unsigned key = 0, priority = 0;
            std::string text;
            in >> key >> priority >> text;
            if (command == "qr")
              client->queueReliable(text.data(), static_cast<unsigned>(text.size()), key, priority);
            else
              client->queueUnreliable(text.data(), static_cast<unsigned>(text.size()), key, priority);
            say("queued");
          } else if (command == "qrn" || command == "qun") {
            unsigned key = 0, priority = 0, size = 0;
            char fill = 'x';
            in >> key >> priority >> size >> fill;
            std::string text(size, fill);
            if (command == "qrn")
              client->queueReliable(text.data(), size, key, priority);
            else
              client->queueUnreliable(text.data(), size, key, priority);
            say("queued");
          } else if (command == "limits") {
            say("limits " + std::to_string(client->getLargestUnreliablePacketSize()));
          } else if (command == "fr") {
            client->flushReliable();
            say("flushed");
          } else if (command == "fu") {
            client->flushUnreliable();
            say("flushed");
          } else if (command == "send-r" || command == "send-u") {
            Sender& sender = senders[command == "send-r" ? 0 : 1];
            sender.next = 0;
            sender.spacingMs = 0;
            in >> sender.count >> sender.prefix >> sender.spacingMs;
            std::string flag;
            in >> flag;
            sender.stamp = flag == "stamp";
          } else if (command == "pump") {
            std::string on;
            in >> on;
            pump = on == "on";
          } else if (command == "echo") {
            std::string on;
            in >> on;
            echo = on == "on";
          } else if (command == "probe") {
            std::string what;
            in >> what;
            if (what == "report") {
              say(probe.report());
            } else if (what == "stop") {
              probe.sending = false;
              probe.stopping = true;
              probe.stoppedAt = std::chrono::steady_clock::now();
            } else {
              probe.spacingMs = std::atoi(what.c_str());
              probe.sending = true;
            }
          } else if (command == "read") {
            std::string on;
            in >> on;
            read = on == "on";
          } else if (!command.empty()) {
            say("error unknown command " + command);
          }
        } catch (Q_Exception* e) {
          say("error " + errorText(e));
        }
      }

      try {
        for (Sender& sender : senders) {
          const unsigned waiting =
              sender.reliable ? client->getReliableBytesWaiting() : client->getUnreliableBytesWaiting();
          if (sender.next < sender.count && waiting == 0 &&
              std::chrono::steady_clock::now() - sender.last >= std::chrono::milliseconds(sender.spacingMs)) {
            sender.last = std::chrono::steady_clock::now();
            std::string payload = sender.prefix + std::to_string(sender.next);
            if (sender.stamp)
              payload += "@" + std::to_string(std::chrono::duration_cast<std::chrono::nanoseconds>(
                                                  sender.last.time_since_epoch())
                                                  .count());
            payload += ";";
            if (sender.reliable)
              client->queueReliable(payload.data(), static_cast<unsigned>(payload.size()), 0, 1);
            else
              client->queueUnreliable(payload.data(), static_cast<unsigned>(payload.size()), 0, 1);
            ++sender.next;
            if (sender.next == sender.count) say("sent " + std::to_string(sender.count));
          }
        }
        if (std::string final = probe.step(*client); !final.empty()) say(final);
        if (read) {
          void* message = nullptr;
          unsigned size = 0;
          while (client->poll(message, size)) {
            std::string text(static_cast<const char*>(message), size);
            if (probe.take(text)) continue;
            say("recv " + std::to_string(size) + " " + text);
            if (echo) client->queueReliable(text.data(), size, 0, 0);
          }
        }
        if (pump || echo || senders[0].count > 0 || senders[1].count > 0 || probe.sending || probe.stopping) {
          client->flushReliable();
          client->flushUnreliable();
        }
      } catch (Q_Exception* e) {
        say("error " + errorText(e));
      }

      if (client->isConnected() != connected) {
        connected = !connected;
        if (connected) {
          everConnected = true;
          say("connected");
          lastBandwidth = client->getBandwidth();
          say("bandwidth " + std::to_string(lastBandwidth));
        } else if (everConnected) {
          say("lost");
        }
      }
      if (connected && client->getBandwidth() != lastBandwidth) {
        lastBandwidth = client->getBandwidth();
        say("bandwidth " + std::to_string(lastBandwidth));
      }
      if (client->getLatency() != lastLatency) {
        lastLatency = client->getLatency();
        char text[64];
        std::snprintf(text, sizeof text, "latency %.6f", static_cast<double>(lastLatency));
        say(text);
      }
      if (inputClosed && pending.empty()) {
        client.reset();
        return 0;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
  } catch (Q_Exception* e) {
    say("error " + errorText(e));
    return 1;
  }
}
