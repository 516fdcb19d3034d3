// The storage behind CUsageOrderedDict: a hash table whose entries are also
// the nodes of a doubly linked list, the usage order.  No Python type slots
// live here; module.cpp is the Python face.
//
// Data structures
//   entries_  a dense array of Entry {key, value, hash, prev, next}.  A live
//             entry has a key; a free entry (left by a removal) has none and
//             is chained through `next` from free_, so the next insertion
//             reuses it.  Links are 32-bit indices into this array, never
//             pointers, so growing the array invalidates nothing and an
//             entry is 32 bytes.
//   slots_    an open-addressing index (CPython's perturbed probe sequence)
//             of entry indices, kEmpty or kDummy.  Its size is 0 (nothing
//             allocated yet) or a power of two, and live + dummy slots stay
//             at or below two thirds of it, so every probe ends on kEmpty.
//   head_/tail_  the ends of the usage list.
//
// Measured against a ring of order records (moves and removals touching
// only the entry itself, stale records dropped lazily), the list was as
// fast or faster up to 10,000 entries and on in-order access; the ring only
// won on 100,000 entries probed in random order, where the list's two
// neighbour writes miss the cache.  The queue's traffic is mostly at the
// ends, so the list stays.
//
// Invariants
//   * used_ live entries, each referenced by exactly one slot and linked
//     exactly once between head_ and tail_; filled_ = live + dummy slots.
//   * The stored hash is the key's hash: rebuilding the index and compacting
//     never call Python code.
//   * keys_version_ changes whenever the set of keys or the layout of the
//     index changes (insert, remove, clear, rebuilds); order_version_
//     whenever the key set or the order changes.  Lookups compare the
//     former across a key's __eq__; iterators compare the latter across
//     steps.  Replacing a value in place changes neither.
//
// Reentrancy
//   Three things run arbitrary Python code: a key's __hash__, a key's __eq__
//   and dropping the last reference to a key or value (its __del__, a weakref
//   callback).  That code may use this very mapping.  So:
//   * hashing happens before any state is read;
//   * a comparison holds its own reference to the stored key and the probe
//     restarts when keys_version_ moved meanwhile (after kMaxLookupRestarts
//     restarts it gives up with RuntimeError rather than loop forever);
//   * references leave the table as py::Ref values handed back to the
//     caller (Removed, replace()), so they are dropped only after every
//     invariant holds again; clear() first moves the arrays out;
//   * nothing here allocates Python objects (the arrays come from PyMem),
//     so a structural change can never trigger the cyclic GC half-way;
//   * allocations (which may throw std::bad_alloc) come before the first
//     write of an operation, so a failure leaves the table as it was.
#pragma once

#include "host/pyref.hpp"

#include <cstdint>
#include <cstring>
#include <new>
#include <vector>

namespace uod {

// PyMem-backed allocator: the arrays show up in tracemalloc and
// sys.getsizeof, and allocating never runs Python code.
template <typename T> struct PyMemAllocator {
  using value_type = T;
  PyMemAllocator() noexcept = default;
  template <typename U> PyMemAllocator(const PyMemAllocator<U> &) noexcept {}
  T *allocate(std::size_t n) {
    if (n > static_cast<std::size_t>(PY_SSIZE_T_MAX) / sizeof(T))
      throw std::bad_alloc();
    void *p = PyMem_Malloc(n * sizeof(T));
    if (!p)
      throw std::bad_alloc();
    return static_cast<T *>(p);
  }
  void deallocate(T *p, std::size_t) noexcept { PyMem_Free(p); }
  template <typename U> bool operator==(const PyMemAllocator<U> &) const noexcept { return true; }
  template <typename U> bool operator!=(const PyMemAllocator<U> &) const noexcept { return false; }
};

using Index = std::int32_t;
inline constexpr Index kNone = -1;  // no entry: list ends, end of the free chain
inline constexpr Index kEmpty = -1; // slot unused since the last rebuild
inline constexpr Index kDummy = -2; // slot whose entry was removed

struct Entry {
  py::Ref key; // empty on free entries
  py::Ref value;
  Py_hash_t hash;
  Index prev;
  Index next; // on free entries: the next free entry
};

// The hash of a key; exact str keys use their cached hash without a call.
inline Py_hash_t hash_of(PyObject *key) {
  if (PyUnicode_CheckExact(key)) {
    Py_hash_t h = reinterpret_cast<PyASCIIObject *>(key)->hash;
    if (h != -1)
      return h;
  }
  return py::hash(py::Borrowed(key));
}

class Table {
public:
  // Where a lookup ended.  Found: ix and its slot.  Absent: ix == kNone and
  // slot is where the key would go (the first dummy on its probe sequence,
  // or the empty slot that ended it).
  struct Found {
    std::size_t slot;
    Index ix;
  };
  // What a removal took out; the caller drops it once the table is sound.
  struct Removed {
    py::Ref key;
    py::Ref value;
  };

  // A lookup that sees the key set change this many times gives up.
  static constexpr int kMaxLookupRestarts = 64;
  // Entry indices must fit in Index with room to spare for the index size.
  static constexpr Py_ssize_t kMaxEntries = Py_ssize_t(1) << 30;

  Table() noexcept = default;
  Table(const Table &) = delete;
  Table &operator=(const Table &) = delete;

  Py_ssize_t size() const noexcept { return used_; }
  Index head() const noexcept { return head_; }
  Index tail() const noexcept { return tail_; }
  const Entry &entry(Index ix) const noexcept { return entries_[ix]; }
  std::uint64_t order_version() const noexcept { return order_version_; }

  // May run the keys' __eq__; throws py::PyError when one raises.
  inline Found lookup(PyObject *key, Py_hash_t hash);

