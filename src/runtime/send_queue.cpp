// The send queue: what send() appends, what the network thread's pump
// issues, and what completions and destroyed sockets take out. Every rule
// about the queue's order, its byte count and where the pump starts is
// here. All of it runs with the runtime's mutex held.
#include <cstdint>

#include "N_Initializer.h"
#include "N_Socket.h"
#include "Q_New.h"
#include "Runtime.h"
#include "data_queue.h"
#include "win32.h"
#include "winsock.h"

// The queue keeps two facts beside its entries, so that neither the pump nor
// the byte count walks the whole backlog: every entry before m_pPumpFrom is
// issued and live (null: no entry needs the pump), and m_uBytesWaitingForSend
// is the sum of wsaBuf.len over the queue.

N_Socket::DataQueue* Runtime::appendSend(N_Socket* socket) {
  return appendEntry(N_Initializer::m_pOutProcessQueue, socket, false, false);
}

void Runtime::dropSends(N_Socket::DataQueue* first) {
  Q_DLList<N_Socket::DataQueue>* queue = N_Initializer::m_pOutProcessQueue;
  while (first != nullptr) {
    N_Socket::DataQueue* next = queue->getNext(first);
    Q_DeleteArray(first->pBuffer);
    queue->remove(first);
    first = next;
  }
}

void Runtime::sendsQueued(N_Socket::DataQueue* pumpFrom, unsigned bytes) {
  N_Initializer::m_uBytesWaitingForSend += bytes;
  if (pumpFrom == nullptr) return;  // issued already: their completions come without a pass
  if (N_Initializer::m_pPumpFrom == nullptr) N_Initializer::m_pPumpFrom = pumpFrom;
  wake();
}

bool& Runtime::released() {
  static bool set = false;
  return set;
}

void*& Runtime::networkQueue() {
  static void* queue = nullptr;
  return queue;
}

void Runtime::sendDone(N_Socket::DataQueue* entry) {
  N_Initializer::m_uBytesWaitingForSend -= entry->wsaBuf.len;
  if (N_Initializer::m_pPumpFrom == entry) N_Initializer::m_pPumpFrom = N_Initializer::m_pOutProcessQueue->getNext(entry);
  N_Initializer::m_pOutProcessQueue->remove(entry);
}

void Runtime::orphan(const N_Socket* socket) {
  for (auto* queue : {N_Initializer::m_pInProcessQueue, N_Initializer::m_pOutProcessQueue}) {
    if (queue == nullptr) continue;
    for (N_Socket::DataQueue* entry = queue->getFirst(); entry != nullptr; entry = queue->getNext(entry)) {
      if (entry->pSocket == socket) {
        entry->bLive = false;
        entry->pSocket = nullptr;
      }
    }
  }
  // Orphans may now stand anywhere in the send queue: the pump looks at all.
  if (N_Initializer::m_pOutProcessQueue != nullptr)
    N_Initializer::m_pPumpFrom = N_Initializer::m_pOutProcessQueue->getFirst();
}

void N_Initializer::pumpSends() {
  // Numbers the passes, for the statistics and so that a socket can be held
  // for the rest of one without a walk to clear the marks (64 bits never
  // wrap back to 0, which is no pass).
  const std::uint64_t pass = ++m_uNetworkPasses;
  Q_DLList<N_Socket::DataQueue>* queue = m_pOutProcessQueue;
  // Entries before m_pPumpFrom are issued and live: only their completions
  // can change them, so the walk starts behind them.
  N_Socket::DataQueue* entry = m_pPumpFrom;
  N_Socket::DataQueue* firstUnsettled = nullptr;
  while (entry != nullptr) {
    N_Socket::DataQueue* next = queue->getNext(entry);
    N_Socket* socket = entry->pSocket;
    if (socket == nullptr) {
      // An orphan. One whose WSASend is still out stays until its
      // completion: Winsock names its overlapped until then. One whose
      // completion failed is marked complete and can go.
      if (!entry->bIssued || entry->bComplete) {
        m_uBytesWaitingForSend -= entry->wsaBuf.len;
        Q_DeleteArray(entry->pBuffer);
        entry->pBuffer = nullptr;
        entry->wsaBuf.buf = nullptr;
        queue->remove(entry);
        entry = nullptr;
      }
    } else if (!entry->bIssued && socket->m_bWritable && socket->m_uPumpHeldPass != pass) {
      // The socket's entries that follow go in the same WSASend, up to its
      // eight buffers; not on UDP, where each WSASend is one datagram.
      N_Socket::DataQueue* last = entry;
      unsigned count = 1;
      while (socket->m_socketType == N_Socket::SOCKET_TCP && count < N_Socket::kJoinedSends) {
        N_Socket::DataQueue* more = queue->getNext(last);
        if (more == nullptr || more->pSocket != socket || more->bIssued) break;
        last = more;
        ++count;
      }
      socket->issueSend(entry, count, pass, nullptr);
      next = queue->getNext(last);
    }
    if (entry != nullptr && firstUnsettled == nullptr && (!entry->bIssued || entry->pSocket == nullptr))
      firstUnsettled = entry;
    entry = next;
  }
  m_pPumpFrom = firstUnsettled;
}
