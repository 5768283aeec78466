// The receive path: the network thread posts one read per FD_READ, and
// receiveComplete() turns the bytes of each read into whole messages on the
// socket's receive queue, undoing the length-prefixed stream format on a
// packaged socket however the stream was cut into reads.
//
// Reassembly state between reads (m_iPacketBytesHave, m_iPacketBytesMissing,
// m_pPacketBuffer):
//   idle            0       0        null
//   prefix partial  1..3    -1       1024 + first fragment bytes, the prefix so far
//   body partial    4 + n   > 0      exactly length + 4 bytes, prefix and payload so far
// A message that lies whole in a read and ends it is handed out in place, in
// the read buffer; one with bytes behind it is copied out.
#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <thread>

#include "N_Exceptions.h"
#include "N_Initializer.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "Q_System.h"
#include "data_queue.h"
#include "trace.h"
#include "little_endian.h"
#include "Runtime.h"
#include "RuntimeLock.h"
#include "win32.h"
#include "winsock.h"

namespace {

constexpr unsigned int kReadSize = 65536;
constexpr int kPrefixSlack = 1024;
// With compact messages on: a message shorter than this is copied out of the
// read buffer rather than keeping all of it, and the block of a long message
// starts at this size and doubles as the bytes arrive.
constexpr unsigned int kCompactBelow = 16384;
// A message with at least this many bytes still to come is read straight
// into its block instead of being copied there out of read buffers.
constexpr std::int64_t kDirectFrom = 4096;

}  // namespace

bool N_Socket::directReadable() {
  if (!m_bPackage || m_bStreamBroken || m_pPacketBuffer == nullptr) return false;
  const std::int64_t have = m_iPacketBytesHave;
  const std::int64_t missing = m_iPacketBytesMissing;
  if (have < 4 || missing < kDirectFrom || m_iPacketCapacity < have + missing) return false;
  // Reads of one socket complete in the order they were posted; one still
  // under way would bring bytes that belong in front of these.
  Q_DLList<DataQueue>* queue = Runtime::reads();
  for (DataQueue* entry = queue->getFirst(); entry != nullptr; entry = queue->getNext(entry))
    if (entry->pSocket == this) return false;
  return true;
}

void N_Socket::postRead() {
  Q_DLList<DataQueue>* queue = Runtime::reads();
  DataQueue* entry = nullptr;
  // A message whose length is known and whose block waits is read straight
  // into the block, and only what follows it into a read buffer: behind a
  // long message just the next prefix, so that the next read can go
  // straight into the next block too.
  const bool direct = directReadable();
  const unsigned int spill =
      direct && m_iPacketBytesHave + std::int64_t{m_iPacketBytesMissing} >= kReadSize ? 4 : kReadSize;
  try {
    entry = appendEntry(queue, this, true, false);
    entry->wsaBuf.len = spill;
    entry->pBuffer = Q_NewArray<char>(spill);
    entry->wsaBuf.buf = entry->pBuffer;
  } catch (Q_MemoryException*) {
    // Without a read posted no FD_READ would come again: the connection
    // can't go on, so it ends as a disconnect the application sees.
    if (entry != nullptr) queue->remove(entry);
    try {
      disconnect();
    } catch (...) {
      traceSwallowed("disconnect after a failed read");
    }
    return;
  }
  entry->overlapped.hEvent = entry;
  entry->bDirect = direct;
  platform::WSABUF buffers[2];
  platform::DWORD count = 0;
  if (direct) {
    buffers[count].buf = m_pPacketBuffer + m_iPacketBytesHave;
    buffers[count].len = static_cast<std::uint32_t>(m_iPacketBytesMissing);
    ++count;
  }
  buffers[count++] = entry->wsaBuf;
  platform::DWORD received = 0;
  platform::DWORD flags = 0;
  if (WSARecv(m_socket, buffers, count, &received, &flags, &entry->overlapped, Runtime::readComplete) ==
      platform::SOCKET_ERROR) {
    int error = platform::WSAGetLastError();
    // WSAEWOULDBLOCK counts as under way, like WSA_IO_PENDING.
    if (error != platform::WSAEWOULDBLOCK && error != platform::WSA_IO_PENDING) {
      Q_DeleteArray(entry->pBuffer);
      entry->pBuffer = nullptr;
      entry->wsaBuf.buf = nullptr;
      queue->remove(entry);
    }
  }
}

