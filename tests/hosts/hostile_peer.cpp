// A hostile host for hostile_test.cpp: plain Linux sockets, none of the
// library, one attack of kAttacks for a bounded time, from kSpread addresses
// 127.0.0.10 and up as many machines would.
//   vardel_host_hostile_peer PORT ATTACK SECONDS
// Prints "attacking", "paired" once a paired attack's heartbeat is answered,
// "closed-by-server T" if the server cut it off after T s, "count N"
// (connections opened or rounds sent) and "done" (every socket closed).
// Exit code 0; 2 for bad arguments; 3 if it couldn't pair.
#include <arpa/inet.h>
#include <netinet/tcp.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <functional>
#include <map>
#include <thread>
#include <vector>

#include "peer_input.h"

namespace {

using Clock = std::chrono::steady_clock;
using Bytes = std::vector<unsigned char>;

constexpr int kControlPort = 6000;
constexpr int kSpread = 12;

int g_port = 0;
Clock::time_point g_start, g_end;

bool timeUp() { return Clock::now() >= g_end; }
void sleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }
bool writable(int fd, int ms) {
  pollfd p{fd, POLLOUT, 0};
  return ::poll(&p, 1, ms) == 1;
}
void closeFd(int& fd, bool reset = false) {
  linger hard{1, 0};  // a reset leaves no TIME_WAIT behind on our side
  if (fd >= 0 && reset) ::setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
  if (fd >= 0) ::close(fd), fd = -1;
}

// A connection from our index-th address to `port` (0: P for even indices,
// 6000 for odd); -1 unless it is up within `timeoutMs`. A small
// `receiveBuffer` keeps the window the server may fill small.
int openFrom(int index, int port = 0, int timeoutMs = 300, int receiveBuffer = 0) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0), one = 1, error = 0;
  // Ports picked per destination at connect time don't run out; our TIME_WAIT
  // leftovers mustn't keep a later listener from binding their port.
  ::setsockopt(fd, IPPROTO_IP, IP_BIND_ADDRESS_NO_PORT, &one, sizeof one);
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
  if (receiveBuffer > 0) ::setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
  if (port == 0) port = index % 2 == 0 ? g_port : kControlPort;
  sockaddr_in local{AF_INET, 0, {htonl(INADDR_LOOPBACK + 9 + index % kSpread)}, {}};
  sockaddr_in remote{AF_INET, htons(static_cast<std::uint16_t>(port)), {htonl(INADDR_LOOPBACK)}, {}};
  socklen_t length = sizeof error;
  if (fd >= 0 && ::bind(fd, reinterpret_cast<sockaddr*>(&local), sizeof local) == 0 &&
      (::connect(fd, reinterpret_cast<sockaddr*>(&remote), sizeof remote) == 0 || errno == EINPROGRESS) &&
      writable(fd, timeoutMs) && ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) == 0 && error == 0)
    return fd;
  closeFd(fd);
  return -1;
}

// `count` connections from our addresses in turn (to `port` as openFrom),
// held for `ms` (0: to the end) and closed; how many came up.
long hold(int count, int first, int port, int ms, int timeoutMs = 300) {
  std::vector<int> fds;
  for (int i = first; i < first + count && !timeUp(); ++i)
    if (int fd = openFrom(i, port, timeoutMs); fd >= 0) fds.push_back(fd);
  std::this_thread::sleep_until(ms > 0 ? Clock::now() + std::chrono::milliseconds(ms) : g_end);
  for (int& fd : fds) closeFd(fd);
  return static_cast<long>(fds.size());
}

// What the socket takes now, from `data` on; -1 once the connection failed.
long sendSome(int fd, const Bytes& data, std::size_t from = 0) {
  const ssize_t n = ::send(fd, data.data() + from, data.size() - from, MSG_NOSIGNAL);
  return n >= 0 ? n : (errno == EAGAIN || errno == EINTR ? 0 : -1);
}

// All of `data`, waiting for room at most `timeoutMs`; false if it didn't go.
bool sendAll(int fd, const Bytes& data, int timeoutMs = 1000) {
  const auto deadline = Clock::now() + std::chrono::milliseconds(timeoutMs);
  for (long done = 0, n; done < static_cast<long>(data.size()); done += n) {
    if ((n = sendSome(fd, data, done)) < 0 || Clock::now() > deadline) return false;
    if (n == 0) writable(fd, 10);
  }
  return true;
}

