// N_Client's payload queues: keyed replacement, priority batches, pacing.
#include <cstdlib>
#include <cstring>

#include "N_Client.h"
#include "Q_New.h"
#include "Q_Throw.h"

namespace {

// Frees the flush's two scratch arrays however the flush ends.
struct FlushScratch {
  N_Client::DataQueue** order = nullptr;
  char* batch = nullptr;
  ~FlushScratch() {
    Q_DeleteArray(batch);
    Q_DeleteArray(order);
  }
};

}  // namespace

void N_Client::queueReliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority) {
  queuePayload(m_pReliableQueue, m_uReliableBytes, m_reliableQueueStats, pPayload, uSize, uKey, uPriority);
}

void N_Client::queueUnreliable(void* pPayload, unsigned uSize, unsigned uKey, unsigned uPriority) {
  queuePayload(m_pUnreliableQueue, m_uUnreliableBytes, m_unreliableQueueStats, pPayload, uSize, uKey, uPriority);
}

void N_Client::flushReliable() { flushQueue(m_pReliableQueue, m_uReliableBytes, m_pTcpSocket, false); }

void N_Client::flushUnreliable() { flushQueue(m_pUnreliableQueue, m_uUnreliableBytes, m_pUdpSocket, true); }

void N_Client::clearReliable() { clearQueue(m_pReliableQueue, m_uReliableBytes); }

void N_Client::clearUnreliable() { clearQueue(m_pUnreliableQueue, m_uUnreliableBytes); }

unsigned N_Client::getReliableBytesWaiting() const { return m_uReliableBytes; }

unsigned N_Client::getUnreliableBytesWaiting() const { return m_uUnreliableBytes; }

void N_Client::queuePayload(Q_DLList<DataQueue>* queue, unsigned& bytes, N_QueueStats& stats, void* pPayload,
                            unsigned uSize, unsigned uKey, unsigned uPriority) {
  // Four seconds of data at the rate in force. The bytes of an entry about
  // to be replaced still count here, so a replacement near the limit throws
  // even when the new payload is smaller.
  if (uSize + bytes > m_uBandwidth * 4u) {
    // An unconstructed object counts nothing (its statistics are all 0).
    if (m_bConstructed) ++stats.uPayloadsRefused;
    Q_ThrowPacketsStackingUp();
  }
  if (queue == nullptr) return;

  // The copy comes first: if it fails, the queue is untouched.
  char* copy = Q_NewArray<char>(uSize);
  if (uSize > 0) std::memcpy(copy, pPayload, uSize);

  DataQueue* entry = nullptr;
  if (uKey != 0) {
    for (DataQueue* e = queue->getFirst(); e != nullptr; e = queue->getNext(e)) {
      if (e->uKey == uKey) {
        entry = e;
        break;
      }
    }
  }
  if (entry != nullptr) {
    // Replaced in place: the entry keeps its position in the list.
    Q_DeleteArray(entry->pData);
    bytes -= entry->uSize;
    ++stats.uPayloadsReplaced;
  } else {
    try {
      entry = queue->append();
    } catch (...) {
      Q_DeleteArray(copy);
      throw;
    }
  }
  entry->bFlushed = false;
  entry->uKey = uKey;
  entry->uPriority = uPriority;
  entry->age.reset();
  entry->uSize = uSize;
  entry->pData = copy;
  bytes += uSize;
  ++stats.uPayloadsQueued;
}

int N_Client::flushCompareQSort(const void* a, const void* b) {
  const DataQueue* first = *static_cast<DataQueue* const*>(a);
  const DataQueue* second = *static_cast<DataQueue* const*>(b);
  if (first->uPriority > second->uPriority) return -1;
  if (first->uPriority < second->uPriority) return 1;
  return 0;
}

void N_Client::flushQueue(Q_DLList<DataQueue>* queue, unsigned& bytes, N_Socket* socket, bool unreliable) {
  if (queue == nullptr || queue->getFirst() == nullptr) return;
  // No rate, no data: the pacing below would divide by zero.
  if (m_uBandwidth == 0) return;
  // One gate for both queues, so both together stay within the bandwidth.
  if (m_sendTimer.getAge() < m_fNextFlushTime) return;

  const int count = queue->m_iCount;
  FlushScratch scratch;
  scratch.order = Q_NewArray<DataQueue*>(static_cast<std::size_t>(count));
  // The buffer is sized in 64 bits: the 32-bit queue count can wrap for
  // payloads near 4 GiB, the buffer must not.
  std::size_t total = 0;
  int n = 0;
  for (DataQueue* e = queue->getFirst(); e != nullptr && n < count; e = queue->getNext(e)) {
    scratch.order[n++] = e;
    total += e->uSize;
  }
  std::qsort(scratch.order, static_cast<std::size_t>(n), sizeof(DataQueue*), flushCompareQSort);
  scratch.batch = Q_NewArray<char>(total);

  // A quarter of a second of data per batch, and on UDP less than one
  // datagram. Both limits are strict; the first entry is exempt from them,
  // so even an entry above the budget leaves, alone.
  const unsigned budget = m_uBandwidth >> 2;
  const int packetLimit = unreliable ? socket->getMaximumSendPacketSize() : 0;
  unsigned taken = 0;
  std::size_t offset = 0;
  for (int i = 0; i < n; ++i) {
    DataQueue* e = scratch.order[i];
    if (i > 0) {
      if (taken + e->uSize >= budget) continue;
      if (unreliable && taken + e->uSize >= static_cast<unsigned>(packetLimit)) continue;
    }
    if (e->uSize > 0) std::memcpy(scratch.batch + offset, e->pData, e->uSize);
    offset += e->uSize;
    taken += e->uSize;
    e->bFlushed = true;
  }

  // The gate opens again once these bytes have had their time at the rate
  // in force; the quotient and sum are taken in double, stored as float.
  m_fNextFlushTime = static_cast<float>(static_cast<double>(m_sendTimer.getAge()) +
                                        static_cast<double>(static_cast<int>(taken)) /
                                            static_cast<double>(static_cast<int>(m_uBandwidth)));

  for (DataQueue* e = queue->getFirst(); e != nullptr;) {
    DataQueue* next = queue->getNext(e);
    if (e->bFlushed) {
      bytes -= e->uSize;
      Q_DeleteArray(e->pData);
      queue->remove(e);
    }
    e = next;
  }

  if (taken > 0) socket->send(scratch.batch, taken);
}

void N_Client::clearQueue(Q_DLList<DataQueue>* queue, unsigned& bytes) {
  bytes = 0;
  if (queue == nullptr) return;
  while (DataQueue* e = queue->getFirst()) {
    Q_DeleteArray(e->pData);
    queue->remove(e);
  }
}
