// Internal to the library: counted allocation of objects and arrays.
//
// Objects come from the global operator new (the nothrow form, which draws on
// the plain one), so code that didn't make them may still `delete` them; the
// count then goes amiss but the heap stays sound. Every allocation is counted
// in Q_Memory::sm_iNewCount, also one that gave nothing, and every release in
// sm_iDeleteCount. An allocation that gives nothing, or that the allocation
// fault of the platform layer refuses, throws Q_MemoryException_Allocation*.
#pragma once

#include <cstddef>
#include <new>
#include <utility>

#include "Q_Memory.h"
#include "Q_Throw.h"
#include "fault.h"

// A new T made from `a`. If T's constructor throws, its storage is given back,
// the exception passes on, and nothing is counted.
template <class T, class... A>
T* Q_New(A&&... a) {
  T* p = platform::fault::allocationShouldFail() ? nullptr : ::new (std::nothrow) T(std::forward<A>(a)...);
  Q_Memory::sm_iNewCount.fetch_add(1, std::memory_order_relaxed);
  if (p == nullptr) Q_ThrowAllocation();
  return p;
}

// Deletes what Q_New made. Null does nothing and isn't counted.
template <class T>
void Q_Delete(T* p) {
  if (p == nullptr) return;
  ::delete p;
  Q_Memory::sm_iDeleteCount.fetch_add(1, std::memory_order_relaxed);
}

// `n` default-initialised T: built-in types and plain records hold whatever
// was there, as buffers that are filled at once should.
template <class T>
T* Q_NewArray(std::size_t n) {
  T* p = platform::fault::allocationShouldFail() ? nullptr : ::new (std::nothrow) T[n];
  Q_Memory::sm_iNewCount.fetch_add(1, std::memory_order_relaxed);
  if (p == nullptr) Q_ThrowAllocation();
  return p;
}

// Deletes what Q_NewArray made. Null does nothing and isn't counted.
template <class T>
void Q_DeleteArray(T* p) {
  if (p == nullptr) return;
  ::delete[] p;
  Q_Memory::sm_iDeleteCount.fetch_add(1, std::memory_order_relaxed);
}
