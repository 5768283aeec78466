// The demo program: the library's public interface at work.
#pragma once

#include <string>
#include <vector>

#include "N_NetworkModel.h"

namespace demo {

struct Options {
  std::string mode = "world";        // world | server | client | transport | resolve
  std::vector<std::string> args;     // positional arguments after the mode
  std::string host;                  // this process's own host (loopback address)
  int port = 3123;
  int clients = 4;
  double seconds = 20.0;             // 0: run until interrupted
  float loss = 0.0f;                 // simulated loss of unreliable messages
  unsigned delayMin = 0, delayMax = 0;  // simulated read delay, milliseconds
  std::string model;                 // the network model as given to --model ("" off)
  N_NetworkModel network;            // ... and parsed
  std::string simulateOn = "clients";  // world: clients | server | both
  bool simulateHere = true;          // this process applies the settings above
  std::string csv;                   // client: latency of every message read, to this file
  std::string json;                  // server and world: statistics per client and second, to this file
  bool verbose = false;
};

// "delay=40,jitter=20,loss=0.05,dup=0.01,reorder=0.05:30,cap=20000,queue=65536,seed=7";
// false on an unknown key.
bool parseModel(const std::string& text, N_NetworkModel& model);

int runResolve(const Options& options);
int runTransport(const Options& options);
int runWorld(const Options& options);
int runServer(const Options& options);
int runClient(const Options& options);

// Process helpers (Linux): start this program again with other arguments.
int spawnSelf(const std::vector<std::string>& args, bool quiet);
// Waits up to graceMs for the child to end by itself, then stops it.
void stopChild(int pid, int graceMs = 0);
bool stopRequested();
void installStopHandler();

}  // namespace demo
