// Fuzzes the receive path of a packaged socket: the input is a stream of
// bytes and the points at which it is cut into reads; each read is handed to
// the receive path the way the network thread hands a completed WSARecv.
//
// Input: byte 0 = k (modulo 16; bit 4 picks the open network's limits), then
// k little-endian 16-bit read sizes (each 1 to 65536, used in turn), then the
// stream. With k = 0 the stream is read 65536 bytes at a time.
//
// Blocks above 16 MiB are refused (see the allocation functions below): a
// length near 2^31 would cost seconds of sanitizer bookkeeping per input, and
// the refusal takes the library's out-of-memory path, which deserves the
// fuzzing as much.
//
// Checked: nothing reads or writes outside its blocks (the sanitizers), the
// messages are exactly those a plain reference parser finds (ahead of the
// first length that can't be true), the stream breaks at such a length and
// nowhere else but at a block that was refused, the progress getters agree
// with the parser, and every allocation is given back once the socket goes.
#include <algorithm>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <new>
#include <vector>

#include "N_Address.h"
#include "N_Initializer.h"
#include "N_Socket.h"
#include "Q_Memory.h"
#include "vardel_platform.h"
#include "win32.h"

namespace {
constexpr std::size_t kLargestBlock = 16u << 20;
std::atomic<int> g_refusedBlocks{0};
}  // namespace

// Array allocations come from malloc, so that large ones can be refused; the
// library counts a refused allocation as made, and the balance below knows.
void* operator new[](std::size_t size, const std::nothrow_t&) noexcept {
  if (size > kLargestBlock) {
    ++g_refusedBlocks;
    return nullptr;
  }
  return std::malloc(size != 0 ? size : 1);
}
void* operator new[](std::size_t size) {
  if (void* p = std::malloc(size != 0 ? size : 1)) return p;
  throw std::bad_alloc();
}
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete[](void* p, std::size_t) noexcept { std::free(p); }
void operator delete[](void* p, const std::nothrow_t&) noexcept { std::free(p); }

struct N_SocketTestAccess {
  static void read(N_Socket& socket, const void* bytes, unsigned int size) {
    N_Socket::injectRead(&socket, bytes, size);
  }
  static bool streamBroken(const N_Socket& socket) { return socket.m_bStreamBroken; }
};

