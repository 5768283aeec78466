// vardel demo.
//
//   vardel_demo                       shared world: a server and 4 client processes on loopback
//   vardel_demo world   [--clients N] [--seconds S] [--loss F] [--delay MIN:MAX]
//                       [--model K=V,...] [--simulate-on clients|server|both] [--csv FILE] [--json FILE]
//   vardel_demo server  [--port P] [--seconds S]        run the server by hand
//   vardel_demo client  SERVER [--host ADDR] [--port P] run one client by hand
//   vardel_demo transport [listen | connect HOST]       two processes, messages over TCP and UDP
//   vardel_demo resolve [NAME] [NUMBER]                 runtime up, local host, address resolution
//
// --host ADDR makes this process the host ADDR (for example 127.0.0.2), so
// that several processes on one machine are hosts of their own.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "N_Initializer.h"
#include "demo.h"

namespace {

void usage() {
  std::printf(
      "usage: vardel_demo [world|server|client SERVER|transport [listen|connect HOST]|resolve [NAME] [NUMBER]]\n"
      "       options: --host ADDR --port P --clients N --seconds S (0: forever) --loss F --delay MIN:MAX -v\n"
      "       --model delay=MS,jitter=MS,loss=F,dup=F,reorder=F:MS,cap=BYTES/S,queue=BYTES,seed=N\n"
      "               the network model: a delay per message, no limit on the rate (see the README)\n"
      "       --simulate-on clients|server|both  where the world applies --loss, --delay and --model\n"
      "               (default clients: the server stays a healthy one)\n"
      "       --csv FILE  client: every position read as \"seconds,latency_ms\"; world: of the first client\n"
      "       --json FILE  world and server: one JSON object per client and second, from the connection's\n"
      "               statistics (scripts/plot_stats.py draws them)\n");
}

}  // namespace

int main(int argc, char** argv) {
  demo::Options options;
  int i = 1;
  if (i < argc && argv[i][0] != '-') options.mode = argv[i++];
  for (; i < argc; ++i) {
    std::string a = argv[i];
    auto value = [&]() -> const char* {
      if (i + 1 >= argc) {
        usage();
        std::exit(2);
      }
      return argv[++i];
    };
    if (a == "--host") {
      options.host = value();
    } else if (a == "--port") {
      options.port = std::atoi(value());
    } else if (a == "--clients") {
      options.clients = std::atoi(value());
    } else if (a == "--seconds") {
      options.seconds = std::atof(value());
    } else if (a == "--loss") {
      options.loss = static_cast<float>(std::atof(value()));
    } else if (a == "--delay") {
      const char* v = value();
      options.delayMin = static_cast<unsigned>(std::strtoul(v, nullptr, 10));
      const char* colon = std::strchr(v, ':');
      options.delayMax = colon ? static_cast<unsigned>(std::strtoul(colon + 1, nullptr, 10)) : options.delayMin;
    } else if (a == "--model") {
      options.model = value();
      if (!demo::parseModel(options.model, options.network)) {
        std::fprintf(stderr, "vardel_demo: bad --model %s\n", options.model.c_str());
        return 2;
      }
    } else if (a == "--simulate-on") {
      options.simulateOn = value();
      if (options.simulateOn != "clients" && options.simulateOn != "server" && options.simulateOn != "both") {
        usage();
        return 2;
      }
    } else if (a == "--csv") {
      options.csv = value();
    } else if (a == "--json") {
      options.json = value();
    } else if (a == "-v") {
      options.verbose = true;
    } else if (a == "-h" || a == "--help") {
      usage();
      return 0;
    } else if (!a.empty() && a[0] != '-') {
      options.args.push_back(a);
    } else {
      usage();
      return 2;
    }
  }
  demo::installStopHandler();
  // Every process of the demo faces its peers as a server on the open
  // network would: bounded queues, time limits for unpaired connections,
  // bounded control work (see "Running a server on an open network").
  N_Initializer::setLimits(N_Limits::openNetwork());
  if (options.mode == "resolve") return demo::runResolve(options);
  if (options.mode == "transport") return demo::runTransport(options);
  if (options.mode == "world") return demo::runWorld(options);
  if (options.mode == "server") return demo::runServer(options);
  if (options.mode == "client") return demo::runClient(options);
  usage();
  return 2;
}
