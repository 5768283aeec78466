// The server end of one connection played by plain Linux sockets: the data
// stream, the control stream and the datagrams, each counted byte by byte and
// message by message in both directions as the peer's system saw them (a
// stream's 4-byte prefixes included), and every control message recorded.
//
// A thread of its own reads all three channels and answers on the control
// channel by its policy: heartbeats, world-time requests.
// Kept apart from the library's headers, whose Winsock names Linux's macros
// would clash with.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace raw_peer {

struct Tally {
  std::uint64_t bytes = 0;
  std::uint64_t messages = 0;
};

// One direction of the three channels.
struct Direction {
  Tally reliable, unreliable, control;
};

// One received control message: its size, its type and value words (0 where cut).
struct Received {
  unsigned size;
  std::uint32_t type, value;
};

// A control message's body: the type word, and the value word for types 1,
// 2 and 8; cut to `size` when asked (the value word is there even for 4-byte
// types, so a cut one carries known bytes).
std::vector<unsigned char> controlBytes(std::uint32_t type, std::uint32_t value = 0, int size = -1);
// A control message's body as received: its size, type word and value word.
Received parse(const void* body, unsigned size);

class RawPeer {
 public:
  // Listens on ip:port and ip:6000, and exchanges datagrams between
  // ip:port+1 and peerIp:port+1.
  RawPeer(const char* ip, const char* peerIp, std::uint16_t port);
  ~RawPeer();
  RawPeer(const RawPeer&) = delete;
  RawPeer& operator=(const RawPeer&) = delete;

  // One packaged message of `size` bytes of `fill` on the data stream.
  void sendReliable(std::size_t size, char fill);
  void sendUnreliable(std::size_t size, char fill);
  void sendControl(std::uint32_t type, std::uint32_t value = 0) { sendControlBytes(controlBytes(type, value)); }
  void sendControlBytes(const std::vector<unsigned char>& body);  // packaged as given, cut ones too

  Direction sent();
  Direction received();
  std::vector<Received> control();
  std::size_t count(std::uint32_t type);  // received control messages of `type`
  bool open(bool control) const { return control ? m_bControlOpen : m_bDataOpen; }  // accepted, not closed

  std::atomic<bool> answerHeartbeats{true};
  std::atomic<bool> heartbeatBack{false};  // a heartbeat of its own after each reply
  std::atomic<int> worldTimeAnswers{-1};   // how many more to answer; -1: all
  std::atomic<float> worldTime{100.0f};
  std::atomic<bool> worldTimeRuns{false};  // the answer adds the peer's own age

 private:
  void run();
  // False once the stream has ended.
  bool readStream(int fd, std::vector<char>& pending, Tally& tally, bool control);
  void send(int fd, const std::vector<char>& bytes, Tally& tally);

  std::chrono::steady_clock::time_point m_start;
  int m_dataListener = -1, m_controlListener = -1;
  // Set by the thread when accepted, read by the senders.
  std::atomic<int> m_data{-1}, m_control{-1};
  std::atomic<bool> m_bDataOpen{false}, m_bControlOpen{false};
  int m_udp = -1;
  std::atomic<bool> m_bStop{false};
  std::mutex m_write;  // one writer at a time on each stream
  std::mutex m_lock;   // the tallies
  Direction m_sent, m_received;
  std::vector<Received> m_controlReceived;
  std::vector<char> m_dataPending, m_controlPending;
  std::thread m_thread;
};

}  // namespace raw_peer
