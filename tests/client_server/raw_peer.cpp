#include "raw_peer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

#include "raw_socket.h"

namespace raw_peer {
namespace {

constexpr std::uint16_t kControlPort = 6000;
enum : std::uint32_t { kHeartbeat = 3, kHeartbeatReply = 4, kWorldTimeRequest = 7, kWorldTime = 8 };

std::uint32_t word(const char* at) {
  const auto* b = reinterpret_cast<const unsigned char*>(at);
  return b[0] | b[1] << 8 | b[2] << 16 | std::uint32_t{b[3]} << 24;
}

void putWord(std::vector<char>& out, std::uint32_t value) {
  for (int i = 0; i < 4; ++i) out.push_back(static_cast<char>(value >> (8 * i)));
}

// A packaged message: its length, then its bytes.
std::vector<char> framed(const std::vector<char>& body) {
  std::vector<char> out;
  putWord(out, static_cast<std::uint32_t>(body.size()));
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

}  // namespace

std::vector<unsigned char> controlBytes(std::uint32_t type, std::uint32_t value, int size) {
  std::vector<char> body;
  putWord(body, type);
  putWord(body, value);
  const bool valued = type == 1 || type == 2 || type == kWorldTime;
  body.resize(size >= 0 ? static_cast<std::size_t>(size) : valued ? 8 : 4);
  return {body.begin(), body.end()};
}

Received parse(const void* body, unsigned size) {
  const auto* at = static_cast<const char*>(body);
  return {size, size >= 4 ? word(at) : 0, size >= 8 ? word(at + 4) : 0};
}

RawPeer::RawPeer(const char* ip, const char* peerIp, std::uint16_t port) : m_start(std::chrono::steady_clock::now()) {
  std::uint16_t controlPort = kControlPort;
  m_dataListener = raw::listenOn(ip, port);
  m_controlListener = raw::listenOn(ip, controlPort);
  m_udp = raw::udpBound(ip, static_cast<std::uint16_t>(port + 1));
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_port = htons(static_cast<std::uint16_t>(port + 1));
  inet_pton(AF_INET, peerIp, &to.sin_addr);
  ::connect(m_udp, reinterpret_cast<sockaddr*>(&to), sizeof to);
  m_thread = std::thread([this] { run(); });
}

RawPeer::~RawPeer() {
  m_bStop = true;
  m_thread.join();
  for (int fd : {m_data.load(), m_control.load(), m_udp, m_dataListener, m_controlListener})
    if (fd >= 0) raw::closeFd(fd);
}

void RawPeer::run() {
  char datagram[65536];
  while (!m_bStop) {
    if (m_data < 0) {
      m_data = raw::acceptOne(m_dataListener, 1);
      m_bDataOpen = m_data >= 0;
    }
    if (m_control < 0) {
      m_control = raw::acceptOne(m_controlListener, 1);
      m_bControlOpen = m_control >= 0;
    }
    pollfd fds[3] = {{m_bDataOpen ? m_data.load() : -1, POLLIN, 0}, {m_bControlOpen ? m_control.load() : -1, POLLIN, 0},
                     {m_udp, POLLIN, 0}};
    if (::poll(fds, 3, 2) <= 0) continue;
    if (fds[0].revents != 0) m_bDataOpen = readStream(m_data, m_dataPending, m_received.reliable, false);
    if (fds[1].revents != 0) m_bControlOpen = readStream(m_control, m_controlPending, m_received.control, true);
    if (fds[2].revents & POLLIN) {
      const ssize_t n = ::recv(m_udp, datagram, sizeof datagram, MSG_DONTWAIT);
      std::lock_guard<std::mutex> hold(m_lock);
      if (n >= 0) {
        m_received.unreliable.bytes += static_cast<std::uint64_t>(n);
        ++m_received.unreliable.messages;
      }
    }
  }
}

bool RawPeer::readStream(int fd, std::vector<char>& pending, Tally& tally, bool isControl) {
  char buffer[65536];
  const ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
  if (n < 0) return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
  if (n == 0) return false;
  std::vector<std::uint32_t> types;
  {
    std::lock_guard<std::mutex> hold(m_lock);
    tally.bytes += static_cast<std::uint64_t>(n);
    pending.insert(pending.end(), buffer, buffer + n);
    while (pending.size() >= 4 && pending.size() >= 4 + std::size_t{word(pending.data())}) {
      const std::uint32_t length = word(pending.data());
      ++tally.messages;
      if (isControl) {
        types.push_back(m_controlReceived.emplace_back(parse(pending.data() + 4, length)).type);
      }
      pending.erase(pending.begin(), pending.begin() + static_cast<std::ptrdiff_t>(4 + length));
    }
  }
  for (std::uint32_t type : types) {
    if (type == kHeartbeat && answerHeartbeats) {
      sendControl(kHeartbeatReply);
      if (heartbeatBack) sendControl(kHeartbeat);
    }
    if (type == kWorldTimeRequest && worldTimeAnswers != 0) {
      if (worldTimeAnswers > 0) --worldTimeAnswers;
      const float now = worldTime.load() +
                        (worldTimeRuns ? std::chrono::duration<float>(std::chrono::steady_clock::now() - m_start).count() : 0.0f);
      std::uint32_t bits;
      std::memcpy(&bits, &now, sizeof bits);
      sendControl(kWorldTime, bits);
    }
  }
  return true;
}

void RawPeer::send(int fd, const std::vector<char>& bytes, Tally& tally) {
  std::lock_guard<std::mutex> writing(m_write);
  const bool sent = fd == m_udp ? ::send(fd, bytes.data(), bytes.size(), 0) == static_cast<ssize_t>(bytes.size())
                                : raw::sendAll(fd, bytes.data(), bytes.size());
  std::lock_guard<std::mutex> hold(m_lock);
  if (!sent) return;
  tally.bytes += bytes.size();
  ++tally.messages;
}

void RawPeer::sendReliable(std::size_t size, char fill) {
  send(m_data, framed(std::vector<char>(size, fill)), m_sent.reliable);
}

void RawPeer::sendUnreliable(std::size_t size, char fill) {
  send(m_udp, std::vector<char>(size, fill), m_sent.unreliable);
}

void RawPeer::sendControlBytes(const std::vector<unsigned char>& body) {
  send(m_control, framed(std::vector<char>(body.begin(), body.end())), m_sent.control);
}

Direction RawPeer::sent() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_sent;
}

Direction RawPeer::received() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_received;
}

std::vector<Received> RawPeer::control() {
  std::lock_guard<std::mutex> hold(m_lock);
  return m_controlReceived;
}

std::size_t RawPeer::count(std::uint32_t type) {
  std::lock_guard<std::mutex> hold(m_lock);
  std::size_t n = 0;
  for (const Received& r : m_controlReceived) n += r.type == type;
  return n;
}

}  // namespace raw_peer
