// _CScanQueue internals shared by its units (structure and adding/removing,
// retrieval and queries, waiting and deferred signals, the Python face).
//
// The queue keeps every pending scan (location, scope name, scan name) at an
// integer priority.  Invariants kept by every operation:
//  1. A ready scan queued at priority p is recorded in three places at once:
//     its scope name is in the name list of its location in the single queue
//     for (p, order of its scan name); (scope, scan name) -> p is in the
//     location's pending dictionary; and it is counted in the location's
//     per-name counts and in _fPerScanNameCounts.  One priority per scan.
//  2. A name list holding '*' holds nothing else; name lists are sorted,
//     distinct and never empty while stored.
//  3. A location parked for inspection has no ready scans: all of its scans
//     leave the single queues and _fPerLocationInfo together, and return
//     together.
// The fields are real Python containers, readable from Python.  Operations
// that call out to Python (a location's __hash__/__eq__, host functions,
// signal handlers) hold strong references to every container they are
// walking, so a re-entrant change can at worst be seen, never crash us.
#pragma once

#include "pysource/scancoordinator/module.hpp"
#include "pysource/scancoordinator/types.hpp"

#include <new>
#include <utility>
#include <vector>

namespace scancoord::sq {

using Q = ScanQueueObject;
using py::Borrowed;
using py::Ref;

struct LocInfo;

// ---- structure, adding and removing --------------------------------------
void init(Q *q, Borrowed location_data_cache);
void SetScansToOrder(Q *q, Borrowed scans_to_order);
Ref GetSingleQueue(Q *q, Borrowed scan_name, long long priority);
// The priority the scan is queued at, or an empty Ref for None.  `key` is
// the (scope, scan name) tuple when the caller already has it.
Ref FindScanPriority(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed key);
void AddScanPairs(Q *q, Borrowed pair_seq, Borrowed scan_name, Borrowed priority,
                  bool add_to_check);
// An append-only list of (location, scope name) pairs, in order, for one
// call.  It may hold every pair of a large batch, so it avoids one large
// transient buffer that the C allocator would keep resident afterwards:
//  - as a view, it refers to the caller's tuple of pairs and records which of
//    them are taken as runs of indices (usually a single run, kept inline);
//  - as a single pair, it holds that pair inline (the coordinator queues one
//    pair after each scan);
//  - otherwise it owns the pairs, in small blocks from Python's allocator.
struct PairRef {
  Borrowed first, second;
};

class PairList {
  static constexpr size_t kPerBlock = 15; // a block stays within 256 bytes
  struct Block {
    Block *next;
    size_t used;
    std::pair<Ref, Ref> items[kPerBlock];
  };
  struct Run {
    Py_ssize_t begin, end;
  };

public:
  PairList() = default;
  // A view over `pairs`, a tuple whose items are 2-tuples.
  explicit PairList(Ref pairs) : view_(std::move(pairs)) {}
  // The one pair (a, b).
  PairList(Borrowed a, Borrowed b) : one_{a.ref(), b.ref()}, size_(1) {}
  PairList(const PairList &) = delete;
  PairList &operator=(const PairList &) = delete;
  PairList(PairList &&o) noexcept
      : view_(std::move(o.view_)), run_(o.run_), more_runs_(std::move(o.more_runs_)),
        one_(std::move(o.one_)), head_(o.head_), tail_(o.tail_), size_(o.size_) {
    o.head_ = o.tail_ = nullptr;
    o.size_ = 0;
  }
  ~PairList() {
    Block *b = head_;
    while (b) {
      Block *next = b->next;
      for (size_t i = 0; i < b->used; ++i)
        b->items[i].~pair();
      PyMem_Free(b);
      b = next;
    }
  }
  // Owned mode: append a pair.
  void emplace_back(Ref a, Ref b) {
    if (!tail_ || tail_->used == kPerBlock) {
      auto *blk = static_cast<Block *>(PyMem_Malloc(sizeof(Block)));
      if (!blk)
        throw std::bad_alloc();
      blk->next = nullptr;
      blk->used = 0;
      (tail_ ? tail_->next : head_) = blk;
      tail_ = blk;
    }
    new (&tail_->items[tail_->used]) std::pair<Ref, Ref>(std::move(a), std::move(b));
    ++tail_->used;
    ++size_;
  }
  // View mode: take the pair at index i (indices ascending).
  void take(Py_ssize_t i) {
    if (size_ == 0)
      run_ = Run{i, i + 1};
    else if (more_runs_.empty() && run_.end == i)
      ++run_.end;
    else if (!more_runs_.empty() && more_runs_.back().end == i)
      ++more_runs_.back().end;
    else
      more_runs_.push_back(Run{i, i + 1});
    ++size_;
  }
  size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }

