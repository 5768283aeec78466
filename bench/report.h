// The comparison of one run: per measure and transport the figure of every
// round, printed as one table of medians and ratios, or written as JSON.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "bench_client_server.h"
#include "bench_scaling.h"
#include "bench_wait.h"

namespace bench {

struct Measure {
  std::string name;  // "64 B messages"
  std::string unit;  // "msg/s", "MB/s" or "us"
  bool higherIsBetter = true;
  std::size_t count = 0;                     // messages or round trips in one round
  std::vector<std::vector<double>> rounds;   // [transport][round]
  std::vector<bool> verified;                // [transport]: every round complete and checked
  double median(std::size_t transport) const;
};

struct Report {
  std::vector<std::string> transports;
  std::size_t library = 0;  // the index of the library among them
  std::vector<std::string> versions;  // "ENet 1.3.17", ...
  int rounds = 0;         // of each throughput figure
  int latencyRounds = 0;  // of the round trip
  bool quick = false;
  // The system's 1-minute load average when the measuring began and ended:
  // above the core count, other work shared the cores and the figures show it.
  double loadBefore = -1;
  double loadAfter = -1;
  std::vector<Measure> measures;

  // How many times faster the library is than `peer`; below 1 it is slower.
  double ratio(const Measure& m, std::size_t peer) const;
};

double loadAverage();  // -1 where the system does not say
void printTable(const Report& report);
bool writeJson(const Report& report, const ClientServerFigures& clientServer, const std::string& path);
// The figures of a --scaling run, which bench/plot_scaling.py draws.
bool writeScalingJson(const ScaleOptions& options, const std::vector<ScaleFigures>& sizes,
                      const std::vector<WaitCost>& waits, const std::string& path);

}  // namespace bench
