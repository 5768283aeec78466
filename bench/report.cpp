#include "report.h"

#include <sys/utsname.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <thread>

namespace bench {
namespace {

std::string cpuModel() {
  std::ifstream in("/proc/cpuinfo");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind("model name", 0) == 0) {
      std::size_t value = line.find_first_not_of(" \t", line.find(':') + 1);
      if (line.find(':') != std::string::npos && value != std::string::npos) return line.substr(value);
    }
  }
  return "unknown";
}

std::string kernel() {
  utsname u{};
  if (uname(&u) != 0) return "unknown";
  return std::string(u.sysname) + " " + u.release + " " + u.machine;
}

std::string utcNow() {
  std::time_t now = std::time(nullptr);
  std::tm tm{};
  gmtime_r(&now, &tm);
  char text[32];
  std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &tm);
  return text;
}

std::string quoted(const std::string& s) {
  std::string out = "\"";
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    if (static_cast<unsigned char>(c) < 0x20) continue;
    out += c;
  }
  return out + "\"";
}

// JSON has no NaN or infinity: a figure that could not be had is null.
std::string number(double v) {
  if (!std::isfinite(v)) return "null";
  char text[32];
  std::snprintf(text, sizeof text, "%.6g", v);
  return text;
}

std::string figure(const Measure& m, double v) {
  char text[32];
  if (!(v > 0)) return "-";
  if (m.unit == "msg/s")
    std::snprintf(text, sizeof text, "%.0fk", v / 1000.0);
  else if (m.unit == "MB/s" && v < 100)
    std::snprintf(text, sizeof text, "%.1f", v);
  else if (m.unit == "MB/s")
    std::snprintf(text, sizeof text, "%.0f", v);
  else
    std::snprintf(text, sizeof text, "%.1f", v);
  return text;
}

}  // namespace

double loadAverage() {
  std::ifstream in("/proc/loadavg");
  double oneMinute = -1;
  if (!(in >> oneMinute)) return -1;
  return oneMinute;
}

double Measure::median(std::size_t transport) const {
  std::vector<double> v = rounds[transport];
  if (v.empty()) return NAN;
  std::sort(v.begin(), v.end());
  std::size_t n = v.size();
  return n % 2 == 1 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2.0;
}

double Report::ratio(const Measure& m, std::size_t peer) const {
  double lib = m.median(library);
  double other = m.median(peer);
  if (!(lib > 0) || !(other > 0)) return NAN;
  return m.higherIsBetter ? lib / other : other / lib;
}

void printTable(const Report& report) {
  std::printf("\nTransports on loopback, medians of %d interleaved rounds (round trip: %d), every message checked\n",
              report.rounds, report.latencyRounds);
  std::printf("%-22s %-6s", "measure", "unit");
  for (const std::string& t : report.transports) std::printf(" %10s", t.c_str());
  std::printf(" |");
  for (std::size_t p = 0; p < report.transports.size(); ++p)
    if (p != report.library) std::printf(" %10s", ("vs " + report.transports[p]).c_str());
  std::printf("\n");
  bool anyFailed = false;
  for (const Measure& m : report.measures) {
    std::printf("%-22s %-6s", m.name.c_str(), m.unit.c_str());
    for (std::size_t t = 0; t < report.transports.size(); ++t) {
      std::string text = figure(m, m.median(t));
      if (!m.verified[t]) {
        text += "!";
        anyFailed = true;
      }
      std::printf(" %10s", text.c_str());
    }
    std::printf(" |");
    for (std::size_t p = 0; p < report.transports.size(); ++p) {
      if (p == report.library) continue;
      double r = report.ratio(m, p);
      char text[32];
      if (std::isfinite(r))
        std::snprintf(text, sizeof text, "%.2fx", r);
      else
        std::snprintf(text, sizeof text, "-");
      std::printf(" %10s", text);
    }
    std::printf("\n");
  }
  std::printf("ratio: how many times faster %s is than the other (throughput %s/other, round trip other/%s)\n",
              report.transports[report.library].c_str(), report.transports[report.library].c_str(),
              report.transports[report.library].c_str());
  if (!report.versions.empty()) {
    std::printf("peers:");
    for (std::size_t i = 0; i < report.versions.size(); ++i)
      std::printf("%s %s", i ? ";" : "", report.versions[i].c_str());
    std::printf("\n");
  }
  unsigned cores = std::thread::hardware_concurrency();
  if (report.loadBefore >= 0) {
    std::printf("load average: %.2f before, %.2f after, on %u cores", report.loadBefore, report.loadAfter, cores);
    if (std::max(report.loadBefore, report.loadAfter) > cores)
      std::printf(" -- other work shared the cores, the figures are noisier than usual");
    std::printf("\n");
  }
  if (anyFailed) std::printf("! VERIFY FAILED: a round lost, reordered or corrupted a message\n");
}

