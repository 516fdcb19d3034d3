// Module-wide state of pysource.scancoordinator: records, constants, the
// module's types, and small helpers shared by the queue and coordinator units.
//
// The module is initialised once per process (see module.cpp), so this state
// is process-wide and deliberately never freed.
#pragma once

#include "host/pyref.hpp"

#include <cstdint>

namespace scancoord {

constexpr long long kTypingModulePriority = 0;
constexpr long long kInteractivePriority = 1;
constexpr long long kBackgroundPriority = 2;
constexpr long long kMaxWholeFilesPerCheck = 25;
constexpr double kMinRescanInterval = 5.0;

struct State {
  py::Ref module;    // the one module object of this process
  py::Ref CScanItem; // collections.namedtuple record types
  py::Ref CSingleQueueStatus;
  py::Ref CScanStatus;
  py::Ref defaultdict;      // collections.defaultdict
  py::Ref int_type;         // int, the defaultdict factory
  py::Ref kWildcardScope;   // symbolinfo.kWildcardScope ('*')
  py::Ref empty_item;       // CScanItem(None, None, None, None)
  py::Ref priorities[3];    // the three published priority ints
  py::Ref one;              // the int 1, a count's first value and step
  py::Ref not_found_result; // (False, None, None), shared
  py::Ref waiting_result;   // (True, None, None), shared
  PyTypeObject *SingleQueueType = nullptr;
  PyTypeObject *ScanQueueType = nullptr;
  PyTypeObject *CoordinatorType = nullptr;
  // Invariant checks and debug-only diagnostics run unless Python was
  // started with -O, exactly as `assert` statements would.
  bool debug = true;
};

extern State *state;

// A CScanItem built directly (namedtuples are tuple subclasses whose
// __new__ only packs its arguments), without calling through Python.
py::Ref make_scan_item(py::Borrowed loc, py::Borrowed scope, py::Borrowed scan_name,
                       py::Borrowed priority);

// Stop the cyclic GC from tracking a freshly built tuple whose items can never
// take part in a cycle (strings, ints, None, untracked tuples).  The collector
// applies the same rule lazily; doing it at creation keeps the queue's many
// small key tuples out of every collection, and lets the dictionaries they
// are stored in stay untracked too.
inline py::Ref untrack_if_atomic(py::Ref t) {
  const Py_ssize_t n = PyTuple_GET_SIZE(t.get());
  for (Py_ssize_t i = 0; i < n; ++i) {
    PyObject *item = PyTuple_GET_ITEM(t.get(), i);
    if (PyObject_IS_GC(item) && PyObject_GC_IsTracked(item))
      return t;
  }
  if (PyObject_GC_IsTracked(t.get()))
    PyObject_GC_UnTrack(t.get());
  return t;
}

// Field access on any CScanItem-like object: a tuple subclass is read by
// index (its fields are positional), anything else by attribute name.
py::Ref item_field(py::Borrowed item, int index);

// The fields of a CScanItem-like object, read once: borrowed from a tuple
// (kept alive by holding the item, whose items cannot be replaced), fetched
// by name otherwise.  `wanted` (bit i for field i) names the fields the caller
// reads, so that an object that is not a tuple sees only those attribute
// reads, in field order; the others stay null.
class ItemFields {
public:
  explicit ItemFields(py::Borrowed item, unsigned wanted = 0xF) : item_(item.ref()) {
    if (PyTuple_Check(item.get()) && PyTuple_GET_SIZE(item.get()) == 4) {
      for (int i = 0; i < 4; ++i)
        v_[i] = PyTuple_GET_ITEM(item.get(), i);
      return;
    }
    for (int i = 0; i < 4; ++i) {
      if (!(wanted & (1u << i)))
        continue;
      owned_[i] = item_field(item, i);
      v_[i] = owned_[i].get();
    }
  }
  py::Borrowed operator[](int i) const { return py::Borrowed(v_[i]); }

private:
  py::Ref item_;
  py::Ref owned_[4];
  PyObject *v_[4] = {};
};

// Raise AssertionError (with an optional message), as a failed `assert`.
[[noreturn]] void assertion_failed(const char *msg = nullptr);

// Message texts of this module, in one place.
namespace msg {
constexpr const char *kExpectedType = "Expected %s, got %.200s";
constexpr const char *kArgCount = "%.200s() takes %.8s %zd positional argument%.1s (%zd given)";
constexpr const char *kUnexpectedKeyword = "%s() got an unexpected keyword argument '%U'";
constexpr const char *kDuplicateKeyword = "%s() got multiple values for keyword argument '%U'";
constexpr const char *kTooManyValues = "too many values to unpack (expected %zd)";
constexpr const char *kNotEnoughValues = "not enough values to unpack (expected %zd, got %zd)";
constexpr const char *kNotReached = "should not be reached";
constexpr const char *kNoneNotIterable = "'NoneType' object is not iterable";
constexpr const char *kScanWithoutOrder = "Scan without order: ";
constexpr const char *kReinit =
    "Module 'scancoordinator' has already been imported. Re-initialisation is not supported.";
constexpr const char *kInterpreterChange = "Interpreter change detected - this module can only be "
                                           "loaded into one interpreter per process.";
} // namespace msg

// Argument parsing for METH_FASTCALL | METH_KEYWORDS methods.  `keys` holds
// the `total` parameter names as interned strs (made once by intern_names),
// the first `required` of which are mandatory; keywords are matched to them
// by identity, with string equality as the fallback.  `out` receives
// borrowed references (nullptr for an omitted optional argument).  Raises the
// interpreter's usual TypeErrors.
void parse_args(const char *fname, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames,
                PyObject *const *keys, int required, int total, PyObject **out);
// The interned strs of `n` parameter names, kept for the life of the process.
PyObject *const *intern_names(const char *const *names, int n);

// Unpack a 2- or 3-item sequence the way Python's tuple unpacking does
// (tuples and lists fast, any iterable otherwise).
void unpack(py::Borrowed seq, Py_ssize_t n, py::Ref *out);
// Unpack a value that must be exactly a tuple (TypeError "Expected tuple,
// got X" otherwise).
void unpack_tuple(py::Borrowed seq, Py_ssize_t n, py::Ref *out);

// Text/bytes helpers for the host's equivalence strings, which may be either.
// `starts_with` compares in the type of `s`, converting `prefix` (UTF-8) when
// the two differ; `like(s, ascii)` is `ascii` as str or bytes to match `s`.
bool starts_with(py::Borrowed s, py::Borrowed prefix);
py::Ref like(py::Borrowed s, const char *ascii);

// A signed 64-bit machine integer from a Python object (TypeError for
// non-integers, OverflowError when it does not fit).
long long as_int64(py::Borrowed o);

} // namespace scancoord