void N_Socket::breakStream() {
  Q_DeleteArray(m_pPacketBuffer);
  m_pPacketBuffer = nullptr;
  m_iPacketCapacity = 0;
  m_iPacketBytesMissing = 0;
  m_iPacketBytesHave = 0;
  m_bStreamBroken = true;
  try {
    disconnect();
  } catch (...) {
    traceSwallowed("disconnect of a broken stream");
  }
}

N_Socket::DataQueue* N_Socket::appendMessage(char* buffer, char* data, unsigned int size) {
  DataQueue* message = appendEntry(m_pReceiveQueue, this, true, true);
  message->pBuffer = buffer;
  message->wsaBuf.len = size;
  message->wsaBuf.buf = data;
  m_uQueuedReceiveBytes += size;
  ++m_uQueuedReceiveMessages;
  ++m_uMessagesReceived;
  return message;
}

bool N_Socket::deliver(DataQueue* read, DataQueue* message) {
  m_pDelivering = message;
  m_deliveringThread = std::this_thread::get_id();
  bool keep = true;
  {
    RuntimeUnlock stepOut;
    try {
      keep = receive(message->wsaBuf.buf, message->wsaBuf.len);
    } catch (...) {
      traceSwallowed("receive");
      keep = true;
    }
  }
  // Only the override itself can have destroyed the socket meanwhile; then
  // the socket, this message and maybe the read buffer are gone.
  if (!read->bLive) return false;
  m_pDelivering = nullptr;
  // A message that poll() handed out meanwhile stays for the next poll().
  if (!keep && !message->bConsumed) {
    m_uQueuedReceiveBytes -= message->wsaBuf.len;
    --m_uQueuedReceiveMessages;
    Q_DeleteArray(message->pBuffer);
    m_pReceiveQueue->remove(message);
  }
  return true;
}

void N_Socket::awaitDelivery() {
  // The override itself may destroy its socket: it must not wait for itself.
  while (m_pDelivering != nullptr && m_deliveringThread != std::this_thread::get_id()) {
    {
      RuntimeUnlock stepOut;
      platform::Sleep(1);
    }
    // The network thread may have gone back to its wait meanwhile, on this
    // socket's event too: it must leave it before the event is closed.
    Runtime::wake();
  }
}

bool N_Socket::receivePlain(DataQueue* read, unsigned int bytes, const ReadLimits& limits) {
  DataQueue* message;
  try {
    if (limits.bCompact && bytes < kCompactBelow) return finishInRead(read, read->wsaBuf.buf, bytes, false, limits);
    message = appendMessage(read->pBuffer, read->wsaBuf.buf, bytes);
  } catch (Q_MemoryException*) {
    breakStream();
    return true;
  }
  read->pBuffer = nullptr;
  read->wsaBuf.buf = nullptr;
  return deliver(read, message);
}

bool N_Socket::finishInRead(DataQueue* read, char* payload, unsigned int size, bool last, const ReadLimits& limits) {
  DataQueue* message;
  // In place, a short message would keep the whole read buffer.
  if (!last || (limits.bCompact && size < kCompactBelow)) {
    char* copy = Q_NewArray<char>(size);
    if (size > 0) std::memcpy(copy, payload, size);
    try {
      message = appendMessage(copy, copy, size);
    } catch (...) {
      Q_DeleteArray(copy);
      throw;
    }
  } else {
    message = appendMessage(read->pBuffer, payload, size);
    read->pBuffer = nullptr;
    read->wsaBuf.buf = nullptr;
  }
  return deliver(read, message);
}

void N_Socket::reserveCollected(std::int64_t needed, std::int64_t total) {
  if (needed <= m_iPacketCapacity) return;
  std::int64_t capacity = std::min(total, std::max(needed, 2 * m_iPacketCapacity));
  char* block = Q_NewArray<char>(static_cast<std::size_t>(capacity));
  std::memcpy(block, m_pPacketBuffer, static_cast<std::size_t>(m_iPacketBytesHave));
  Q_DeleteArray(m_pPacketBuffer);
  m_pPacketBuffer = block;
  m_iPacketCapacity = capacity;
}

namespace {

// The message a socket collects across reads, seen through its members:
// `have` bytes of it in `block` so far, `missing` still to come. Nothing is
// collected while `have` is 0; `missing` is -1 while the prefix itself is cut.
struct Collection {
  enum State { kNothing, kPrefix, kBody };

