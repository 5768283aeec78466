// A hostile host for the server protection tests: plain Linux sockets, none of
// the library, one attack for a bounded time.
//
//   vardel_host_hostile_peer --host A --server 127.0.0.1 --port P
//       --attack NAME --seconds S
//
// Attacks: see kAttacks below. Those that open many connections spread them
// over kSpread addresses from A up, as many machines would; those that pair
// like a client use A alone. Prints, one per line:
//   attacking                started
//   paired                   the server answered our heartbeat (paired attacks)
//   closed-by-server T       the server cut a paired attacker off after T s
//   count N                  connections opened or messages sent
//   done                     finished, every socket closed
// Exit code 0; 2 for bad arguments; 3 if a paired attack couldn't pair.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using Bytes = std::vector<unsigned char>;

constexpr int kControlPort = 6000;
constexpr int kSpread = 12;

std::string g_host = "127.0.0.10", g_server = "127.0.0.1";
int g_port = 3123;
Clock::time_point g_start, g_end;

void say(const std::string& line) {
  std::fputs((line + "\n").c_str(), stdout);
  std::fflush(stdout);
}
bool timeUp() { return Clock::now() >= g_end; }
void sleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }
double elapsed() { return std::chrono::duration<double>(Clock::now() - g_start).count(); }
void waitWritable(int fd, int ms) {
  pollfd p{fd, POLLOUT, 0};
  ::poll(&p, 1, ms);
}

sockaddr_in address(const std::string& ip, int port, int offset = 0) {
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<std::uint16_t>(port));
  inet_pton(AF_INET, ip.c_str(), &a.sin_addr);
  a.sin_addr.s_addr = htonl(ntohl(a.sin_addr.s_addr) + static_cast<std::uint32_t>(offset));
  return a;
}

// A non-blocking connection from our index-th address (A + index mod
// kSpread); -1 unless it is up within `timeoutMs`. A small `receiveBuffer`
// keeps the window the server may fill small.
int openFrom(int index, int port, int timeoutMs = 500, int receiveBuffer = 0) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  int one = 1;
  // The port is picked at connect time, per destination: thousands of short
  // connections then don't run out of ports.
  ::setsockopt(fd, IPPROTO_IP, IP_BIND_ADDRESS_NO_PORT, &one, sizeof one);
  // Our closed connections linger in TIME_WAIT on ports from the ephemeral
  // range; without this a later listener on such a port can't bind it.
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
  if (receiveBuffer > 0) ::setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
  sockaddr_in local = address(g_host, 0, index % kSpread), remote = address(g_server, port);
  pollfd p{fd, POLLOUT, 0};
  int error = 0;
  socklen_t length = sizeof error;
  if (::bind(fd, reinterpret_cast<sockaddr*>(&local), sizeof local) != 0 ||
      (::connect(fd, reinterpret_cast<sockaddr*>(&remote), sizeof remote) != 0 && errno != EINPROGRESS) ||
      ::poll(&p, 1, timeoutMs) != 1 || ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) != 0 || error != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

void closeFd(int& fd, bool reset = false) {
  // A reset leaves no TIME_WAIT behind on our side.
  linger hard{1, 0};
  if (fd >= 0 && reset) ::setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
  if (fd >= 0) ::close(fd);
  fd = -1;
}

// The ports in turn: P for even k, 6000 for odd.
int portOf(int k) { return k % 2 == 0 ? g_port : kControlPort; }

// `count` connections from our addresses in turn, to both ports in turn or
// to P alone; those that came up.
std::vector<int> openMany(int count, int first, bool bothPorts, int timeoutMs = 300) {
  std::vector<int> fds;
  for (int i = first; i < first + count && !timeUp(); ++i)
    if (int fd = openFrom(i, bothPorts ? portOf(i) : g_port, timeoutMs); fd >= 0) fds.push_back(fd);
  return fds;
}

// Holds `fds` open to the end, then closes them; how many there were.
long holdToEnd(std::vector<int> fds) {
  while (!timeUp()) sleepMs(10);
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
  for (std::size_t done = 0; done < data.size();) {
    const long n = sendSome(fd, data, done);
    if (n < 0 || Clock::now() > deadline) return false;
    done += static_cast<std::size_t>(n);
    if (n == 0) waitWritable(fd, 10);
  }
  return true;
}

// Reads what arrived into `into` (or drops it); true once the server closed
// or reset the connection.
bool closedByServer(int fd, Bytes* into = nullptr) {
  unsigned char buffer[4096];
  for (;;) {
    const ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
    if (n == 0) return true;
    if (n < 0) return errno != EAGAIN && errno != EINTR;
    if (into != nullptr) into->insert(into->end(), buffer, buffer + n);
  }
}

void putWord(Bytes& out, std::uint32_t word) {
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<unsigned char>(word >> (8 * i)));
}

// A packaged message: the length prefix, then `body` bytes of `fill` (the
// prefix may claim more than that).
Bytes frame(std::uint32_t length, std::size_t body, unsigned char fill = 'x') {
  Bytes out;
  putWord(out, length);
  out.insert(out.end(), body, fill);
  return out;
}