// Reads what arrived (into `into`); true once the server closed the connection.
bool closedByServer(int fd, Bytes* into = nullptr) {
  unsigned char buffer[4096];
  for (ssize_t n; (n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT)) != 0;) {
    if (n < 0) return errno != EAGAIN && errno != EINTR;
    if (into != nullptr) into->insert(into->end(), buffer, buffer + n);
  }
  return true;
}

// 32-bit words as on the wire (little-endian, as here), `times` over; then
// `body` bytes of `fill`.
Bytes words(std::initializer_list<std::uint32_t> list, int times = 1, std::size_t body = 0, unsigned char fill = 'x') {
  Bytes out;
  const auto* bytes = reinterpret_cast<const unsigned char*>(list.begin());
  for (int t = 0; t < times; ++t) out.insert(out.end(), bytes, bytes + 4 * list.size());
  out.insert(out.end(), body, fill);
  return out;
}

// Connects and closes as fast as it can, mostly with a reset.
long connectFlood() {
  long count = 0;
  for (int k = 0; !timeUp(); ++k)
    if (int fd = openFrom(k, 0, 100); fd >= 0) ++count, closeFd(fd, k % 4 != 0);
  return count;
}

// Messages cut short: the length prefix claims more than follows, then the
// close; every fourth prefix has its top bit set.
long truncated() {
  const std::uint32_t claims[] = {1000, 70000, 1u << 20, 0x80000010u};
  long count = 0;
  for (int k = 0; !timeUp(); ++k, sleepMs(5)) {
    int fd = openFrom(k);
    const std::uint32_t claim = claims[k % 4];
    count += fd >= 0 && sendAll(fd, words({claim}, 1, claim > 0x80000000u ? 16 : std::min(claim / 2, 256u << 10)));
    closeFd(fd);
  }
  return count;
}

// `n` connections to `port`, each opened again once the server closed it (at
// most ten times a second: flooding connections is another attack); a new one
// first sends `opening`, then at every turn what `next` gives for what it sent.
long slots(int n, int port, int turnMs, const Bytes& opening, const std::function<Bytes(std::size_t)>& next) {
  std::vector<int> fds(n, -1);
  std::vector<std::size_t> sent(n);
  std::vector<Clock::time_point> opened(n);
  long count = 0;
  while (!timeUp()) {
    for (int i = 0; i < n; ++i) {
      if (fds[i] >= 0 && closedByServer(fds[i])) closeFd(fds[i]);
      if (fds[i] < 0 && Clock::now() - opened[i] >= std::chrono::milliseconds(100)) {
        opened[i] = Clock::now(), sent[i] = 0;
        if ((fds[i] = openFrom(i, port)) >= 0 && !sendAll(fds[i], opening, 200)) closeFd(fds[i]);
        count += fds[i] >= 0;
      }
      const long k = fds[i] < 0 ? 0 : sendSome(fds[i], next(sent[i]));
      if (k < 0) closeFd(fds[i]);
      sent[i] += static_cast<std::size_t>(std::max(k, 0L));
    }
    for (auto turn = Clock::now() + std::chrono::milliseconds(turnMs); Clock::now() < turn && !timeUp();) sleepMs(10);
  }
  for (int& fd : fds) closeFd(fd);
  return count;
}

// A peer shaped like a client (the data connection, then the control one from
// the same address, and its heartbeat: a 3 at once and a moment after each 4,
// a 4 for each 3) that then sends `flood` over and over on the data or the
// control channel, as much as the socket takes, answering heartbeats if
// `answer`, until the server cuts it off. The rounds sent; -1 if not paired.
long pairedFlood(const Bytes& flood, bool onData, bool answer, int receiveBuffer = 0, int pauseMs = 0) {
  int data = openFrom(0, g_port, 5000, receiveBuffer), control = data < 0 ? -1 : openFrom(0, kControlPort, 5000);
  Bytes pending;
  bool replied = false;
  Clock::time_point nextBeat = Clock::now();
  auto heartbeat = [&] {  // false once the server closed the control connection
    if (closedByServer(control, &pending)) return false;
    std::size_t at = 0;
    for (std::uint32_t length; pending.size() - at >= 4; at += 4 + length) {
      std::memcpy(&length, &pending[at], 4);
      if (pending.size() - at < 4 + std::size_t{length}) break;
      if (length >= 4 && pending[at + 4] == 3) sendAll(control, words({4, 4}), 200);
      if (length >= 4 && pending[at + 4] == 4) replied = true, nextBeat = Clock::now() + std::chrono::milliseconds(100);
    }
    pending.erase(pending.begin(), pending.begin() + static_cast<long>(at));
    if (Clock::now() >= nextBeat) nextBeat = Clock::time_point::max(), sendAll(control, words({4, 3}), 200);
    return true;
  };
  // The server answers once it paired the two; sanitizer builds are slow.
  for (auto until = Clock::now() + std::chrono::seconds(20); control >= 0 && !replied && Clock::now() < until; sleepMs(1))
    if (!heartbeat()) break;
  long rounds = replied ? 0 : -1;
  if (replied) say("paired");
  for (auto until = Clock::now() + std::chrono::milliseconds(500); replied && Clock::now() < until; sleepMs(5)) heartbeat();
  for (std::size_t at = 0; replied && !timeUp(); pauseMs > 0 ? sleepMs(pauseMs) : void(writable(control, 5))) {
    const long n = sendSome(onData ? data : control, flood, at);
    if (n < 0 || (answer && !heartbeat())) {
      say("closed-by-server " + std::to_string(std::chrono::duration<double>(Clock::now() - g_start).count()));
      break;
    }
    if ((at += static_cast<std::size_t>(n)) == flood.size()) at = 0, ++rounds;
  }
  closeFd(control), closeFd(data);
  return rounds;
}

