// ENet on loopback: reliable packets on channel 0, one thread per host.
#include <enet/enet.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <mutex>
#include <thread>
#include <vector>

#include "peer_transports.h"

namespace bench {
namespace {

using Clock = std::chrono::steady_clock;

// Bytes the sender may have queued and not yet seen acknowledged: the fastest
// bound for ENet here (64 KiB starves its window, 4 or 8 MiB gain nothing).
constexpr std::size_t kBacklogBytes = 1u << 20;

void initializeOnce() {
  static std::once_flag once;
  std::call_once(once, [] {
    if (enet_initialize() != 0) std::fprintf(stderr, "enet_initialize failed\n");
    std::atexit(enet_deinitialize);
  });
}

// A server host on an ephemeral port of 127.0.0.1 and a client connected to it.
struct Pair {
  ENetHost* server = nullptr;
  ENetHost* client = nullptr;
  ENetPeer* toServer = nullptr;
  ENetPeer* toClient = nullptr;

  bool open() {
    initializeOnce();
    ENetAddress address{};
    enet_address_set_host_ip(&address, "127.0.0.1");
    address.port = 0;
    server = enet_host_create(&address, 1, 1, 0, 0);
    client = enet_host_create(nullptr, 1, 1, 0, 0);
    if (server == nullptr || client == nullptr) return false;
    ENetAddress to = server->address;
    enet_address_set_host_ip(&to, "127.0.0.1");
    toServer = enet_host_connect(client, &to, 1, 0);
    if (toServer == nullptr) return false;
    bool clientUp = false;
    auto deadline = Clock::now() + std::chrono::seconds(5);
    while ((!clientUp || toClient == nullptr) && Clock::now() < deadline) {
      ENetEvent event;
      while (enet_host_service(client, &event, 1) > 0)
        if (event.type == ENET_EVENT_TYPE_CONNECT) clientUp = true;
      while (enet_host_service(server, &event, 1) > 0)
        if (event.type == ENET_EVENT_TYPE_CONNECT) toClient = event.peer;
    }
    return clientUp && toClient != nullptr;
  }

  ~Pair() {
    if (client != nullptr) enet_host_destroy(client);
    if (server != nullptr) enet_host_destroy(server);
  }
};

void released(ENetPacket* packet) {
  *static_cast<std::size_t*>(packet->userData) -= packet->dataLength;
}

}  // namespace

Throughput enetThroughput(std::size_t size, std::size_t count) {
  Throughput t;
  // Declared before the hosts: packets still unacknowledged at the end are
  // freed with the hosts and count themselves off here.
  std::size_t inFlight = 0;
  Pair pair;
  if (!pair.open()) return t;
  std::atomic<bool> done{false};
  bool ok = true;
  Clock::time_point last;  // the clock stops at the last message, not at the sender's next service
  std::thread reader([&] {
    std::uint64_t next = 0;
    auto deadline = Clock::now() + std::chrono::seconds(60);
    bool connected = true;
    while (next < count && connected && Clock::now() < deadline) {
      ENetEvent event;
      if (enet_host_service(pair.server, &event, 1) <= 0) continue;
      if (event.type == ENET_EVENT_TYPE_RECEIVE) {
        if (event.packet->dataLength != size || !checkMessage(event.packet->data, size, next)) ok = false;
        ++next;
        enet_packet_destroy(event.packet);
      } else if (event.type == ENET_EVENT_TYPE_DISCONNECT) {
        connected = false;
      }
    }
    last = Clock::now();
    ok = ok && next == count;
    done.store(true);
  });
  // inFlight is touched on this thread only: ENet frees acknowledged packets
  // inside enet_host_service on the client.
  std::vector<std::uint8_t> message;
  std::size_t sent = 0;
  auto start = Clock::now();
  while (!done.load()) {
    while (sent < count && inFlight < kBacklogBytes) {
      fillMessage(message, size, sent);
      ENetPacket* packet = enet_packet_create(message.data(), size, ENET_PACKET_FLAG_RELIABLE);
      packet->userData = &inFlight;
      packet->freeCallback = released;
      inFlight += size;
      if (enet_peer_send(pair.toServer, 0, packet) != 0) {
        inFlight -= size;
        packet->freeCallback = nullptr;
        enet_packet_destroy(packet);
        break;
      }
      ++sent;
    }
    ENetEvent event;
    enet_host_service(pair.client, &event, 1);
  }
  reader.join();
  double seconds = std::chrono::duration<double>(last - start).count();
  t.verified = ok;
  setRates(t, count, size, seconds);
  return t;
}

Latency enetRoundTrip(std::size_t size, int rounds) {
  Pair pair;
  if (!pair.open()) return {};
  std::atomic<bool> stop{false};
  std::thread echo([&] {
    while (!stop.load()) {
      ENetEvent event;
      if (enet_host_service(pair.server, &event, 1) <= 0) continue;
      if (event.type != ENET_EVENT_TYPE_RECEIVE) continue;
      ENetPacket* reply = enet_packet_create(event.packet->data, event.packet->dataLength, ENET_PACKET_FLAG_RELIABLE);
      enet_packet_destroy(event.packet);
      enet_peer_send(event.peer, 0, reply);
      enet_host_flush(pair.server);
    }
  });
  std::vector<double> micros;
  std::vector<std::uint8_t> message;
  for (int i = 0; i < rounds; ++i) {
    fillMessage(message, size, static_cast<std::uint64_t>(i));
    auto start = Clock::now();
    enet_peer_send(pair.toServer, 0, enet_packet_create(message.data(), size, ENET_PACKET_FLAG_RELIABLE));
    enet_host_flush(pair.client);
    bool back = false;
    bool corrupt = false;
    while (!back && Clock::now() - start < std::chrono::seconds(5)) {
      ENetEvent event;
      if (enet_host_service(pair.client, &event, 1) <= 0 || event.type != ENET_EVENT_TYPE_RECEIVE) continue;
      back = true;
      corrupt = event.packet->dataLength != size ||
                !checkMessage(event.packet->data, size, static_cast<std::uint64_t>(i));
      enet_packet_destroy(event.packet);
    }
    if (!back || corrupt) {
      std::fprintf(stderr, "ENet round trip: reply %d %s\n", i, back ? "corrupt" : "missing");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  stop.store(true);
  echo.join();
  return summarize(micros);
}

std::string enetVersion() {
  ENetVersion v = enet_linked_version();
  return std::to_string(ENET_VERSION_GET_MAJOR(v)) + "." + std::to_string(ENET_VERSION_GET_MINOR(v)) + "." +
         std::to_string(ENET_VERSION_GET_PATCH(v));
}

}  // namespace bench
