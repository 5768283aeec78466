// The shared world: a server and clients on loopback, each client a process
// of its own with its own address. Clients move an entity, send its position
// unreliably 60 times a second (keyed, so a newer position replaces one that
// hasn't left yet) and a status event reliably once a second. The server
// relays every position to every client and shows a live table per client,
// with the latency and loss each direction achieved under the simulated bad
// network (which by default only the clients apply, to what they read).
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "N_Address.h"
#include "N_Client.h"
#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Server.h"
#include "demo.h"
#include "vardel_platform.h"

namespace demo {
namespace {

using Clock = std::chrono::steady_clock;

// Every payload is one fixed-size record, so a batch splits again by size.
struct Record {
  enum : unsigned { POSITION = 1, STATUS = 2 };
  unsigned type;
  unsigned entity;
  float x, y;       // STATUS: the client's mean latency (ms) and loss share of
                    // what it read, over the last second and since the start
                    // (NaN and negative: nothing measured yet)
  float worldTime;  // the sender's world clock when it queued the record
  unsigned count;   // POSITION: unreliable batches the sender had sent before
                    // (gaps are losses); STATUS: positions the client has seen
};
static_assert(sizeof(Record) == 24, "records travel as they lie in memory");

constexpr double kTick = 1.0 / 60.0;

void applySimulation(const Options& o) {
  N_Client::simulatePacketLoss(o.loss);
  N_Client::simulateLatency(o.delayMin, o.delayMax);
  N_Client::simulateNetwork(o.network);
}

// Sends whatever the unreliable queue may and counts the batches that left:
// every record queued since the last one that left carries that count.
void flushCounted(N_Client& client, unsigned& sent) {
  const unsigned before = client.getUnreliableBytesWaiting();
  client.flushUnreliable();
  if (before > 0 && client.getUnreliableBytesWaiting() < before) ++sent;
}

// Latency and loss of one direction as its reader sees them: the latency of
// each record read against its sender's world clock (the two clocks are in
// line), and the batch numbers that never arrived.
struct Achieved {
  double latencySum = 0;  // ms, this second
  unsigned latencyCount = 0;
  double latencyMs = NAN;  // mean of the last full second; NaN: nothing read
  unsigned long long distinct = 0;
  long long highest = -1;
  std::set<unsigned> recent;  // batch numbers read lately, against copies

