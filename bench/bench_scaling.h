// A server with more clients than the default wait set holds: 20, 50, 100
// and 200 client processes, each on a loopback address of its own.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

struct ScaleFigures {
  int clients = 0;    // processes started
  int connected = 0;  // handed out by pollConnect
  int reported = 0;   // told the server what they sent
  unsigned long reliableSent = 0, reliableDelivered = 0, reliableDisorder = 0;
  unsigned long unreliableSent = 0, unreliableDelivered = 0;
  double seconds = 0;           // the measured window, all clients connected
  double serverCpuPercent = 0;  // of one core, this process (server) only
  double loadBefore = -1, loadAfter = -1;
};

struct ScaleOptions {
  std::vector<int> sizes{20, 50, 100, 200};
  double seconds = 20;  // of the measured window per size
  unsigned waitEvents = 1024;
};

// Runs every size in turn (the runtime must not run yet: the wait set's size
// is set here), printing a line per size as it goes.
std::vector<ScaleFigures> benchScaling(const ScaleOptions& options);

// The body of one client process: connects to 127.0.0.1:port from `host`,
// sends a 64-byte unreliable payload 20 times a second and a reliable event
// once a second until the server says stop, then reports what it sent.
int scaleClient(const char* host, int port);