// `count` copies of one control message, back to back; with a value, it
// alternates between `value` and `value / 8`.
Bytes controlRun(std::uint32_t type, int count, bool withValue = false, std::uint32_t value = 0) {
  Bytes out;
  for (int i = 0; i < count; ++i) {
    putWord(out, withValue ? 8 : 4);
    putWord(out, type);
    if (withValue) putWord(out, i % 2 == 0 ? value : value / 8);
  }
  return out;
}

// Keeps one stream of `data` going, as much as the socket takes each call;
// false once the connection failed.
struct Flood {
  Bytes data;
  std::size_t at = 0;
  long rounds = 0;
  bool push(int fd) {
    const long n = sendSome(fd, data, at);
    if (n < 0) return false;
    at += static_cast<std::size_t>(n);
    if (at == data.size()) at = 0, ++rounds;
    return true;
  }
};

// A peer shaped like a client: the data connection, then the control
// connection from the same address, and a client's heartbeat: a 3 at once and
// again a moment after each 4, a 4 for each 3 of the server.
struct Paired {
  int data = -1, control = -1;
  Bytes pending;
  bool replied = false;
  Clock::time_point nextBeat = Clock::time_point::max();

  ~Paired() {
    closeFd(control);
    closeFd(data);
  }
  bool open(int receiveBuffer = 0) {
    data = openFrom(0, g_port, 5000, receiveBuffer);
    if (data >= 0) control = openFrom(0, kControlPort, 5000);
    if (control < 0) return false;
    beat(3);
    // The server answers once it paired the two; sanitizer builds are slow.
    for (auto deadline = Clock::now() + std::chrono::seconds(20); !replied && Clock::now() < deadline; sleepMs(1))
      if (!heartbeat()) return false;
    return replied;
  }
  void beat(std::uint32_t type) { sendAll(control, controlRun(type, 1), 200); }
  // Reads the control channel and answers; false once the server closed it.
  bool heartbeat() {
    if (closedByServer(control, &pending)) return false;
    std::size_t at = 0;
    while (pending.size() - at >= 4) {
      const std::uint32_t length = pending[at] | pending[at + 1] << 8 | pending[at + 2] << 16 | pending[at + 3] << 24;
      if (pending.size() - at < 4 + std::size_t{length}) break;
      const unsigned char type = length >= 4 ? pending[at + 4] : 0;
      at += 4 + length;
      if (type == 3) beat(4);
      if (type == 4) replied = true, nextBeat = Clock::now() + std::chrono::milliseconds(100);
    }
    pending.erase(pending.begin(), pending.begin() + static_cast<long>(at));
    if (Clock::now() >= nextBeat) nextBeat = Clock::time_point::max(), beat(3);
    return true;
  }
};

// --- the attacks -------------------------------------------------------------

// Connections to both ports without a byte, twenty at a time, closed a
// moment later, once the server has taken them.
long scan() {
  long count = 0;
  for (int round = 0; round < 10 && !timeUp(); ++round) {
    std::vector<int> fds = openMany(20, round * 20, true);
    count += static_cast<long>(fds.size());
    sleepMs(200);
    for (int& fd : fds) closeFd(fd);
    sleepMs(50);
  }
  return count;
}

// Twenty connections, each sending the next byte of a message once a second
// and reconnecting when the server closed it.
long drip() {
  const Bytes message = frame(100000, 96);
  std::vector<int> fds(20, -1);
  std::vector<std::size_t> at(fds.size(), 0);
  long opened = 0;
  while (!timeUp()) {
    for (std::size_t i = 0; i < fds.size(); ++i) {
      if (fds[i] >= 0 && closedByServer(fds[i])) closeFd(fds[i]);
      if (fds[i] < 0) {
        fds[i] = openFrom(static_cast<int>(i), g_port, 300);
        at[i] = 0;
        opened += fds[i] >= 0;
      }
      if (fds[i] >= 0 && sendSome(fds[i], Bytes{message[at[i] % message.size()]}) > 0) ++at[i];
    }
    for (int k = 0; k < 100 && !timeUp(); ++k) sleepMs(10);
  }
  for (int& fd : fds) closeFd(fd);
  return opened;
}

// Messages cut short: the prefix claims more than follows, then the close;
// every fourth prefix has its top bit set.
long truncated() {
  const std::uint32_t claims[] = {1000, 70000, 1u << 20, 0x80000010u};
  long count = 0;
  for (int k = 0; !timeUp(); ++k) {
    int fd = openFrom(k, portOf(k), 300);
    if (fd < 0) {
      sleepMs(10);
      continue;
    }
    const std::uint32_t claim = claims[k % 4];
    const std::size_t body = (claim & 0x80000000u) != 0 ? 16 : std::min<std::size_t>(claim / 2, 256 << 10);
    count += sendAll(fd, frame(claim, body), 1000);
    closeFd(fd);
    sleepMs(5);
  }
  return count;
}