  char*& block;
  std::int64_t& capacity;
  std::atomic<int>& have;
  std::atomic<int>& missing;

  State state() const { return have == 0 ? kNothing : missing < 0 ? kPrefix : kBody; }
  // A fresh block of `size` bytes for a message of which `total` bytes are
  // to come (-1: its prefix is cut).
  void begin(std::int64_t size, std::int64_t total) {
    Q_DeleteArray(block);
    block = nullptr;
    block = Q_NewArray<char>(static_cast<std::size_t>(size));
    capacity = size;
    missing = static_cast<int>(total);
  }
  // Takes `n` bytes at `from`; in the body they count against what is missing.
  void take(const char* from, std::int64_t n) {
    if (n > 0) std::memcpy(block + have, from, static_cast<std::size_t>(n));
    have = static_cast<int>(have + n);
    if (missing >= 0) missing = static_cast<int>(missing - n);
  }
  // The prefix is whole: a block of `size` bytes for the body, the prefix
  // moved into it.
  void startBody(std::int64_t size, std::uint32_t length) {
    char* body = Q_NewArray<char>(static_cast<std::size_t>(size));
    std::memcpy(body, block, 4);
    Q_DeleteArray(block);
    block = body;
    capacity = size;
    missing = static_cast<int>(length);
  }
  // The finished block was handed on; nothing is collected any more.
  void release() {
    block = nullptr;
    capacity = 0;
    missing = 0;
    have = 0;
  }
};

}  // namespace

bool N_Socket::receiveDirect(DataQueue* read, unsigned int bytes) {
  Collection collected{m_pPacketBuffer, m_iPacketCapacity, m_iPacketBytesHave, m_iPacketBytesMissing};
  // The bytes are in place already: they only count.
  collected.have = static_cast<int>(collected.have + bytes);
  collected.missing = static_cast<int>(collected.missing - bytes);
  if (collected.missing > 0) return true;
  DataQueue* message;
  try {
    message = appendMessage(collected.block, collected.block + 4, static_cast<unsigned int>(collected.have - 4));
  } catch (Q_MemoryException*) {
    breakStream();
    return true;
  }
  collected.release();
  return deliver(read, message);
}

bool N_Socket::receivePackaged(DataQueue* read, unsigned int bytes, const ReadLimits& limits) {
  if (m_bStreamBroken) return true;
  Collection collected{m_pPacketBuffer, m_iPacketCapacity, m_iPacketBytesHave, m_iPacketBytesMissing};
  // 64-bit arithmetic: a length near 2^31 must not wrap the comparisons.
  std::int64_t left = bytes;
  char* cursor = read->wsaBuf.buf;
  auto take = [&](std::int64_t n) {
    collected.take(cursor, n);
    cursor += n;
    left -= n;
  };
  try {
    while (left > 0) {
      switch (collected.state()) {
        case Collection::kNothing: {
          if (left < 4) {
            // The prefix itself is cut.
            collected.begin(left + kPrefixSlack, -1);
            take(left);
            return true;
          }
          const std::uint32_t length = little_endian::get32(cursor);
          if (length > limits.uMaximumLength) {
            breakStream();
            return true;
          }
          const std::int64_t total = std::int64_t{length} + 4;
          if (left < total) {
            // The message spans reads: collect it at its final size, or with
            // compact messages in a block that grows as the bytes come.
            collected.begin(limits.bCompact ? std::min(total, std::max<std::int64_t>(left, kCompactBelow)) : total,
                            total);
            take(left);
            return true;
          }
          char* payload = cursor + 4;
          cursor += total;
          left -= total;
          if (!finishInRead(read, payload, length, left == 0, limits)) return false;
          break;
        }
        case Collection::kPrefix: {
          // Complete the prefix, then collect the body in a block of its size.
          take(std::min<std::int64_t>(4 - collected.have, left));
          if (collected.have < 4) return true;
          const std::uint32_t length = little_endian::get32(collected.block);
          if (length > limits.uMaximumLength) {
            breakStream();
            return true;
          }
          const std::int64_t total = std::int64_t{length} + 4;
          collected.startBody(limits.bCompact ? std::min<std::int64_t>(total, kCompactBelow) : total, length);
          [[fallthrough]];  // an empty body is finished already
        }
        case Collection::kBody: {
          const std::int64_t n = std::min<std::int64_t>(collected.missing, left);
          reserveCollected(collected.have + n, collected.have + collected.missing);
          take(n);
          if (collected.missing > 0) return true;
          DataQueue* message =
              appendMessage(collected.block, collected.block + 4, static_cast<unsigned int>(collected.have - 4));
          collected.release();
          if (!deliver(read, message)) return false;
          break;
        }
      }
    }
  } catch (Q_MemoryException*) {
    // What can't be held can't be skipped either: the stream has lost its
    // place, so the connection ends.
    breakStream();
  }
  return true;
}

