/// @class Q_DLList
/// The library's one container: a doubly linked list with a sentinel at each
/// end, whose elements are known by the address of their data. That address
/// stays the same while the element is on the list, so whoever keeps it can
/// remove the element later without a search.
///
/// Each node is one counted allocation (Q_Memory): the two links, then the
/// element. Elements are raw storage: no constructor or destructor of T runs,
/// so a list of pointers holds the pointer and a list of records holds fields
/// that the user fills one by one after append().
///
/// The fields are public, like those of the library's other plain records:
/// owners read m_iCount, and tests look at the cache. Only the operations
/// should change them. The list has no lock; getAt() moves the cache, so it
/// counts as a write: one thread at a time, also for reading.
#pragma once

#include <cstddef>
#include <cstdint>
#include <new>
#include <type_traits>

#include "Q_Memory.h"

/// The link part of a node. Both links are null in the outer side of each
/// sentinel and in a node that is on no list.
class Q_DLListBaseNode {
 public:
  Q_DLListBaseNode* m_pPrev;  ///< The node before; null before the head sentinel.
  Q_DLListBaseNode* m_pNext;  ///< The node after; null after the tail sentinel.
};

/// The operations and fields of Q_DLList (see there); `N` is the link part of
/// a node.

template <class T, class N = Q_DLListBaseNode>
class Q_DLListBase {
  static_assert(std::is_trivially_destructible_v<T>, "elements are raw storage and are never destroyed");
  static_assert(alignof(T) <= __STDCPP_DEFAULT_NEW_ALIGNMENT__, "nodes come from Q_Memory::allocate");

 public:
  /// m_iCacheIndex when the cache holds nothing.
  static constexpr std::int32_t kInvalidCacheIndex = 0x7fffffff;

  /// An empty list.
  Q_DLListBase() { initialize(); }
  /// Frees the spare blocks and every node still on the list, each counted.
  /// What elements point at is the owner's to free.
  virtual ~Q_DLListBase() { freeAll(); }

  /// Not copyable: the nodes have one owner.
  Q_DLListBase(const Q_DLListBase&) = delete;
  /// Not assignable.
  Q_DLListBase& operator=(const Q_DLListBase&) = delete;

  /// A new node with its links null, on no list; gives the data pointer.
  /// @throws Q_MemoryException_Allocation* if there is no memory.
  virtual T* allocateNode() {
    void* raw = Q_Memory::allocate(kDataOffset + sizeof(T));
    N* node = ::new (raw) N;
    node->m_pPrev = nullptr;
    node->m_pNext = nullptr;
    return dataOf(node);
  }

  /// Frees the node of `data`, which must be on no list.
  virtual void freeNode(T* data) { Q_Memory::release(nodeOf(data)); }

  /// The first element; null when the list is empty.
  T* getFirst() { return isElement(m_head.m_pNext) ? dataOf(m_head.m_pNext) : nullptr; }

  /// The element after `data`, or null after the last one.
  T* getNext(T* data) {
    N* next = nodeOf(data)->m_pNext;
    return isElement(next) ? dataOf(next) : nullptr;
  }

  /// The element at `index`, from 0. An index outside 0..m_iCount-1 gives null
  /// and leaves the cache alone.
  ///
  /// The cache remembers the element the last call gave, so walking by rising
  /// index costs one step a call. Each call starts from whichever of the
  /// cache, the head and the tail is nearest: a tie between the cache and an
  /// end goes to the cache, a tie between the two ends goes to the tail.
  T* getAt(int index) {
    if (index < 0 || index >= m_iCount) return nullptr;
    if (m_iCacheIndex == kInvalidCacheIndex) {
      m_iCacheIndex = 0;
      m_pCacheData = getFirst();
    }
    int fromCache = index > m_iCacheIndex ? index - m_iCacheIndex : m_iCacheIndex - index;
    int fromHead = index;
    int fromTail = m_iCount - index - 1;
    int nearestEnd = fromHead < fromTail ? fromHead : fromTail;
    if (fromCache > nearestEnd) {
      if (fromHead < fromTail) {
        m_iCacheIndex = 0;
        m_pCacheData = getFirst();
      } else {
        m_iCacheIndex = m_iCount - 1;
        m_pCacheData = getLast();
      }
    }
    while (m_iCacheIndex > index) {
      m_pCacheData = dataOf(nodeOf(m_pCacheData)->m_pPrev);
      --m_iCacheIndex;
    }
    while (m_iCacheIndex < index) {
      m_pCacheData = dataOf(nodeOf(m_pCacheData)->m_pNext);
      ++m_iCacheIndex;
    }
    return m_pCacheData;
  }