  void read(unsigned batch, double latency) {
    latencySum += latency;
    ++latencyCount;
    if (recent.insert(batch).second) ++distinct;
    if (static_cast<long long>(batch) > highest) highest = batch;
    while (!recent.empty() && *recent.begin() + 512 < static_cast<unsigned long long>(highest))
      recent.erase(recent.begin());
  }
  void endSecond() {
    latencyMs = latencyCount > 0 ? latencySum / latencyCount : NAN;
    latencySum = 0;
    latencyCount = 0;
  }
  double loss() const { return highest < 0 ? -1 : 1.0 - static_cast<double>(distinct) / (highest + 1); }
};

std::string percent(double share) {
  if (share < 0) return "-";
  char text[16];
  std::snprintf(text, sizeof text, "%.1f%%", share * 100.0);
  return text;
}

std::string millis(double ms) {
  if (std::isnan(ms)) return "-";
  char text[16];
  std::snprintf(text, sizeof text, "%.1f", ms);
  return text;
}

// What the settings say, for the dashboard.
std::string describeSettings(const Options& o) {
  std::string text;
  char part[160];
  if (o.loss > 0 || o.delayMin || o.delayMax) {
    std::snprintf(part, sizeof part, "read gate: loss %.0f%%, %u-%u ms shut after every read", o.loss * 100.0,
                  o.delayMin, o.delayMax);
    text += part;
  }
  if (!o.model.empty()) {
    const N_NetworkModel& m = o.network;
    if (!text.empty()) text += "; ";
    std::snprintf(part, sizeof part, "model: delay %.0f+-%.0f ms, loss %.1f%%, dup %.1f%%, reorder %.1f%% by %.0f ms",
                  m.fDelay, m.fJitter, m.fLoss * 100.0, m.fDuplicate * 100.0, m.fReorder * 100.0, m.fReorderWindow);
    text += part;
    if (m.uBandwidth > 0) {
      std::snprintf(part, sizeof part, ", cap %u B/s, queue %u B", m.uBandwidth, m.uQueueLimit);
      text += part;
    }
  }
  return text;
}

template <class Each>
void forEachRecord(const void* data, unsigned size, Each each) {
  const auto* p = static_cast<const unsigned char*>(data);
  for (unsigned at = 0; at + sizeof(Record) <= size; at += sizeof(Record)) {
    Record r;
    std::memcpy(&r, p + at, sizeof r);
    each(r);
  }
}

// Per-second rates of one connection from two copies of its statistics, as
// the server's end counts: in = read from the client, out = sent to it.
struct Rates {
  double bytesIn[3] = {}, bytesOut[3] = {}, messagesIn[3] = {}, messagesOut[3] = {};
  double replaced = 0, lost = 0, delayed = 0;
};

const char* const kChannelNames[3] = {"reliable", "unreliable", "control"};

const N_SocketStats& channelOf(const N_ClientStats& s, int c) {
  return c == 0 ? s.reliable : c == 1 ? s.unreliable : s.control;
}

Rates ratesBetween(const N_ClientStats& before, const N_ClientStats& now, double seconds) {
  Rates r;
  if (seconds <= 0) return r;
  auto rate = [seconds](std::uint64_t a, std::uint64_t b) { return static_cast<double>(b - a) / seconds; };
  for (int c = 0; c < 3; ++c) {
    const N_SocketStats &a = channelOf(before, c), &b = channelOf(now, c);
    r.bytesIn[c] = rate(a.uBytesReceived, b.uBytesReceived);
    r.bytesOut[c] = rate(a.uBytesSent, b.uBytesSent);
    r.messagesIn[c] = rate(a.uMessagesReceived, b.uMessagesReceived);
    r.messagesOut[c] = rate(a.uMessagesSent, b.uMessagesSent);
  }
  r.replaced = rate(before.reliableQueue.uPayloadsReplaced + before.unreliableQueue.uPayloadsReplaced,
                    now.reliableQueue.uPayloadsReplaced + now.unreliableQueue.uPayloadsReplaced);
  r.lost = rate(before.uSimulatedLost + before.model.uLost, now.uSimulatedLost + now.model.uLost);
  r.delayed = rate(before.uSimulatedDelayed + before.model.uDelayed, now.uSimulatedDelayed + now.model.uDelayed);
  return r;
}

// A number for JSON: NaN (nothing measured) is null.
std::string jsonNumber(double value, int decimals) {
  if (!std::isfinite(value)) return "null";
  char text[40];
  std::snprintf(text, sizeof text, "%.*f", decimals, value);
  return text;
}

struct ClientRow {
  std::string name;
  unsigned entity = 0;
  unsigned long messages = 0;  // payload messages in the current second
  double rate = 0;             // messages per second, last full second
  double offsetMs = 0;         // client's world clock minus the server's
  bool haveOffset = false;
  unsigned seenByClient = 0;
  float x = 0, y = 0;
  unsigned sentDown = 0;  // unreliable batches sent to the client
  Achieved up;            // client to server, as read here
  double downMs = NAN, downLoss = -1;  // server to client, as the client reported
  N_ClientStats stats;    // the connection's statistics at the last full second
  Clock::time_point statsAt;
  Rates rates;            // over the last full second
};

// One line of JSON for one client and second (--json).
void writeJson(std::FILE* out, double t, const ClientRow& row) {
  const N_ClientStats& s = row.stats;
  const Rates& r = row.rates;
  std::string line = "{\"t\":" + jsonNumber(t, 3) + ",\"client\":\"" + row.name + "\",\"entity\":" +
                     std::to_string(row.entity);
  line += ",\"rtt_ms\":{\"latest\":" + jsonNumber(s.fLatency * 1000.0, 3) +
          ",\"lowest\":" + jsonNumber(s.fLatencyLowest * 1000.0, 3) + ",\"mean\":" + jsonNumber(s.fLatencyMean * 1000.0, 3) +
          ",\"highest\":" + jsonNumber(s.fLatencyHighest * 1000.0, 3) + ",\"heartbeats\":" + std::to_string(s.uHeartbeats) + "}";
  line += ",\"grant_Bps\":" + std::to_string(s.uBandwidth);
  line += ",\"per_second\":{";
  for (int c = 0; c < 3; ++c) {
    line += std::string(c > 0 ? "," : "") + "\"" + kChannelNames[c] + "\":{\"bytes_in\":" + jsonNumber(r.bytesIn[c], 1) +
            ",\"bytes_out\":" + jsonNumber(r.bytesOut[c], 1) + ",\"messages_in\":" + jsonNumber(r.messagesIn[c], 1) +
            ",\"messages_out\":" + jsonNumber(r.messagesOut[c], 1) + "}";
  }
  line += ",\"payloads_replaced\":" + jsonNumber(r.replaced, 1) + ",\"simulated_lost\":" + jsonNumber(r.lost, 1) +
          ",\"simulated_delayed\":" + jsonNumber(r.delayed, 1) + "}";
  const unsigned sendWaiting =
      s.reliable.uBytesWaitingForSend + s.unreliable.uBytesWaitingForSend + s.control.uBytesWaitingForSend;
  line += ",\"waiting_bytes\":{\"reliable_queue\":" + std::to_string(s.reliableQueue.uBytesWaiting) +
          ",\"unreliable_queue\":" + std::to_string(s.unreliableQueue.uBytesWaiting) +
          ",\"sockets\":" + std::to_string(sendWaiting) + "}";
  line += ",\"totals\":{\"bytes_in\":" +
          std::to_string(s.reliable.uBytesReceived + s.unreliable.uBytesReceived + s.control.uBytesReceived) +
          ",\"bytes_out\":" + std::to_string(s.reliable.uBytesSent + s.unreliable.uBytesSent + s.control.uBytesSent) +
          ",\"payloads_refused\":" +
          std::to_string(s.reliableQueue.uPayloadsRefused + s.unreliableQueue.uPayloadsRefused) + "}";
  line += ",\"achieved\":{\"up_ms\":" + jsonNumber(row.up.latencyMs, 2) + ",\"up_loss\":" +
          (row.up.loss() < 0 ? std::string("null") : jsonNumber(row.up.loss(), 4)) + ",\"down_ms\":" +
          jsonNumber(row.downMs, 2) + ",\"down_loss\":" + (row.downLoss < 0 ? std::string("null") : jsonNumber(row.downLoss, 4)) +
          "}}\n";
  std::fputs(line.c_str(), out);
}

// The process's runtime over the last full second.
struct RuntimeRow {
  N_RuntimeStats stats;
  double passes = 0, events = 0;  // per second
};

void drawTable(N_Server& server, std::map<N_Client*, ClientRow>& rows, const RuntimeRow& runtime, const Options& o,
               int& lines) {
  if (lines > 0) std::printf("\x1b[%dA", lines);
  lines = 0;
  auto line = [&lines](const char* format, auto... values) {
    std::printf("\x1b[K");
    std::printf(format, values...);
    ++lines;
  };
  line("vardel shared world  world time %8.2f s  clients %zu\n", server.getWorldTimer().getAge(), rows.size());
  const std::string settings = describeSettings(o);
  const std::string where = o.mode == "world" ? "on " + o.simulateOn : "on this server";
  if (settings.empty())
    line("no simulated bad network\n");
  else
    line("simulated %s: %s\n", where.c_str(), settings.c_str());
  line("achieved: up = client to server as the server reads it, down = server to client as the client reads it;\n");
  line("          latency by the two world clocks, which differ by about the clock off column\n");
  line("%-12s %6s %7s %9s %9s %8s %8s %6s %8s %7s %8s %7s %14s\n", "client", "entity", "rtt", "clock off",
       "bandwidth", "rel wait", "unr wait", "in", "up", "up", "down", "down", "position");
  line("%-12s %6s %7s %9s %9s %8s %8s %6s %8s %7s %8s %7s %14s\n", "", "", "ms", "ms", "B/s", "B", "B", "msg/s",
       "ms", "loss", "ms", "loss", "");
  if (rows.empty()) line("  (waiting for clients)\n");
  for (auto& [client, row] : rows) {
    char offset[16] = "-";
    if (row.haveOffset) std::snprintf(offset, sizeof offset, "%+.1f", row.offsetMs);
    line("%-12s %6u %7.1f %9s %9u %8u %8u %6.0f %8s %7s %8s %7s %6.1f,%6.1f\n", row.name.c_str(), row.entity,
         client->getLatency() * 1000.0, offset, client->getBandwidth(), client->getReliableBytesWaiting(),
         client->getUnreliableBytesWaiting(), row.rate, millis(row.up.latencyMs).c_str(),
         percent(row.up.loss()).c_str(), millis(row.downMs).c_str(), percent(row.downLoss).c_str(), row.x, row.y);
  }
  line("\n");
  // The statistics of each connection (N_Client::getStatistics() on the
  // server's end), as rates over the last full second.
  line("traffic per second, as the server's end of each connection counts it (in: from the client, out: to it)\n");
  line("%-12s %13s %13s %13s %13s %11s %16s %5s %6s %6s %7s\n", "client", "reliable in", "reliable out",
       "unreliable in", "unrel. out", "control", "rtt ms, last 16", "repl", "sim", "sim", "waiting");
  line("%-12s %5s %7s %5s %7s %5s %7s %5s %7s %5s %5s %16s %5s %6s %6s %7s\n", "", "msg", "B", "msg", "B", "msg", "B",
       "msg", "B", "B in", "B out", "low/mean/high", "/s", "lost/s", "del/s", "B");
  for (auto& [client, row] : rows) {
    const Rates& r = row.rates;
    const N_ClientStats& s = row.stats;
    char rtt[40];
    std::snprintf(rtt, sizeof rtt, "%.1f/%.1f/%.1f", s.fLatencyLowest * 1000.0, s.fLatencyMean * 1000.0,
                  s.fLatencyHighest * 1000.0);
    line("%-12s %5.0f %7.0f %5.0f %7.0f %5.0f %7.0f %5.0f %7.0f %5.0f %5.0f %16s %5.0f %6.0f %6.0f %7u\n",
         row.name.c_str(), r.messagesIn[0], r.bytesIn[0], r.messagesOut[0], r.bytesOut[0], r.messagesIn[1],
         r.bytesIn[1], r.messagesOut[1], r.bytesOut[1], r.bytesIn[2], r.bytesOut[2], rtt, r.replaced, r.lost,
         r.delayed,
         s.reliableQueue.uBytesWaiting + s.unreliableQueue.uBytesWaiting + s.reliable.uBytesWaitingForSend +
             s.unreliable.uBytesWaitingForSend + s.control.uBytesWaitingForSend);
  }
  const N_RuntimeStats& rt = runtime.stats;
  line("runtime: %u sockets and %u listeners open, %u B waiting for send, network thread %.0f passes/s, %.0f events/s\n",
       rt.uOpenSockets, rt.uOpenListeners, rt.uBytesWaitingForSend, runtime.passes, runtime.events);
  line("\n");
  std::fflush(stdout);
}

}  // namespace

int runServer(const Options& options) {
  if (!options.host.empty()) platform::setLocalHost(options.host.c_str());
  try {
    N_Initializer network;
    if (options.simulateHere) applySimulation(options);
    N_Server server(options.port);
    std::map<N_Client*, ClientRow> rows;
    unsigned nextEntity = 1;
    auto start = Clock::now();
    std::FILE* json = nullptr;
    if (!options.json.empty() && (json = std::fopen(options.json.c_str(), "w")) == nullptr) {
      std::printf("server: cannot write %s\n", options.json.c_str());
      return 1;
    }
    RuntimeRow runtime;
    runtime.stats = N_Initializer::getStatistics();
    auto runtimeAt = start;
    auto nextDraw = start;
    auto nextSecond = start + std::chrono::seconds(1);
    int lines = 0;
    while (!stopRequested()) {
      auto tick = Clock::now();
      if (options.seconds > 0 && tick - start > std::chrono::duration<double>(options.seconds)) break;
      server.update();
      N_Client* joined;
      while (server.pollConnect(joined)) {
        ClientRow row;
        row.name = const_cast<const char*>(joined->getAddress()->getStringNumber());
        row.entity = nextEntity++;
        row.stats = joined->getStatistics();
        row.statsAt = Clock::now();
        rows[joined] = row;
      }
      std::vector<Record> positions;
      for (auto it = rows.begin(); it != rows.end();) {
        N_Client* client = it->first;
        if (!client->isConnected()) {
          server.disconnectClient(client);
          it = rows.erase(it);
          continue;
        }
        ClientRow& row = it->second;
        void* data;
        unsigned size;
        while (client->poll(data, size)) {
          ++row.messages;
          forEachRecord(data, size, [&](const Record& r) {
            if (r.type == Record::POSITION) {
              row.x = r.x;
              row.y = r.y;
              row.up.read(r.count, (server.getWorldTimer().getAge() - r.worldTime) * 1000.0);
            } else if (r.type == Record::STATUS) {
              // The record left the client about half a round trip ago.
              row.offsetMs = (r.worldTime + client->getLatency() / 2.0 - server.getWorldTimer().getAge()) * 1000.0;
              row.haveOffset = client->getLatency() > 0;
              row.seenByClient = r.count;
              row.downMs = r.x;
              row.downLoss = r.y;
            }
          });
        }
        positions.push_back(Record{Record::POSITION, row.entity, row.x, row.y, server.getWorldTimer().getAge(), 0});
        ++it;
      }
      // Relay every entity's position to every client; the key keeps one
      // position per entity waiting.
      for (auto& [client, row] : rows) {
        for (Record p : positions) {
          if (p.entity == row.entity) continue;
          p.count = row.sentDown;
          client->queueUnreliable(&p, sizeof p, p.entity, 1);
        }
        flushCounted(*client, row.sentDown);
      }
      if (tick >= nextSecond) {
        const double t = std::chrono::duration<double>(tick - start).count();
        for (auto& [client, row] : rows) {
          row.rate = static_cast<double>(row.messages);
          row.messages = 0;
          row.up.endSecond();
          const N_ClientStats now = client->getStatistics();
          row.rates = ratesBetween(row.stats, now, std::chrono::duration<double>(tick - row.statsAt).count());
          row.stats = now;
          row.statsAt = tick;
          if (json != nullptr) writeJson(json, t, row);
        }
        if (json != nullptr) std::fflush(json);
        const N_RuntimeStats now = N_Initializer::getStatistics();
        const double seconds = std::chrono::duration<double>(tick - runtimeAt).count();
        runtime.passes = static_cast<double>(now.uNetworkPasses - runtime.stats.uNetworkPasses) / seconds;
        runtime.events = static_cast<double>(now.uEventsServed - runtime.stats.uEventsServed) / seconds;
        runtime.stats = now;
        runtimeAt = tick;
        nextSecond += std::chrono::seconds(1);
      }
      if (tick >= nextDraw) {
        drawTable(server, rows, runtime, options, lines);
        nextDraw = tick + std::chrono::milliseconds(250);
      }
      std::this_thread::sleep_until(tick + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(kTick)));
    }
    if (json != nullptr) std::fclose(json);
    std::printf("Server stopping with %zu clients\n", rows.size());
  } catch (Q_Exception* e) {
    std::printf("server failed: %s\n", e->getErrorMessage());
    return 1;
  }
  return 0;
}