// Connects and closes as fast as it can, mostly with a reset.
long connectFlood() {
  long count = 0;
  for (int k = 0; !timeUp(); ++k)
    if (int fd = openFrom(k, portOf(k), 100); fd >= 0) ++count, closeFd(fd, k % 4 != 0);
  return count;
}

// A prefix of 0x7FFFFFFB on eight connections, then the body in slices; a
// connection that the server closed is opened again with a new prefix, at
// most ten times a second per slot (flooding connections is another attack).
long giantPrefix() {
  const Bytes slice(32 << 10, 'g');
  std::vector<int> fds(8, -1);
  std::vector<Clock::time_point> opened(fds.size());
  long count = 0;
  while (!timeUp()) {
    for (std::size_t i = 0; i < fds.size(); ++i) {
      if (fds[i] >= 0 && (closedByServer(fds[i]) || sendSome(fds[i], slice) < 0)) closeFd(fds[i]);
      if (fds[i] < 0 && Clock::now() - opened[i] >= std::chrono::milliseconds(100)) {
        opened[i] = Clock::now();
        fds[i] = openFrom(static_cast<int>(i), portOf(static_cast<int>(i)), 300);
        if (fds[i] >= 0 && !sendAll(fds[i], frame(0x7FFFFFFBu, 0), 200)) closeFd(fds[i]);
        count += fds[i] >= 0;
      }
    }
    sleepMs(10);
  }
  for (int& fd : fds) closeFd(fd);
  return count;
}

// 6000 messages of 8 bytes, each in a write of its own, on a data connection
// that never pairs; held to the end.
long smallMessages() {
  int fd = openFrom(0, g_port, 2000);
  long count = 0;
  for (int i = 0; fd >= 0 && i < 6000 && !timeUp(); ++i, ++count) {
    if (!sendAll(fd, frame(8, 8, static_cast<unsigned char>('a' + i % 26)), 1000)) break;
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  holdToEnd({fd});
  return count;
}

// Pairs, then keeps `flood` going on the data or the control channel until
// the server cuts it off, answering heartbeats if `answer`.
long pairedFlood(Flood flood, bool onData, bool answer, int receiveBuffer, int pauseMs) {
  Paired peer;
  if (!peer.open(receiveBuffer)) return -1;
  say("paired");
  for (auto until = Clock::now() + std::chrono::milliseconds(500); Clock::now() < until; sleepMs(5)) peer.heartbeat();
  while (!timeUp()) {
    if (!flood.push(onData ? peer.data : peer.control) || (answer && !peer.heartbeat())) {
      say("closed-by-server " + std::to_string(elapsed()));
      break;
    }
    pauseMs > 0 ? sleepMs(pauseMs) : waitWritable(peer.control, 5);
  }
  return flood.rounds;
}

const std::map<std::string, std::function<long()>> kAttacks = {
    {"scan", scan},
    {"drip", drip},
    {"truncated", truncated},
    {"connect-flood", connectFlood},
    {"giant-prefix", giantPrefix},
    {"small-messages", smallMessages},
    // Two hundred silent connections to both ports, held to the end.
    {"half-open", [] { return holdToEnd(openMany(200, 0, true)); }},
    // Forty-eight silent connections to P, four from each address.
    {"descriptors", [] { return holdToEnd(openMany(4 * kSpread, 0, false, 500)); }},
    // Echo requests without reading.
    {"echo-flood", [] { return pairedFlood({controlRun(5, 8192)}, false, false, 0, 0); }},
    // Bandwidth requests while reading and answering heartbeats.
    {"bandwidth-flood", [] { return pairedFlood({controlRun(1, 8192, true, 400000)}, false, true, 0, 0); }},
    // Heartbeats correctly, sends data that the server echoes, never reads
    // it, with a small receive window.
    {"no-read", [] { return pairedFlood({frame(16 << 10, 16 << 10, 'n')}, true, true, 4096, 2); }},
};

}  // namespace

int main(int argc, char** argv) {
  std::string attack;
  double seconds = 3;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string a = argv[i], value = argv[i + 1];
    if (a == "--host") g_host = value;
    else if (a == "--server") g_server = value;
    else if (a == "--port") g_port = std::atoi(value.c_str());
    else if (a == "--attack") attack = value;
    else if (a == "--seconds") seconds = std::atof(value.c_str());
    else return std::fprintf(stderr, "hostile_peer: unknown option %s\n", a.c_str()), 2;
  }
  const auto run = kAttacks.find(attack);
  if (run == kAttacks.end()) return std::fprintf(stderr, "hostile_peer: unknown attack '%s'\n", attack.c_str()), 2;
  // The test may have lowered the limit it handed down (descriptors); ours is
  // our own business.
  rlimit files{};
  if (::getrlimit(RLIMIT_NOFILE, &files) == 0) {
    files.rlim_cur = files.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &files);
  }
  g_start = Clock::now();
  g_end = g_start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  say("attacking");
  const long count = run->second();
  if (count < 0) return say("error not paired"), 3;
  say("count " + std::to_string(count));
  say("done");
  return 0;
}
