// The send path: send() turns a message into send entries on the runtime's
// out-queue (length prefix and chunks on a packaged socket), the network
// thread's pump issues them, and sendComplete() ends them.
#include <cstdint>
#include <cstring>
#include <new>
#include <span>
#include <vector>

#include "N_Initializer.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "Q_System.h"
#include "little_endian.h"
#include "Q_Throw.h"
#include "Runtime.h"
#include "RuntimeLock.h"
#include "win32.h"
#include "winsock.h"

namespace {

// A chunk keeps 16 bytes below the send limit, also the first one that
// carries the prefix, so no single WSASend exceeds the socket's buffer.
constexpr unsigned int kChunkReserve = 16;

}  // namespace

void N_Socket::send(void* data, unsigned int size) {
  const char* bytes = static_cast<const char*>(data);
  const unsigned int limit = static_cast<unsigned int>(m_iMaximumSendPacketSize > 0 ? m_iMaximumSendPacketSize : 0);
  // The copies are made before the lock is taken: a large message then holds
  // up the network thread only for the appends, which is what keeps the
  // entries of one message together and in order.
  // A message of one chunk, most of them, needs no list of its own.
  Chunk one[1];
  std::vector<Chunk> many;
  Chunk* chunks = one;
  std::size_t count = 0;
  try {
    if (!m_bPackage) {
      if (size > limit) Q_ThrowPacketTooBig(static_cast<int>(size), m_iMaximumSendPacketSize);
      // Counted once allocated: a failed allocation leaves nothing to free.
      char* buffer = Q_NewArray<char>(size);
      chunks[count++] = {buffer, size};
      if (size > 0) std::memcpy(buffer, bytes, size);
    } else {
      unsigned int chunkLimit = limit > kChunkReserve ? limit - kChunkReserve : 1;
      unsigned int chunk = size < chunkLimit ? size : chunkLimit;
      const std::size_t needed = 1 + (std::size_t{size} - chunk + chunkLimit - 1) / chunkLimit;
      if (needed > 1) {
        many.resize(needed);
        chunks = many.data();
      }
      char* first = Q_NewArray<char>(static_cast<std::size_t>(chunk) + 4);
      chunks[count++] = {first, chunk + 4};
      // The whole message's size, however many chunks follow.
      little_endian::put32(first, size);
      if (chunk > 0) std::memcpy(first + 4, bytes, chunk);
      for (unsigned int offset = chunk; offset < size;) {
        unsigned int c = size - offset < chunkLimit ? size - offset : chunkLimit;
        char* buffer = Q_NewArray<char>(c);
        chunks[count++] = {buffer, c};
        std::memcpy(buffer, bytes + offset, c);
        offset += c;
      }
    }
  } catch (const std::bad_alloc&) {
    // The list of chunks itself could not be made: reported like any allocation.
    for (std::size_t i = 0; i < count; ++i) Q_DeleteArray(chunks[i].buffer);
    Q_ThrowAllocation();
  } catch (...) {
    for (std::size_t i = 0; i < count; ++i) Q_DeleteArray(chunks[i].buffer);
    throw;
  }

  platform::SOCKET socket = 0;
  // The write itself is made outside the runtime's mutex, so that the
  // network thread, which the bytes may wake, need not wait for it.
  if (sendQueued(chunks, count, socket)) platform::WSAFlushSends(socket);
}

bool N_Socket::sendQueued(const Chunk* chunks, std::size_t count, platform::SOCKET& socket) {
  RuntimeLock lock;
  socket = m_socket;
  DataQueue* first = nullptr;
  std::size_t appended = 0;
  try {
    for (const Chunk& c : std::span(chunks, count)) {
      DataQueue* entry = Runtime::appendSend(this);
      entry->pBuffer = c.buffer;
      entry->wsaBuf.buf = c.buffer;
      entry->wsaBuf.len = c.length;
      if (first == nullptr) first = entry;
      ++appended;
      // Its completion counts the message as sent.
      entry->bMessageEnd = appended == count;
    }
  } catch (...) {
    // Nothing of a message that failed stays queued.
    Runtime::dropSends(first);
    for (std::size_t i = appended; i < count; ++i) Q_DeleteArray(chunks[i].buffer);
    throw;
  }
  unsigned int queued = 0;
  for (const Chunk& c : std::span(chunks, count)) queued += c.length;
  // With nothing of this socket queued before the message, the pump would
  // issue it next anyway: issued from here it needs no pass of the network
  // thread, and whatever the kernel takes at once is on its way now. Not
  // while the caller holds the runtime's mutex itself: until it lets go,
  // nothing is sent.
  void* const network = Runtime::networkQueue();
  const bool direct = m_uQueuedSendMessages == 0 && m_bWritable && network != nullptr &&
                      platform::MutexHoldCount(Runtime::mutex()) == 1;
  m_uQueuedSendBytes += queued;
  m_uQueuedSendMessages += static_cast<unsigned int>(count);
  DataQueue* pumpFrom = first;
  if (direct) {
    Q_DLList<DataQueue>* queue = Runtime::sends();
    const std::uint64_t pass = Runtime::lastPass();
    while (pumpFrom != nullptr && issueSend(pumpFrom, 1, pass, network)) pumpFrom = queue->getNext(pumpFrom);
  }
  Runtime::sendsQueued(pumpFrom, queued);
  return direct;
}

