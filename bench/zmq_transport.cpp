// ZeroMQ on loopback TCP: PUSH/PULL one way, REQ/REP for the round trip.
#include <zmq.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "peer_transports.h"

namespace bench {
namespace {

using Clock = std::chrono::steady_clock;

// One context (its default single I/O thread) and a bound and a connected
// socket; a failed receive gives up after a minute instead of hanging.
struct Pair {
  void* context = zmq_ctx_new();
  void* bound = nullptr;
  void* connected = nullptr;

  bool open(int boundType, int connectedType, std::size_t messageSize) {
    bound = zmq_socket(context, boundType);
    connected = zmq_socket(context, connectedType);
    int linger = 0;
    int timeoutMs = 60000;
    // Queues of 8 MiB, the backlog the library's sender is allowed, counted in
    // messages as ZeroMQ counts them; never below its default of 1000. Its
    // default alone slowed 64-byte messages by about a quarter here.
    int highWater = static_cast<int>(std::max<std::size_t>(1000, (8u << 20) / std::max<std::size_t>(messageSize, 1)));
    for (void* s : {bound, connected}) {
      zmq_setsockopt(s, ZMQ_LINGER, &linger, sizeof linger);
      zmq_setsockopt(s, ZMQ_RCVTIMEO, &timeoutMs, sizeof timeoutMs);
      zmq_setsockopt(s, ZMQ_SNDTIMEO, &timeoutMs, sizeof timeoutMs);
      zmq_setsockopt(s, ZMQ_SNDHWM, &highWater, sizeof highWater);
      zmq_setsockopt(s, ZMQ_RCVHWM, &highWater, sizeof highWater);
    }
    if (zmq_bind(bound, "tcp://127.0.0.1:*") != 0) return false;
    char endpoint[256];
    std::size_t length = sizeof endpoint;
    zmq_getsockopt(bound, ZMQ_LAST_ENDPOINT, endpoint, &length);
    return zmq_connect(connected, endpoint) == 0;
  }

  ~Pair() {
    if (connected != nullptr) zmq_close(connected);
    if (bound != nullptr) zmq_close(bound);
    zmq_ctx_term(context);
  }
};

// Receives one message and checks its size and content.
bool receiveChecked(void* socket, std::size_t size, std::uint64_t index) {
  zmq_msg_t message;
  zmq_msg_init(&message);
  bool ok = zmq_msg_recv(&message, socket, 0) >= 0 && zmq_msg_size(&message) == size &&
            checkMessage(static_cast<const std::uint8_t*>(zmq_msg_data(&message)), size, index);
  zmq_msg_close(&message);
  return ok;
}

}  // namespace

Throughput zmqThroughput(std::size_t size, std::size_t count) {
  Throughput t;
  Pair pair;
  if (!pair.open(ZMQ_PULL, ZMQ_PUSH, size)) return t;
  // Connecting is not part of the figure: one empty message goes through first.
  if (zmq_send(pair.connected, "", 0, 0) != 0 || !receiveChecked(pair.bound, 0, 0)) return t;
  bool ok = true;
  std::thread reader([&] {
    // On past a bad message, so that the sender is not left waiting on a full
    // queue; a receive that times out ends it.
    for (std::size_t i = 0; i < count; ++i) {
      zmq_msg_t message;
      zmq_msg_init(&message);
      bool got = zmq_msg_recv(&message, pair.bound, 0) >= 0;
      if (!got || zmq_msg_size(&message) != size ||
          !checkMessage(static_cast<const std::uint8_t*>(zmq_msg_data(&message)), size, i))
        ok = false;
      zmq_msg_close(&message);
      if (!got) break;
    }
  });
  auto start = Clock::now();
  std::vector<std::uint8_t> message;
  for (std::size_t i = 0; i < count; ++i) {
    fillMessage(message, size, i);
    if (zmq_send(pair.connected, message.data(), size, 0) != static_cast<int>(size)) break;
  }
  reader.join();
  double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  t.verified = ok;
  setRates(t, count, size, seconds);
  return t;
}

Latency zmqRoundTrip(std::size_t size, int rounds) {
  Pair pair;
  if (!pair.open(ZMQ_REP, ZMQ_REQ, size)) return {};
  std::thread echo([&] {
    std::vector<std::uint8_t> buffer(size + 1);
    for (int i = 0; i <= rounds; ++i) {  // the warm-up round and `rounds` more
      int n = zmq_recv(pair.bound, buffer.data(), buffer.size(), 0);
      if (n < 0 || zmq_send(pair.bound, buffer.data(), static_cast<std::size_t>(n), 0) != n) return;
    }
  });
  std::vector<double> micros;
  if (zmq_send(pair.connected, "", 0, 0) == 0 && receiveChecked(pair.connected, 0, 0)) {
    std::vector<std::uint8_t> message;
    for (int i = 0; i < rounds; ++i) {
      fillMessage(message, size, static_cast<std::uint64_t>(i));
      auto start = Clock::now();
      bool ok = zmq_send(pair.connected, message.data(), size, 0) == static_cast<int>(size) &&
                receiveChecked(pair.connected, size, static_cast<std::uint64_t>(i));
      if (!ok) {
        std::fprintf(stderr, "ZeroMQ round trip: reply %d missing or corrupt\n", i);
        break;
      }
      micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    }
  }
  // A failed run leaves the echo waiting: closing the context wakes it.
  if (static_cast<int>(micros.size()) < rounds) zmq_ctx_shutdown(pair.context);
  echo.join();
  return summarize(micros);
}

std::string zmqVersion() {
  int major, minor, patch;
  zmq_version(&major, &minor, &patch);
  return std::to_string(major) + "." + std::to_string(minor) + "." + std::to_string(patch);
}

}  // namespace bench