  // Calls f(PairRef) for every pair, in order.
  template <typename F> void for_each(F &&f) const {
    if (view_) {
      if (size_ == 0)
        return;
      auto walk = [&](const Run &r) {
        for (Py_ssize_t i = r.begin; i < r.end; ++i) {
          PyObject *pair = PyTuple_GET_ITEM(view_.get(), i);
          f(PairRef{Borrowed(PyTuple_GET_ITEM(pair, 0)), Borrowed(PyTuple_GET_ITEM(pair, 1))});
        }
      };
      walk(run_);
      for (const Run &r : more_runs_)
        walk(r);
      return;
    }
    if (one_.first) {
      f(PairRef{Borrowed(one_.first), Borrowed(one_.second)});
      return;
    }
    for (const Block *b = head_; b; b = b->next)
      for (size_t i = 0; i < b->used; ++i)
        f(PairRef{Borrowed(b->items[i].first), Borrowed(b->items[i].second)});
  }

private:
  Ref view_;
  Run run_{0, 0};
  std::vector<Run> more_runs_;
  std::pair<Ref, Ref> one_;
  Block *head_ = nullptr;
  Block *tail_ = nullptr;
  size_t size_ = 0;
};
// AddScanPairs([(loc, scope)], ...) without the one-pair sequence.
void AddScanPair(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                 bool add_to_check);
void AddReadyScanPairs(Q *q, const PairList &pairs, Borrowed scan_name, Borrowed priority,
                       bool add_to_check);
void AddScanToPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                             Borrowed priority, Borrowed key);
bool RemoveScanFromPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                                  Borrowed priority, Borrowed key);
// `known` is the location's record when the caller has just read it; it is
// used only if it is still current.
bool RemoveScanTriple(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                      bool remove_waiting, Borrowed key, const LocInfo *known = nullptr);
void RemoveAllForLocations(Q *q, Borrowed loc_seq, Borrowed scan_name_set, bool remove_waiting);
// RemoveAllForLocations([loc], ...), without the one-item sequence.
void RemoveAllForLocation(Q *q, Borrowed loc, Borrowed scan_name_set, bool remove_waiting);
void Clear(Q *q);
// `key` is the scan's (scope, scan name) tuple when the caller has it.
void ScanCompleted(Q *q, Borrowed scan_item, Borrowed key = Borrowed());
void destroy_impl(Q *q);

// ---- retrieval and queries -----------------------------------------------
Ref First(Q *q);
Ref FirstOrNone(Q *q); // empty Ref for None
Ref PopWholeFilesToCheck(Q *q, Py_ssize_t max_files);
Ref GetPendingDictForLoc(Q *q, Borrowed loc); // empty Ref for None
bool LocationInQueue(Q *q, Borrowed loc, Borrowed scan_name);
bool Empty(Q *q, bool include_waiting);
Py_ssize_t GetFileCount(Q *q, Borrowed scan_name, Borrowed priority);
Ref GetScanCount(Q *q, Borrowed scan_item);
Py_ssize_t GetWaitingCount(Q *q);
void UpdateForVisibleDocuments(Q *q, Borrowed active_loc, Borrowed visible_locs);
void MoveScansBetweenQueues(Q *q, Borrowed loc, Borrowed names_to_move, Borrowed from_queue,
                            Borrowed to_queue);