int runClient(const Options& options) {
  if (!options.host.empty()) platform::setLocalHost(options.host.c_str());
  std::string serverName = options.args.empty() ? "127.0.0.1" : options.args[0];
  try {
    N_Initializer network;
    applySimulation(options);
    N_Address server(serverName.c_str());
    if (!server.wait(5.0f) && server.getIdentifier() == 0) {
      std::printf("client: cannot resolve %s\n", serverName.c_str());
      return 1;
    }
    const char* me = const_cast<const char*>(N_Address::getLocalAddress()->getStringNumber());
    N_Client client;
    auto start = Clock::now();
    bool connected = false;
    unsigned seen = 0;
    unsigned sentUp = 0;
    Achieved down;
    std::FILE* csv = options.csv.empty() ? nullptr : std::fopen(options.csv.c_str(), "w");
    if (csv != nullptr) std::fprintf(csv, "seconds,latency_ms\n");
    auto nextStatus = start;
    auto nextAttempt = start;
    double phase = (me[std::strlen(me) - 1] - '0') * 0.7;
    while (!stopRequested()) {
      auto tick = Clock::now();
      double t = std::chrono::duration<double>(tick - start).count();
      if (options.seconds > 0 && t > options.seconds) break;
      if (!connected && tick >= nextAttempt && !client.isConnected()) {
        // The server may not be up yet: try again each second until it answers.
        client.construct(&server, options.port);
        nextAttempt = tick + std::chrono::seconds(1);
      }
      client.update();
      if (!client.isConnected()) {
        if (connected) {
          std::printf("client %s: connection lost\n", me);
          return 1;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        continue;
      }
      if (!connected) {
        connected = true;
        std::printf("client %s: connected, latency %.1f ms, world time %.3f s\n", me, client.getLatency() * 1000.0,
                    client.getWorldTimer().getAge());
      }
      float world = client.getWorldTimer().getAge();
      Record position{Record::POSITION, 0, static_cast<float>(50 * std::cos(t + phase)),
                      static_cast<float>(50 * std::sin(1.3 * t + phase)), world, sentUp};
      client.queueUnreliable(&position, sizeof position, 1, 1);
      if (tick >= nextStatus) {
        down.endSecond();
        Record status{Record::STATUS, 0, static_cast<float>(down.latencyMs), static_cast<float>(down.loss()), world,
                      seen};
        client.queueReliable(&status, sizeof status, 0, 5);
        nextStatus = tick + std::chrono::seconds(1);
      }
      client.flushReliable();
      flushCounted(client, sentUp);
      void* data;
      unsigned size;
      while (client.poll(data, size)) {
        const float now = client.getWorldTimer().getAge();
        bool first = true;
        forEachRecord(data, size, [&](const Record& r) {
          ++seen;
          if (r.type != Record::POSITION) return;
          const double latency = (now - r.worldTime) * 1000.0;
          down.read(r.count, latency);
          // One line per message: its records were queued together.
          if (csv != nullptr && first)
            std::fprintf(csv, "%.4f,%.3f\n", std::chrono::duration<double>(Clock::now() - start).count(), latency);
          first = false;
        });
      }
      std::this_thread::sleep_until(tick + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(kTick)));
    }
    if (csv != nullptr) std::fclose(csv);
  } catch (Q_Exception* e) {
    std::printf("client failed: %s\n", e->getErrorMessage());
    return 1;
  }
  return 0;
}