  // Move entry ix to the front or the back.
  inline void move_to(Index ix, bool front) noexcept;
  // Give entry ix a new value and move it to one end; returns the old value
  // for the caller to drop.
  inline py::Ref replace(Index ix, PyObject *value, bool front) noexcept;
  // Add a key that `where`, a lookup of it after which no Python code ran,
  // found absent.  Throws std::bad_alloc or py::PyError (table full) before
  // changing anything.
  void insert(Found where, PyObject *key, PyObject *value, Py_hash_t hash, bool front);
  // Take out the entry that `where` found (no Python code may have run since).
  Removed remove(Found where) noexcept;
  // Empty the table; the old contents are dropped after it is empty again.
  void clear() noexcept;

  int traverse(visitproc visit, void *arg) const;
  // Bytes of our own arrays, for __sizeof__.
  std::size_t allocated_bytes() const noexcept {
    return entries_.capacity() * sizeof(Entry) + slots_.capacity() * sizeof(Index);
  }

private:
  enum class Match { kNo, kYes, kChanged };

  inline bool probe(PyObject *key, Py_hash_t hash, Found &out);
  Match compare_slow(PyObject *stored, PyObject *key);
  [[noreturn]] static void throw_mutated();

  inline void unlink(Index ix) noexcept;
  inline void link(Index ix, bool front) noexcept;

  static std::size_t slots_for(Py_ssize_t n) noexcept;
  void rebuild_slots(std::size_t new_size);
  void maybe_shrink() noexcept;
  void compact(std::size_t capacity);

  std::vector<Entry, PyMemAllocator<Entry>> entries_;
  std::vector<Index, PyMemAllocator<Index>> slots_;
  Index head_ = kNone;
  Index tail_ = kNone;
  Index free_ = kNone;
  Py_ssize_t used_ = 0;
  Py_ssize_t filled_ = 0;
  std::uint64_t keys_version_ = 0;
  std::uint64_t order_version_ = 0;
};

// ---- hot path, inline ----------------------------------------------------

inline bool unicode_equal(PyObject *a, PyObject *b) noexcept {
  const Py_ssize_t n = PyUnicode_GET_LENGTH(a);
  if (n != PyUnicode_GET_LENGTH(b))
    return false;
  const int kind = PyUnicode_KIND(a);
  if (kind != static_cast<int>(PyUnicode_KIND(b)))
    return false;
  return std::memcmp(PyUnicode_DATA(a), PyUnicode_DATA(b), static_cast<std::size_t>(n) * kind) == 0;
}

inline Table::Found Table::lookup(PyObject *key, Py_hash_t hash) {
  Found found;
  for (int restarts = 0; !probe(key, hash, found);)
    if (++restarts > kMaxLookupRestarts)
      throw_mutated();
  return found;
}

// One pass along the probe sequence.  Returns false when a key's __eq__
// changed the key set, in which case nothing read so far can be trusted.
inline bool Table::probe(PyObject *key, Py_hash_t hash, Found &out) {
  out.ix = kNone;
  out.slot = 0;
  if (slots_.empty())
    return true;
  const std::size_t mask = slots_.size() - 1;
  std::size_t perturb = static_cast<std::size_t>(hash);
  std::size_t i = perturb & mask;
  std::size_t first_dummy = SIZE_MAX;
  for (;;) {
    const Index ix = slots_[i];
    if (ix >= 0) {
      const Entry &e = entries_[ix];
      PyObject *stored = e.key.get();
      if (stored == key) {
        out = {i, ix};
        return true;
      }
      if (e.hash == hash) {
        if (PyUnicode_CheckExact(stored) && PyUnicode_CheckExact(key)) {
          // str == str runs no Python code: no reentrancy to guard against.
          if (unicode_equal(stored, key)) {
            out = {i, ix};
            return true;
          }
        } else {
          switch (compare_slow(stored, key)) {
          case Match::kYes:
            out = {i, ix};
            return true;
          case Match::kChanged:
            return false;
          case Match::kNo:
            break;
          }
        }
      }
    } else if (ix == kEmpty) {
      out.slot = first_dummy != SIZE_MAX ? first_dummy : i;
      return true;
    } else if (first_dummy == SIZE_MAX) {
      first_dummy = i;
    }
    perturb >>= 5;
    i = (i * 5 + perturb + 1) & mask;
  }
}

inline void Table::unlink(Index ix) noexcept {
  const Entry &e = entries_[ix];
  if (e.prev != kNone)
    entries_[e.prev].next = e.next;
  else
    head_ = e.next;
  if (e.next != kNone)
    entries_[e.next].prev = e.prev;
  else
    tail_ = e.prev;
}

inline void Table::link(Index ix, bool front) noexcept {
  Entry &e = entries_[ix];
  if (front) {
    e.prev = kNone;
    e.next = head_;
    if (head_ != kNone)
      entries_[head_].prev = ix;
    else
      tail_ = ix;
    head_ = ix;
  } else {
    e.next = kNone;
    e.prev = tail_;
    if (tail_ != kNone)
      entries_[tail_].next = ix;
    else
      head_ = ix;
    tail_ = ix;
  }
}

inline void Table::move_to(Index ix, bool front) noexcept {
  if ((front ? head_ : tail_) == ix)
    return; // already there: the order, and so any iteration, is undisturbed
  unlink(ix);
  link(ix, front);
  ++order_version_;
}

inline py::Ref Table::replace(Index ix, PyObject *value, bool front) noexcept {
  py::Ref old = py::Ref::borrow(value);
  entries_[ix].value.swap(old);
  move_to(ix, front);
  return old;
}

} // namespace uod
