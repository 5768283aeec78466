// Internal to the library: a record appended to one of the data queues with
// every field set, owning nothing yet; the caller hands it its buffer.
#pragma once

#include <cstring>

#include "N_Socket.h"
#include "Q_DLList.h"

inline N_Socket::DataQueue* appendEntry(Q_DLList<N_Socket::DataQueue>* queue, N_Socket* socket, bool issued,
                                        bool complete) {
  N_Socket::DataQueue* entry = queue->append();
  entry->pBuffer = nullptr;
  entry->wsaBuf.len = 0;
  entry->wsaBuf.buf = nullptr;
  std::memset(&entry->overlapped, 0, sizeof entry->overlapped);
  entry->bIssued = issued;
  entry->bComplete = complete;
  entry->bConsumed = false;
  entry->bLive = true;
  entry->bMessageEnd = false;
  entry->bDirect = false;
  entry->pSocket = socket;
  return entry;
}