int runWorld(const Options& options) {
  // The bad network goes where the user means it: by default into the
  // clients' reads only, so that the server stays a healthy one.
  const bool clientsSimulate = options.simulateOn != "server";
  const bool serverSimulates = options.simulateOn != "clients";
  std::vector<std::string> common = {"--port", std::to_string(options.port)};
  if (clientsSimulate && options.loss > 0) common.insert(common.end(), {"--loss", std::to_string(options.loss)});
  if (clientsSimulate && (options.delayMin || options.delayMax))
    common.insert(common.end(), {"--delay", std::to_string(options.delayMin) + ":" + std::to_string(options.delayMax)});
  if (clientsSimulate && !options.model.empty()) common.insert(common.end(), {"--model", options.model});
  std::vector<int> children;
  for (int i = 0; i < options.clients; ++i) {
    std::vector<std::string> args = {"client", "127.0.0.1", "--host", "127.0.0." + std::to_string(i + 2),
                                     "--seconds", "0"};
    args.insert(args.end(), common.begin(), common.end());
    if (i == 0 && !options.csv.empty()) args.insert(args.end(), {"--csv", options.csv});
    children.push_back(spawnSelf(args, !options.verbose));
  }
  Options server = options;
  server.host = "127.0.0.1";
  server.simulateHere = serverSimulates;
  int rc = runServer(server);
  for (int pid : children) stopChild(pid);
  return rc;
}