  /// A new element at the tail, its storage unset. Elements only come in at
  /// the tail, so every list is in order of arrival.
  /// @throws Q_MemoryException_Allocation* if there is no memory; the list is
  /// unchanged then.
  T* append() {
    T* data = allocateNode();
    N* node = nodeOf(data);
    node->m_pPrev = m_tail.m_pPrev;
    node->m_pNext = &m_tail;
    m_tail.m_pPrev->m_pNext = node;
    m_tail.m_pPrev = node;
    ++m_iCount;
    m_iCacheIndex = kInvalidCacheIndex;
    return data;
  }

  /// Takes the element off the list and frees its node; nothing that the
  /// element points at is touched. A walk that removes as it goes takes
  /// getNext() first.
  void remove(T* data) {
    unlink(nodeOf(data));
    freeNode(data);
  }

  N m_head;  ///< Head sentinel. m_pNext: first node, or the tail sentinel when empty.
  N m_tail;  ///< Tail sentinel. m_pPrev: last node, or the head sentinel when empty.
  std::int32_t m_iCount;       ///< Elements on the list.
  std::int32_t m_iCacheIndex;  ///< Index of m_pCacheData, or kInvalidCacheIndex.
  T* m_pCacheData;             ///< The element getAt() gave last.
  /// Unused by the list itself; if set, it must come from Q_Memory::allocate,
  /// and the destructors release it.
  void* m_pSpareA;
  void* m_pSpareB;  ///< As m_pSpareA.

 protected:
  /// The element storage begins after the links, at T's alignment.
  static constexpr std::size_t kDataOffset = (sizeof(N) + alignof(T) - 1) / alignof(T) * alignof(T);

  /// The data of `node`.
  static T* dataOf(N* node) { return reinterpret_cast<T*>(reinterpret_cast<unsigned char*>(node) + kDataOffset); }
  /// The node that holds `data`.
  static N* nodeOf(T* data) {
    return std::launder(reinterpret_cast<N*>(reinterpret_cast<unsigned char*>(data) - kDataOffset));
  }

  /// The last element; null when the list is empty.
  T* getLast() { return isElement(m_tail.m_pPrev) ? dataOf(m_tail.m_pPrev) : nullptr; }

  /// What both destructors do, and what a subclass that overrides freeNode()
  /// must call in its own destructor: by the time a base destructor runs, the
  /// override is no longer reached.
  void freeAll() {
    Q_Memory::release(m_pSpareA);
    m_pSpareA = nullptr;
    Q_Memory::release(m_pSpareB);
    m_pSpareB = nullptr;
    while (T* first = getFirst()) remove(first);
  }

 private:
  // A node that isn't a sentinel has both links set.
  static bool isElement(const N* node) { return node->m_pPrev != nullptr && node->m_pNext != nullptr; }

  void initialize() {
    m_head.m_pPrev = nullptr;
    m_head.m_pNext = &m_tail;
    m_tail.m_pPrev = &m_head;
    m_tail.m_pNext = nullptr;
    m_iCount = 0;
    m_iCacheIndex = kInvalidCacheIndex;
    m_pCacheData = nullptr;
    m_pSpareA = nullptr;
    m_pSpareB = nullptr;
  }

  void unlink(N* node) {
    node->m_pPrev->m_pNext = node->m_pNext;
    node->m_pNext->m_pPrev = node->m_pPrev;
    node->m_pPrev = nullptr;
    node->m_pNext = nullptr;
    --m_iCount;
    m_iCacheIndex = kInvalidCacheIndex;
  }
};

template <class T>
class Q_DLList : public Q_DLListBase<T, Q_DLListBaseNode> {
 public:
  /// An empty list.
  Q_DLList() = default;
  /// Frees every node still on the list (Q_DLListBase::freeAll).
  ~Q_DLList() override { this->freeAll(); }
};