namespace {

using Bytes = std::vector<unsigned char>;

// Records every message, keeping every other one for poll().
class FuzzSocket : public N_Socket {
 public:
  ~FuzzSocket() { destruct(); }
  bool receive(void* data, unsigned int size) override {
    const auto* p = static_cast<const unsigned char*>(data);
    if (size > 0 && p == nullptr) std::abort();
    received.emplace_back(p, p + size);
    if (received.size() % 2 == 1) kept.push_back(received.size() - 1);
    return received.size() % 2 == 1;
  }
  std::vector<Bytes> received;
  std::vector<std::size_t> kept;
};

struct Expected {
  std::vector<Bytes> messages;
  bool broken = false;           // a length that can't be true was met
  std::int64_t partialSize = 0;  // length + 4 of a message in collection
  std::int64_t partialHave = 0;  // its bytes so far, prefix included
};

Expected reference(const unsigned char* stream, std::size_t size, std::uint32_t maximumLength) {
  Expected e;
  std::size_t at = 0;
  while (size - at >= 4) {
    const std::uint32_t length =
        stream[at] | stream[at + 1] << 8 | stream[at + 2] << 16 | std::uint32_t{stream[at + 3]} << 24;
    if (length > maximumLength) {
      e.broken = true;
      return e;
    }
    if (size - at - 4 < length) {
      e.partialSize = std::int64_t(length) + 4;
      e.partialHave = static_cast<std::int64_t>(size - at);
      return e;
    }
    e.messages.emplace_back(stream + at + 4, stream + at + 4 + length);
    at += 4 + length;
  }
  return e;
}

N_Address* g_loopback = nullptr;
int g_port = 0;

void startOnce() {
  if (g_loopback != nullptr) return;
  platform::setLocalHost("127.0.0.1");
  new N_Initializer;  // up for the whole run
  g_loopback = new N_Address("127.0.0.1");
  // Its reverse lookup allocates on a thread of its own: let it finish, so
  // that the allocation balance below counts this target's work alone.
  g_loopback->wait(2.0f);
  platform::Sleep(50);
  // A datagram socket that talks to itself never receives anything here:
  // the reads come from this target alone.
  g_port = 20000 + static_cast<int>(reinterpret_cast<std::uintptr_t>(&g_port) % 20000);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  startOnce();
  if (size == 0) return 0;
  const std::size_t k = data[0] % 16, header = 1 + 2 * k;
  if (size < header) return 0;
  // The largest length differs, and the open network's compact messages copy
  // short ones and grow long ones as they arrive.
  N_Initializer::setLimits((data[0] & 16) != 0 ? N_Limits::openNetwork() : N_Limits::defaults());
  const std::uint32_t maximumLength = N_Initializer::getLimits().uMaximumMessageSize;
  std::vector<std::size_t> cuts;
  for (std::size_t i = 0; i < k; ++i) cuts.push_back(std::size_t(data[1 + 2 * i] | data[2 + 2 * i] << 8) + 1);
  if (cuts.empty()) cuts.push_back(65536);
  const unsigned char* stream = data + header;
  const std::size_t streamSize = size - header;

  const int newBefore = Q_Memory::sm_iNewCount.load(), deleteBefore = Q_Memory::sm_iDeleteCount.load(),
            refusedBefore = g_refusedBlocks.load();
  {
    FuzzSocket socket;
    socket.construct(g_loopback, g_port, N_Socket::SOCKET_UDP);
    socket.enablePackage();
    for (std::size_t at = 0, turn = 0, piece; at < streamSize; at += piece) {
      piece = std::min(cuts[turn++ % cuts.size()], streamSize - at);
      N_SocketTestAccess::read(socket, stream + at, static_cast<unsigned int>(piece));
      const int missing = socket.getReceivePacketBytesMissing(), total = socket.getReceivePacketSize();
      if (missing < 0 || total < 0 || (total == 0) != (missing == 0) || (total > 0 && total - missing < 4))
        std::abort();
    }

    const Expected e = reference(stream, streamSize, maximumLength);
    const bool broken = N_SocketTestAccess::streamBroken(socket);
    // A length that can't be true breaks the stream; so does a block that
    // can't be allocated, but only at a message that can't finish here.
    const bool refusedHere = g_refusedBlocks.load() != refusedBefore;
    if (broken != e.broken && !(broken && refusedHere && e.partialSize > 0)) std::abort();
    if (socket.received != e.messages) std::abort();
    const bool whole = !broken && e.partialHave >= 4;  // a prefix read in full
    if (socket.getReceivePacketSize() != (whole ? e.partialSize : 0)) std::abort();
    if (!broken && socket.getReceivePacketBytesMissing() != (whole ? e.partialSize - e.partialHave : 0)) std::abort();
    // The kept messages come out of poll() whole and in order.
    void* message = nullptr;
    unsigned int messageSize = 0;
    for (std::size_t index : socket.kept) {
      const Bytes& want = socket.received[index];
      if (!socket.poll(message, messageSize) || messageSize != want.size() ||
          (messageSize > 0 && std::memcmp(message, want.data(), messageSize) != 0))
        std::abort();
    }
    if (socket.poll(message, messageSize)) std::abort();
  }
  const int refused = g_refusedBlocks.load() - refusedBefore;
  if (Q_Memory::sm_iNewCount.load() - newBefore - refused != Q_Memory::sm_iDeleteCount.load() - deleteBefore)
    std::abort();
  return 0;
}
