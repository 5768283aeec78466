// Allocation counters and the raw allocation that the library's containers
// use. Every allocation and release of the library's own objects is counted,
// so a test can check that they balance.
#pragma once

#include <atomic>
#include <cstddef>

#include "vardel_export.h"

class VARDEL_API Q_Memory {
 public:
  // One more for every allocation, also one that gave nothing; one more for
  // every release. Atomic: resolver threads and the network thread allocate
  // beside the application's threads. Nothing in the library reads them.
  static std::atomic<int> sm_iNewCount;
  static std::atomic<int> sm_iDeleteCount;

  // `bytes` of uninitialised storage, aligned for any standard type. Throws
  // Q_MemoryException_Allocation* if there is none (or an injected allocation
  // fault says so); it never returns null.
  static void* allocate(std::size_t bytes);
  // Gives back what allocate gave. Null is allowed and does nothing.
  static void release(void* p);
};