bool N_Socket::issueSend(DataQueue* entry, unsigned count, std::uint64_t pass, void* completionQueue) {
  Q_DLList<DataQueue>* queue = Runtime::sends();
  platform::WSABUF buffers[kJoinedSends];
  DataQueue* joined = entry;
  for (unsigned i = 0; i < count; ++i, joined = queue->getNext(joined)) buffers[i] = joined->wsaBuf;
  const auto markIssued = [&] {
    DataQueue* e = entry;
    for (unsigned i = 0; i < count; ++i, e = queue->getNext(e)) e->bIssued = true;
  };
  entry->overlapped.hEvent = entry;
  entry->overlapped.Offset = count;
  platform::DWORD sent = 0;
  const int result =
      completionQueue != nullptr
          ? platform::WSASendFor(completionQueue, m_socket, buffers, count, &sent, 0, &entry->overlapped,
                                 sendComplete)
          : platform::WSASend(m_socket, buffers, count, &sent, 0, &entry->overlapped, sendComplete);
  if (result == 0) {
    markIssued();
    return true;
  }
  int error = platform::WSAGetLastError();
  if (error == platform::WSAEWOULDBLOCK) {
    // This and every later entry of the socket wait for FD_WRITE.
    m_bWritable = false;
    entry->overlapped.hEvent = nullptr;
  } else if (error == platform::WSA_IO_PENDING) {
    // Later entries wait for this one's completion.
    markIssued();
    m_bWritable = false;
    m_bWriteCompletionPending = true;
  } else {
    // Tried again on a later pass. The socket's later entries must not
    // overtake it, so they wait too.
    m_uPumpHeldPass = pass;
  }
  return false;
}

void N_Socket::sendComplete(platform::DWORD dwError, platform::DWORD cbTransferred, platform::OVERLAPPED* lpOverlapped,
                            platform::DWORD dwFlags) {
  DataQueue* entry = static_cast<DataQueue*>(lpOverlapped->hEvent);
  // The entries that went in the same WSASend follow it in the queue: only
  // their completion takes them out.
  const unsigned count = lpOverlapped->Offset > 1 ? lpOverlapped->Offset : 1;
  if (dwError != 0) {
    // The entries stay queued and aren't sent again. Marking them lets the
    // pump free them once their socket has died. One line for each, as for
    // entries sent on their own (the bytes that went count for the first).
    RuntimeLock lock;
    for (unsigned i = 0; i < count && entry != nullptr; ++i, entry = Runtime::sends()->getNext(entry)) {
      const char* text = Q_STR(
          "sendComplete: dwError = %s (%d),\n              lpOverlapped->hEvent = 0x%08X\n"
          "              cbTransferred = %d\n              dwFlags = %d\n",
          getWSErrorName(static_cast<int>(dwError)), static_cast<int>(dwError),
          static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(entry)),
          static_cast<int>(i == 0 ? cbTransferred : 0), static_cast<int>(dwFlags));
      Sys->verbose("%s", text);
      entry->bComplete = true;
    }
    return;
  }
  RuntimeLock lock;
  for (unsigned i = 0; i < count && entry != nullptr; ++i) {
    DataQueue* next = Runtime::sends()->getNext(entry);
    Q_DeleteArray(entry->pBuffer);
    entry->pBuffer = nullptr;
    entry->wsaBuf.buf = nullptr;
    N_Socket* socket = entry->pSocket;
    if (socket != nullptr && !socket->m_bWritable && socket->m_bWriteCompletionPending) {
      socket->m_bWritable = true;
      socket->m_bWriteCompletionPending = false;
    }
    if (socket != nullptr) {
      socket->m_uQueuedSendBytes -= entry->wsaBuf.len;
      --socket->m_uQueuedSendMessages;
      socket->m_uBytesSent += entry->wsaBuf.len;
      if (entry->bMessageEnd) ++socket->m_uMessagesSent;
    }
    Runtime::sendDone(entry);
    entry = next;
  }
}