bool parseModel(const std::string& text, N_NetworkModel& model) {
  model = N_NetworkModel{};
  std::size_t at = 0;
  while (at < text.size()) {
    std::size_t end = text.find(',', at);
    if (end == std::string::npos) end = text.size();
    const std::string item = text.substr(at, end - at);
    at = end + 1;
    const std::size_t eq = item.find('=');
    if (eq == std::string::npos) return false;
    const std::string key = item.substr(0, eq);
    const char* value = item.c_str() + eq + 1;
    if (key == "delay") {
      model.fDelay = std::strtof(value, nullptr);
    } else if (key == "jitter") {
      model.fJitter = std::strtof(value, nullptr);
    } else if (key == "loss") {
      model.fLoss = std::strtof(value, nullptr);
    } else if (key == "dup") {
      model.fDuplicate = std::strtof(value, nullptr);
    } else if (key == "reorder") {
      char* colon = nullptr;
      model.fReorder = std::strtof(value, &colon);
      model.fReorderWindow = *colon == ':' ? std::strtof(colon + 1, nullptr) : 0.0f;
    } else if (key == "cap") {
      model.uBandwidth = static_cast<unsigned>(std::strtoul(value, nullptr, 10));
    } else if (key == "queue") {
      model.uQueueLimit = static_cast<unsigned>(std::strtoul(value, nullptr, 10));
    } else if (key == "seed") {
      model.uSeed = static_cast<unsigned>(std::strtoul(value, nullptr, 10));
    } else {
      return false;
    }
  }
  return true;
}

}  // namespace demo
