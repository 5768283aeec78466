// Client and server figures: payload round trip and a 20-client server.
#pragma once

#include <cstddef>

#include "plain_tcp.h"

struct ClientServerFigures {
  bench::Latency payload;
  int payloadRounds = 0;
  std::size_t clients = 0;
  double seconds = 0;
  double serverCpuPercent = 0;  // of one core
  double deliveredPercent = 0;
};

// Prints the figures as it measures them, and returns them.
ClientServerFigures benchClientServer(bool quick);

// The body of one client process of the 20-client measurement.
int clientPeer(const char* host, int port, double seconds);
