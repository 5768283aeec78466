// Other transports measured beside the library, each built in only when its
// development package is found (VARDEL_BENCH_ENET, VARDEL_BENCH_ZMQ). Same
// messages and checks as the plain TCP baseline; only the bench links them.
#pragma once

#include <cstddef>
#include <string>

#include "plain_tcp.h"

namespace bench {

#ifdef VARDEL_BENCH_ENET
// Reliable channel 0 between two hosts on 127.0.0.1, each serviced by its own
// thread with enet_host_service(host, &event, 1).
Throughput enetThroughput(std::size_t size, std::size_t count);
Latency enetRoundTrip(std::size_t size, int rounds);
std::string enetVersion();
#endif

#ifdef VARDEL_BENCH_ZMQ
// PUSH/PULL for throughput, REQ/REP for the round trip, over tcp://127.0.0.1
// in one context (one I/O thread for both ends, as the library has one
// network thread for both ends here).
Throughput zmqThroughput(std::size_t size, std::size_t count);
Latency zmqRoundTrip(std::size_t size, int rounds);
std::string zmqVersion();
#endif

}  // namespace bench
