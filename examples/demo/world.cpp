// The shared world: a server and clients on loopback, each client a process
// of its own with its own address. Clients move an entity, send its position
// unreliably 60 times a second (keyed, so a newer position replaces one that
// hasn't left yet) and a status event reliably once a second. The server
// relays every position to every client and shows a live table per client.
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <map>
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
  float x, y;
  float worldTime;  // the sender's world clock when it queued the record
  unsigned count;   // STATUS: positions the client has seen of other entities
};
static_assert(sizeof(Record) == 24, "records travel as they lie in memory");

constexpr double kTick = 1.0 / 60.0;

void applySimulation(const Options& o) {
  N_Client::simulatePacketLoss(o.loss);
  N_Client::simulateLatency(o.delayMin, o.delayMax);
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

struct ClientRow {
  std::string name;
  unsigned entity = 0;
  unsigned long messages = 0;  // payload messages in the current second
  double rate = 0;             // messages per second, last full second
  double offsetMs = 0;         // client's world clock minus the server's
  bool haveOffset = false;
  unsigned seenByClient = 0;
  float x = 0, y = 0;
};

void drawTable(N_Server& server, std::map<N_Client*, ClientRow>& rows, const Options& o, bool first) {
  if (!first) std::printf("\x1b[%zuA", rows.size() + 5 + (rows.empty() ? 1 : 0));
  std::printf("\x1b[Kvardel shared world  world time %8.2f s  clients %zu  simulated loss %.0f%%  delay %u-%u ms\n",
              server.getWorldTimer().getAge(), rows.size(), o.loss * 100.0, o.delayMin, o.delayMax);
  std::printf("\x1b[K%-12s %6s %9s %10s %10s %10s %9s %9s %14s\n", "client", "entity", "latency", "clock off",
              "bandwidth", "rel wait", "unrel wait", "msgs/s", "position");
  std::printf("\x1b[K%-12s %6s %9s %10s %10s %10s %9s %9s %14s\n", "", "", "ms", "ms", "B/s", "B", "B", "in", "");
  std::printf("\x1b[K\n");
  if (rows.empty()) std::printf("\x1b[K  (waiting for clients)\n");
  for (auto& [client, row] : rows) {
    char offset[16] = "-";
    if (row.haveOffset) std::snprintf(offset, sizeof offset, "%+.1f", row.offsetMs);
    std::printf("\x1b[K%-12s %6u %9.1f %10s %10u %10u %9u %9.0f %6.1f,%6.1f\n", row.name.c_str(), row.entity,
                client->getLatency() * 1000.0, offset, client->getBandwidth(), client->getReliableBytesWaiting(),
                client->getUnreliableBytesWaiting(), row.rate, row.x, row.y);
  }
  std::printf("\x1b[K\n");
  std::fflush(stdout);
}

}  // namespace

int runServer(const Options& options) {
  if (!options.host.empty()) platform::setLocalHost(options.host.c_str());
  try {
    N_Initializer network;
    applySimulation(options);
    N_Server server(options.port);
    std::map<N_Client*, ClientRow> rows;
    unsigned nextEntity = 1;
    auto start = Clock::now();
    auto nextDraw = start;
    auto nextSecond = start + std::chrono::seconds(1);
    bool first = true;
    while (!stopRequested()) {
      auto tick = Clock::now();
      if (options.seconds > 0 && tick - start > std::chrono::duration<double>(options.seconds)) break;
      server.update();
      N_Client* joined;
      while (server.pollConnect(joined)) {
        ClientRow row;
        row.name = const_cast<const char*>(joined->getAddress()->getStringNumber());
        row.entity = nextEntity++;
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
            } else if (r.type == Record::STATUS) {
              // The record left the client about half a round trip ago.
              row.offsetMs = (r.worldTime + client->getLatency() / 2.0 - server.getWorldTimer().getAge()) * 1000.0;
              row.haveOffset = client->getLatency() > 0;
              row.seenByClient = r.count;
            }
          });
        }
        positions.push_back(Record{Record::POSITION, row.entity, row.x, row.y, server.getWorldTimer().getAge(), 0});
        ++it;
      }
      // Relay every entity's position to every client; the key keeps one
      // position per entity waiting.
      for (auto& [client, row] : rows) {
        for (const Record& p : positions) {
          if (p.entity == row.entity) continue;
          client->queueUnreliable(const_cast<Record*>(&p), sizeof p, p.entity, 1);
        }
        client->flushUnreliable();
      }
      if (tick >= nextSecond) {
        for (auto& [client, row] : rows) {
          row.rate = static_cast<double>(row.messages);
          row.messages = 0;
        }
        nextSecond += std::chrono::seconds(1);
      }
      if (tick >= nextDraw) {
        drawTable(server, rows, options, first);
        first = false;
        nextDraw = tick + std::chrono::milliseconds(250);
      }
      std::this_thread::sleep_until(tick + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(kTick)));
    }
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
                      static_cast<float>(50 * std::sin(1.3 * t + phase)), world, 0};
      client.queueUnreliable(&position, sizeof position, 1, 1);
      if (tick >= nextStatus) {
        Record status{Record::STATUS, 0, 0, 0, world, seen};
        client.queueReliable(&status, sizeof status, 0, 5);
        nextStatus = tick + std::chrono::seconds(1);
      }
      client.flushReliable();
      client.flushUnreliable();
      void* data;
      unsigned size;
      while (client.poll(data, size)) forEachRecord(data, size, [&](const Record&) { ++seen; });
      std::this_thread::sleep_until(tick + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(kTick)));
    }
  } catch (Q_Exception* e) {
    std::printf("client failed: %s\n", e->getErrorMessage());
    return 1;
  }
  return 0;
}

int runWorld(const Options& options) {
  std::vector<std::string> common = {"--port", std::to_string(options.port)};
  if (options.loss > 0) common.insert(common.end(), {"--loss", std::to_string(options.loss)});
  if (options.delayMin || options.delayMax)
    common.insert(common.end(), {"--delay", std::to_string(options.delayMin) + ":" + std::to_string(options.delayMax)});
  std::vector<int> children;
  for (int i = 0; i < options.clients; ++i) {
    std::vector<std::string> args = {"client", "127.0.0.1", "--host", "127.0.0." + std::to_string(i + 2),
                                     "--seconds", "0"};
    args.insert(args.end(), common.begin(), common.end());
    children.push_back(spawnSelf(args, !options.verbose));
  }
  Options server = options;
  server.host = "127.0.0.1";
  int rc = runServer(server);
  for (int pid : children) stopChild(pid);
  return rc;
}

}  // namespace demo