const std::map<std::string, std::function<long()>> kAttacks = {
    {"connect-flood", connectFlood},
    {"truncated", truncated},
    // Silent connections to both ports, twenty at a time, closed a moment
    // later, once the server has taken them.
    {"scan",
     [] {
       long count = 0;
       for (int round = 0; round < 10 && !timeUp(); ++round, sleepMs(50)) count += hold(20, round * 20, 0, 200);
       return count;
     }},
    // Two hundred silent connections to both ports, held to the end.
    {"half-open", [] { return hold(200, 0, 0, 0); }},
    // Forty-eight silent connections to P, four from each address.
    {"descriptors", [] { return hold(4 * kSpread, 0, g_port, 0, 500); }},
    // 6000 messages of 8 bytes, each in a write of its own, on a data
    // connection that never pairs; held to the end.
    {"small-messages",
     [] {
       int fd = openFrom(0, g_port, 2000), count = 0;
       for (; fd >= 0 && count < 6000 && !timeUp() && sendAll(fd, words({8}, 1, 8, 'a' + count % 26)); ++count)
         std::this_thread::sleep_for(std::chrono::microseconds(200));
       std::this_thread::sleep_until(g_end);
       return closeFd(fd), long{count};
     }},
    // Twenty connections to P, each sending the next byte of a message that
    // claims 100000 once a second.
    {"drip",
     [] {
       const Bytes m = words({100000}, 1, 96);
       return slots(20, g_port, 1000, {}, [&](std::size_t at) { return Bytes{m[at % m.size()]}; });
     }},
    // A prefix of 0x7FFFFFFB on eight connections, then the body in slices.
    {"giant-prefix", [] { return slots(8, 0, 10, words({0x7FFFFFFBu}), [](std::size_t) { return Bytes(32 << 10, 'g'); }); }},
    // Echo requests without reading.
    {"echo-flood", [] { return pairedFlood(words({4, 5}, 8192), false, false); }},
    // Bandwidth requests while reading and answering heartbeats.
    {"bandwidth-flood", [] { return pairedFlood(words({8, 1, 400000, 8, 1, 50000}, 4096), false, true); }},
    // Heartbeats correctly, sends data that the server echoes, never reads
    // it, with a small receive window.
    {"no-read", [] { return pairedFlood(words({16 << 10}, 1, 16 << 10, 'n'), true, true, 4096, 2); }},
};

}  // namespace

int main(int argc, char** argv) {
  const auto run = argc == 4 ? kAttacks.find(argv[2]) : kAttacks.end();
  if (run == kAttacks.end()) return std::fprintf(stderr, "usage: hostile_peer PORT ATTACK SECONDS\n"), 2;
  g_port = std::atoi(argv[1]);
  // The test may have lowered the limit it handed down (descriptors); ours is
  // our own business.
  rlimit files{};
  if (::getrlimit(RLIMIT_NOFILE, &files) == 0) files.rlim_cur = files.rlim_max, ::setrlimit(RLIMIT_NOFILE, &files);
  g_start = Clock::now();
  g_end = g_start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(std::atof(argv[3])));
  say("attacking");
  const long count = run->second();
  if (count < 0) return say("error not paired"), 3;
  say("count " + std::to_string(count));
  say("done");
  return 0;
}