void N_Initializer::receiveComplete(platform::DWORD error, platform::DWORD bytes, platform::OVERLAPPED* overlapped,
                                    platform::DWORD flags) {
  auto* read = static_cast<N_Socket::DataQueue*>(overlapped->hEvent);
  if (error != 0) {
    const char* text = Q_STR(
        "receiveComplete: dwError = %s (%d),\n                 lpOverlapped->hEvent = 0x%08X\n"
        "                 cbTransferred = %d\n                 dwFlags = %d\n",
        N_Socket::getWSErrorName(static_cast<int>(error)), static_cast<int>(error),
        static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(overlapped->hEvent)), static_cast<int>(bytes),
        static_cast<int>(flags));
    Sys->verbose("%s", text);
    // The reassembly state stays as it is; the read itself is over, and
    // nothing names its entry any more, so it goes now rather than at the
    // runtime's stop (a peer that resets connections again and again must
    // not make the queue grow).
    RuntimeLock lock;
    Q_DeleteArray(read->pBuffer);
    read->pBuffer = nullptr;
    read->wsaBuf.buf = nullptr;
    m_pInProcessQueue->remove(read);
    return;
  }
  RuntimeLock lock;
  N_Socket* socket = read->pSocket;
  if (read->bLive && socket != nullptr) {
    // A direct read filled the block of the message in collection first; it
    // asked for no more than the bytes missing, which nothing changed since.
    const unsigned int direct =
        read->bDirect ? std::min<unsigned int>(bytes, static_cast<unsigned int>(socket->m_iPacketBytesMissing)) : 0;
    unsigned int size = std::min<unsigned int>(bytes - direct, read->wsaBuf.len);
    socket->m_uBytesReceived += direct + size;
    const N_Limits limits = getLimits();
    const N_Socket::ReadLimits readLimits{limits.uMaximumMessageSize, limits.bCompactMessages};
    if (read->bDirect && !socket->m_bPackage) {
      // Packaging was switched off while the read was under way: its bytes
      // make one plain read, as if they had all come into the read buffer.
      char* joined = nullptr;
      try {
        joined = Q_NewArray<char>(std::size_t{direct} + size);
      } catch (Q_MemoryException*) {
        socket->breakStream();
      }
      if (joined != nullptr) {
        if (direct > 0) std::memcpy(joined, socket->m_pPacketBuffer + socket->m_iPacketBytesHave, direct);
        if (size > 0) std::memcpy(joined + direct, read->wsaBuf.buf, size);
        Q_DeleteArray(read->pBuffer);
        read->pBuffer = joined;
        read->wsaBuf.buf = joined;
        socket->receivePlain(read, direct + size, readLimits);
      }
    } else if (direct == 0 || socket->receiveDirect(read, direct)) {
      if (socket->m_bPackage)
        socket->receivePackaged(read, size, readLimits);
      else
        socket->receivePlain(read, size, readLimits);
    }
  }
  Q_DeleteArray(read->pBuffer);
  read->pBuffer = nullptr;
  read->wsaBuf.buf = nullptr;
  m_pInProcessQueue->remove(read);
}

void N_Socket::injectRead(N_Socket* socket, const void* bytes, unsigned int size, platform::DWORD error) {
  size = std::min(size, kReadSize);
  RuntimeLock lock;
  Q_DLList<DataQueue>* queue = Runtime::reads();
  DataQueue* entry = nullptr;
  try {
    entry = appendEntry(queue, socket, true, false);
    entry->pBuffer = Q_NewArray<char>(kReadSize);
  } catch (...) {
    if (entry != nullptr) queue->remove(entry);
    throw;
  }
  entry->wsaBuf.len = kReadSize;
  entry->wsaBuf.buf = entry->pBuffer;
  entry->overlapped.hEvent = entry;
  if (size > 0) std::memcpy(entry->pBuffer, bytes, size);
  lock.unlock();
  Runtime::readComplete(error, error == 0 ? size : 0, &entry->overlapped, 0);
}
