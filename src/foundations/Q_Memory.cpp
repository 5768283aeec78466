#include "Q_Memory.h"

#include <new>

#include "Q_Throw.h"
#include "fault.h"

std::atomic<int> Q_Memory::sm_iNewCount{0};
std::atomic<int> Q_Memory::sm_iDeleteCount{0};

void* Q_Memory::allocate(std::size_t bytes) {
  char* p = platform::fault::allocationShouldFail() ? nullptr : new (std::nothrow) char[bytes];
  sm_iNewCount.fetch_add(1, std::memory_order_relaxed);
  if (p == nullptr) Q_ThrowAllocation();
  return p;
}

void Q_Memory::release(void* p) {
  if (p == nullptr) return;
  delete[] static_cast<char*>(p);
  sm_iDeleteCount.fetch_add(1, std::memory_order_relaxed);
}
