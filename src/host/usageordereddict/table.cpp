// The cold half of Table: insertion, removal, clearing, and the rebuilds
// that keep the index sparse and the entry array dense.  See table.hpp for
// the structures and their invariants.
//
// Sizing policy
//   * Index: rebuilt when an insertion would take live + dummy slots past
//     two thirds; the new size is the smallest power of two >= twice the
//     live count, so steady insert/remove churn rebuilds at the same size
//     (dropping dummies) and growth doubles.
//   * Entries: grow by half when no free entry is left.  When removals leave
//     the array at most one eighth full (and past kShrinkFloor), it is
//     compacted into list order, which also makes iteration walk memory
//     forwards.
//   Each rebuild costs O(size) and follows Omega(size) operations, so every
//   operation stays amortised constant time.
#include "host/usageordereddict/table.hpp"

#include "host/usageordereddict/messages.hpp"

#include <algorithm>

namespace uod {

namespace {
constexpr std::size_t kMinSlots = 8;
constexpr std::size_t kMinEntries = 8;
constexpr std::size_t kShrinkFloor = 64;

inline std::size_t first_probe(Py_hash_t hash, std::size_t mask, std::size_t &perturb) {
  perturb = static_cast<std::size_t>(hash);
  return perturb & mask;
}
inline std::size_t next_probe(std::size_t i, std::size_t mask, std::size_t &perturb) {
  perturb >>= 5;
  return (i * 5 + perturb + 1) & mask;
}
// The first empty slot on hash's probe sequence (the index must have one).
template <typename Slots> std::size_t empty_slot(const Slots &slots, Py_hash_t hash) {
  const std::size_t mask = slots.size() - 1;
  std::size_t perturb;
  std::size_t i = first_probe(hash, mask, perturb);
  while (slots[i] != kEmpty)
    i = next_probe(i, mask, perturb);
  return i;
}
} // namespace

Table::Match Table::compare_slow(PyObject *stored, PyObject *key) {
  const std::uint64_t version = keys_version_;
  // __eq__ may remove the entry and with it the table's reference.
  py::Ref hold = py::Ref::borrow(stored);
  const int r = PyObject_RichCompareBool(hold.get(), key, Py_EQ);
  if (r < 0)
    py::throw_error();
  // If the key set is unchanged the entry still owns `stored`, so dropping
  // `hold` below cannot run any code.
  if (keys_version_ != version)
    return Match::kChanged;
  return r ? Match::kYes : Match::kNo;
}

void Table::throw_mutated() {
  PyErr_SetString(PyExc_RuntimeError, msg::kMutatedDuringLookup);
  py::throw_error();
}

std::size_t Table::slots_for(Py_ssize_t n) noexcept {
  std::size_t size = kMinSlots;
  while (size < 2 * static_cast<std::size_t>(n))
    size <<= 1;
  return size;
}

void Table::insert(Found where, PyObject *key, PyObject *value, Py_hash_t hash, bool front) {
  if (used_ >= kMaxEntries) {
    PyErr_SetString(PyExc_OverflowError, msg::kFull);
    py::throw_error();
  }
  // Allocate first: each step may throw and leaves a sound table behind.
  std::size_t slot = where.slot;
  if (static_cast<std::size_t>(filled_ + 1) * 3 > slots_.size() * 2) {
    rebuild_slots(slots_for(used_ + 1));
    slot = empty_slot(slots_, hash);
  }
  if (free_ == kNone && entries_.size() == entries_.capacity()) {
    const std::size_t cap = entries_.capacity();
    entries_.reserve(cap < kMinEntries ? kMinEntries : cap + cap / 2);
  }

  // Nothing below throws.
  Index ix;
  if (free_ != kNone) {
    ix = free_;
    Entry &e = entries_[ix];
    free_ = e.next;
    e.key = py::Ref::borrow(key);
    e.value = py::Ref::borrow(value);
    e.hash = hash;
  } else {
    ix = static_cast<Index>(entries_.size());
    entries_.push_back(Entry{py::Ref::borrow(key), py::Ref::borrow(value), hash, kNone, kNone});
  }
  if (slots_[slot] == kEmpty)
    ++filled_;
  slots_[slot] = ix;
  link(ix, front);
  ++used_;
  ++keys_version_;
  ++order_version_;
}

Table::Removed Table::remove(Found where) noexcept {
  const Index ix = where.ix;
  unlink(ix);
  slots_[where.slot] = kDummy;
  Entry &e = entries_[ix];
  Removed out{std::move(e.key), std::move(e.value)};
  e.prev = kNone;
  e.next = free_;
  free_ = ix;
  --used_;
  ++keys_version_;
  ++order_version_;
  maybe_shrink();
  return out;
}

void Table::clear() noexcept {
  // Swap the arrays out before dropping anything: a __del__ run by the
  // drop may use this table, and must find it empty and sound.
  std::vector<Entry, PyMemAllocator<Entry>> old_entries;
  std::vector<Index, PyMemAllocator<Index>> old_slots;
  old_entries.swap(entries_);
  old_slots.swap(slots_);
  head_ = tail_ = free_ = kNone;
  used_ = filled_ = 0;
  ++keys_version_;
  ++order_version_;
}

int Table::traverse(visitproc visit, void *arg) const {
  for (const Entry &e : entries_) {
    if (int r = e.key.visit(visit, arg))
      return r;
    if (int r = e.value.visit(visit, arg))
      return r;
  }
  return 0;
}

void Table::rebuild_slots(std::size_t new_size) {
  std::vector<Index, PyMemAllocator<Index>> fresh(new_size, kEmpty);
  for (std::size_t ix = 0; ix < entries_.size(); ++ix)
    if (entries_[ix].key)
      fresh[empty_slot(fresh, entries_[ix].hash)] = static_cast<Index>(ix);
  slots_.swap(fresh);
  filled_ = used_;
  ++keys_version_;
}

void Table::maybe_shrink() noexcept {
  const std::size_t cap = entries_.capacity();
  if (cap <= kShrinkFloor || static_cast<std::size_t>(used_) * 8 > cap)
    return;
  try {
    compact(std::max(kMinEntries, static_cast<std::size_t>(used_) * 2));
  } catch (const std::bad_alloc &) {
    // Keep the larger arrays; they are still a sound table.
  }
}

void Table::compact(std::size_t capacity) {
  std::vector<Entry, PyMemAllocator<Entry>> fresh;
  std::vector<Index, PyMemAllocator<Index>> fresh_slots;
  if (used_ > 0) {
    fresh.reserve(capacity);
    fresh_slots.assign(slots_for(used_), kEmpty);
  }
  // From here on nothing throws: push_back stays within the reservation.
  // Entry n of the new array is the n-th of the list.
  Index n = 0;
  for (Index ix = head_; ix != kNone; ix = entries_[ix].next, ++n) {
    Entry &e = entries_[ix];
    fresh.push_back(Entry{std::move(e.key), std::move(e.value), e.hash, n - 1, n + 1});
    fresh_slots[empty_slot(fresh_slots, e.hash)] = n;
  }
  if (n > 0)
    fresh[n - 1].next = kNone;
  // The old arrays now hold only emptied references: freeing them runs no code.
  entries_.swap(fresh);
  slots_.swap(fresh_slots);
  head_ = n > 0 ? 0 : kNone;
  tail_ = n > 0 ? n - 1 : kNone;
  free_ = kNone;
  filled_ = used_;
  ++keys_version_;
  ++order_version_;
}

} // namespace uod
