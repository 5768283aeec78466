/// @class Q_Memory
/// Allocation counters and the raw allocation that the library's containers
/// use. Every allocation and release of the library's own objects is counted,
/// so a test can check that they balance. Every member may be used from any
/// thread.
#pragma once

#include <atomic>
#include <cstddef>

#include "vardel_export.h"

class VARDEL_API Q_Memory {
 public:
  /// One more for every allocation, also one that gave nothing. Atomic:
  /// resolver threads and the network thread allocate beside the
  /// application's threads. Nothing in the library reads the counters.
  static std::atomic<int> sm_iNewCount;
  /// One more for every release; see sm_iNewCount.
  static std::atomic<int> sm_iDeleteCount;

  /// `bytes` of uninitialised storage, aligned for any standard type.
  /// @throws Q_MemoryException_Allocation* if there is none (or an injected
  /// allocation fault says so); it never returns null.
  static void* allocate(std::size_t bytes);
  /// Gives back what allocate gave. Null is allowed and does nothing.
  static void release(void* p);
};