void CB_SingletonChanged(Q *q);
void CB_ActiveDocChanged(Q *q);
void PrintScanQueues(Q *q, Borrowed write, Py_ssize_t limit);

// ---- waiting for inspection / data, deferred signals ---------------------
bool IsTreeBranchReady(Q *q, Borrowed loc);
void MoveScansForLocToWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority);
void AddItemsWaitingForInspect(Q *q, Borrowed loc, Borrowed item_seq);
void SetWholeFileCheckWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority);
void CB_TreeBranchesNowReady(Q *q, Borrowed data, Borrowed ready_set);
void StartWaitingForData(Q *q, Borrowed scan_item);
void FinishedWaitingForData(Q *q, Borrowed scan_item);
void UpdatePendingSets(Q *q, Borrowed added_set, Borrowed removed_set);
// _UpdatePendingSets({loc}, None) or (None, {loc}) without building the set.
void LocationAdded(Q *q, Borrowed loc);
void LocationRemoved(Q *q, Borrowed loc);
void SignalEmitIdle(Q *q);

// ---- overridable dispatch ------------------------------------------------
// The queue's own calls of these operations go through here: a direct C++
// call for the class itself, the override on a subclass that has one.
namespace call {
void AddScanPairs(Q *q, Borrowed pair_seq, Borrowed scan_name, Borrowed priority,
                  bool add_to_check);
// AddScanPairs([(loc, scope)], ...) without the one-pair sequence.
void AddScanPair(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                 bool add_to_check);
void AddReadyScanPairs(Q *q, const PairList &pairs, Borrowed scan_name, Borrowed priority,
                       bool add_to_check);
bool RemoveScanTriple(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                      bool remove_waiting, Borrowed key, const LocInfo *known = nullptr);
Ref FirstOrNone(Q *q);
void UpdatePendingSets(Q *q, Borrowed added_set, Borrowed removed_set);
void LocationAdded(Q *q, Borrowed loc);
void LocationRemoved(Q *q, Borrowed loc);
Ref GetSingleQueue(Q *q, Borrowed scan_name, long long priority);
bool IsTreeBranchReady(Q *q, Borrowed loc);
void MoveScansForLocToWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority);
void Clear(Q *q);
} // namespace call

// ---- shared helpers ------------------------------------------------------
// The (counts, pending) pair stored for a location; both empty if absent.
// `table` and `version` say which state of _fPerLocationInfo it was read
// from: while that dictionary is unchanged, a new lookup would find the same
// record (a tuple, whose two dictionaries cannot be swapped for others).
struct LocInfo {
  Ref tuple, counts, pending;
  PyObject *table = nullptr;
  uint64_t version = 0;
  explicit operator bool() const { return bool(tuple); }
  bool current(const Q *q) const;
};
LocInfo loc_info(Q *q, Borrowed loc);
// A name list as stored in a single queue (TypeError if not a list).
PyListObject *as_name_list(Borrowed v);
// Name lists and the cyclic GC.  A name list holds scope names, strs that
// can be part of no cycle, so the queue keeps its lists untracked while they
// hold only such names (as the collector does by itself for tuples and
// dictionaries of atomic items): a batch of thousands of new locations then
// leaves the collector nothing new to walk, and no full collection follows.
// The list made for a first name; untracked unless the name is tracked.
Ref new_name_list(Borrowed name);
// After `name` was put into `list`: a tracked name tracks the list again.
void name_added(Borrowed list, Borrowed name);
// A list the queue filled with names: untracked if they are all atomic.
void untrack_name_list(Borrowed list);
// bisect.bisect_left(list, x)
Py_ssize_t bisect_left(Borrowed list, Borrowed x);
// The (scope, scan name) key tuple, the queue's shared one for this pair of
// name objects (see KeyTable).
Ref make_key(Q *q, Borrowed scope, Borrowed scan_name);
// A priority as stored: an int object of the given value.
Ref priority_obj(long long p);

} // namespace scancoord::sq