bool writeJson(const Report& report, const ClientServerFigures& cs, const std::string& path) {
  std::FILE* f = std::fopen(path.c_str(), "w");
  if (f == nullptr) return false;
  const std::string& lib = report.transports[report.library];
  std::fprintf(f, "{\n  \"date\": %s,\n", quoted(utcNow()).c_str());
  std::fprintf(f, "  \"machine\": {\"cpu\": %s, \"cores\": %u, \"system\": %s,\n", quoted(cpuModel()).c_str(),
               std::thread::hardware_concurrency(), quoted(kernel()).c_str());
  std::fprintf(f, "              \"load_average_before\": %s, \"load_average_after\": %s},\n",
               report.loadBefore >= 0 ? number(report.loadBefore).c_str() : "null",
               report.loadAfter >= 0 ? number(report.loadAfter).c_str() : "null");
  std::fprintf(f, "  \"rounds\": %d,\n  \"latency_rounds\": %d,\n  \"quick\": %s,\n", report.rounds,
               report.latencyRounds, report.quick ? "true" : "false");
  std::fprintf(f, "  \"library\": %s,\n  \"transports\": [", quoted(lib).c_str());
  for (std::size_t t = 0; t < report.transports.size(); ++t)
    std::fprintf(f, "%s%s", t ? ", " : "", quoted(report.transports[t]).c_str());
  std::fprintf(f, "],\n  \"versions\": [");
  for (std::size_t v = 0; v < report.versions.size(); ++v)
    std::fprintf(f, "%s%s", v ? ", " : "", quoted(report.versions[v]).c_str());
  std::fprintf(f, "],\n  \"ratio\": %s,\n", quoted("how many times faster " + lib + " is than the other").c_str());
  std::fprintf(f, "  \"measures\": [\n");
  for (std::size_t i = 0; i < report.measures.size(); ++i) {
    const Measure& m = report.measures[i];
    std::fprintf(f, "    {\"name\": %s, \"unit\": %s, \"higher_is_better\": %s, \"count\": %zu,\n",
                 quoted(m.name).c_str(), quoted(m.unit).c_str(), m.higherIsBetter ? "true" : "false", m.count);
    std::fprintf(f, "     \"median\": {");
    for (std::size_t t = 0; t < report.transports.size(); ++t)
      std::fprintf(f, "%s%s: %s", t ? ", " : "", quoted(report.transports[t]).c_str(), number(m.median(t)).c_str());
    std::fprintf(f, "},\n     \"ratio\": {");
    bool first = true;
    for (std::size_t t = 0; t < report.transports.size(); ++t) {
      if (t == report.library) continue;
      std::fprintf(f, "%s%s: %s", first ? "" : ", ", quoted(report.transports[t]).c_str(),
                   number(report.ratio(m, t)).c_str());
      first = false;
    }
    std::fprintf(f, "},\n     \"verified\": {");
    for (std::size_t t = 0; t < report.transports.size(); ++t)
      std::fprintf(f, "%s%s: %s", t ? ", " : "", quoted(report.transports[t]).c_str(),
                   m.verified[t] ? "true" : "false");
    std::fprintf(f, "},\n     \"rounds\": {");
    for (std::size_t t = 0; t < report.transports.size(); ++t) {
      std::fprintf(f, "%s%s: [", t ? ", " : "", quoted(report.transports[t]).c_str());
      for (std::size_t r = 0; r < m.rounds[t].size(); ++r)
        std::fprintf(f, "%s%s", r ? ", " : "", number(m.rounds[t][r]).c_str());
      std::fprintf(f, "]");
    }
    std::fprintf(f, "}}%s\n", i + 1 < report.measures.size() ? "," : "");
  }
  std::fprintf(f, "  ],\n");
  std::fprintf(f,
               "  \"client_server\": {\"payload_round_trip_us\": {\"median\": %s, \"p99\": %s, \"rounds\": %d},\n"
               "                    \"server\": {\"clients\": %zu, \"seconds\": %s, \"cpu_percent_of_one_core\": %s, "
               "\"delivered_percent\": %s}}\n}\n",
               number(cs.payload.medianMicros).c_str(), number(cs.payload.p99Micros).c_str(), cs.payloadRounds,
               cs.clients, number(cs.seconds).c_str(), number(cs.serverCpuPercent).c_str(),
               number(cs.deliveredPercent).c_str());
  return std::fclose(f) == 0;
}

bool writeScalingJson(const ScaleOptions& options, const std::vector<ScaleFigures>& sizes,
                      const std::vector<WaitCost>& waits, const std::string& path) {
  std::FILE* f = std::fopen(path.c_str(), "w");
  if (f == nullptr) return false;
  std::fprintf(f, "{\n  \"date\": %s,\n", quoted(utcNow()).c_str());
  std::fprintf(f, "  \"machine\": {\"cpu\": %s, \"cores\": %u, \"system\": %s},\n", quoted(cpuModel()).c_str(),
               std::thread::hardware_concurrency(), quoted(kernel()).c_str());
  std::fprintf(f, "  \"wait_events\": %u,\n  \"seconds_per_size\": %s,\n", options.waitEvents,
               number(options.seconds).c_str());
  std::fprintf(f, "  \"sizes\": [\n");
  for (std::size_t i = 0; i < sizes.size(); ++i) {
    const ScaleFigures& s = sizes[i];
    std::fprintf(f,
                 "    {\"clients\": %d, \"connected\": %d, \"reported\": %d, \"reliable_sent\": %lu, "
                 "\"reliable_delivered\": %lu, \"reliable_out_of_order\": %lu, \"unreliable_sent\": %lu, "
                 "\"unreliable_delivered\": %lu, \"seconds\": %s, \"server_cpu_percent_of_one_core\": %s, "
                 "\"load_average_before\": %s, \"load_average_after\": %s}%s\n",
                 s.clients, s.connected, s.reported, s.reliableSent, s.reliableDelivered, s.reliableDisorder,
                 s.unreliableSent, s.unreliableDelivered, number(s.seconds).c_str(), number(s.serverCpuPercent).c_str(),
                 number(s.loadBefore).c_str(), number(s.loadAfter).c_str(), i + 1 < sizes.size() ? "," : "");
  }
  std::fprintf(f, "  ],\n  \"wait_cost\": [");
  for (std::size_t i = 0; i < waits.size(); ++i)
    std::fprintf(f, "%s{\"handles\": %u, \"us_per_event\": %s}", i ? ", " : "", waits[i].handles,
                 number(waits[i].microsPerRound).c_str());
  std::fprintf(f, "]\n}\n");
  return std::fclose(f) == 0;
}

}  // namespace bench
