// Module pysource.usageordereddict: the Python face of the usage-ordered
// mapping (the storage is Table, table.hpp).
//
// What it owns
//   * CUsageOrderedDict: a heap type, subclassable, cyclic GC, weakrefs.
//     Instances embed a Table (object.hpp).
//   * CUsageOrderedDictEntry: the read-only (key, val) snapshot returned by
//     _fFirst and _fLast.  It holds its own references, so it stays valid
//     whatever happens to the mapping afterwards.
//   * CUsageOrderedDictIterator: keys, values or items, front to back.
//   * The capsule `_C_API`, a static CUsageOrderedDict_CAPI table.
//
// One code path
//   The capi_* functions are the operations.  The capsule hands them to
//   other extension modules as they are; the Python methods and slots only
//   parse arguments and convert results around them.  Every capi_* function
//   is an entry from outside: it checks the type of `d`, catches C++
//   exceptions and reports errors the C way.  The *_impl functions beneath
//   them throw instead and are inlined into their single caller.
//
// Iteration
//   An iterator remembers the mapping's order_version; any change of the key
//   set or of the order (not a value replaced in place) makes its next step
//   raise RuntimeError, after which it is exhausted.  It takes its own
//   references to the key and value before allocating the result, since an
//   allocation may run the GC and with it arbitrary code.
//
// Overrides
//   Only __repr__ calls another overridable method (items()), and it does so
//   through the instance for subclasses so that an override is honoured.
//   The capsule functions do not dispatch: callers use them for the exact
//   type only.
//
// Item assignment (d[k] = v) is refused: where a new or updated key goes is
// the point of this mapping, so callers say it with Set(k, v, first).
#include "host/usageordereddict/object.hpp"

#include "host/usageordereddict/messages.hpp"
#include "host/usageordereddict_capi.h"

#include <structmember.h>

#include <cstddef>
#include <initializer_list>

namespace uod {
namespace {

PyTypeObject *g_type = nullptr;       // CUsageOrderedDict (the module holds a reference too)
PyTypeObject *g_entry_type = nullptr; // CUsageOrderedDictEntry
PyTypeObject *g_iter_type = nullptr;  // CUsageOrderedDictIterator

// ---- helpers ---------------------------------------------------------------

inline Table &checked_table(PyObject *d) {
  if (!PyObject_TypeCheck(d, g_type)) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedMapping, Py_TYPE(d)->tp_name);
    py::throw_error();
  }
  return table_of(d);
}

// KeyError(key), wrapped in a tuple so that a tuple key is not unpacked
// into the exception's arguments.
[[noreturn]] void throw_key_error(PyObject *key) {
  py::Ref args = py::check(PyTuple_Pack(1, key));
  PyErr_SetObject(PyExc_KeyError, args.get());
  py::throw_error();
}

py::Ref new_mapping(PyTypeObject *type) {
  py::Ref self = py::check(type->tp_alloc(type, 0));
  auto *obj = reinterpret_cast<UodObject *>(self.get());
  obj->weakreflist = nullptr;
  new (obj->table_storage) Table();
  return self;
}

// ---- the operations ------------------------------------------------------------

inline PyObject *get_impl(PyObject *d, PyObject *key, int first) {
  Table &t = checked_table(d);
  const Table::Found f = t.lookup(key, hash_of(key));
  if (f.ix == kNone)
    return nullptr;
  if (first)
    t.move_to(f.ix, true);
  return t.entry(f.ix).value.get();
}

inline void set_impl(PyObject *d, PyObject *key, PyObject *value, int first) {
  Table &t = checked_table(d);
  const Py_hash_t hash = hash_of(key);
  const Table::Found f = t.lookup(key, hash);
  if (f.ix == kNone)
    t.insert(f, key, value, hash, first != 0);
  else
    t.replace(f.ix, value, first != 0); // the old value dies here, the entry already in place
}

inline py::Ref pop_impl(PyObject *d, PyObject *key) {
  Table &t = checked_table(d);
  const Table::Found f = t.lookup(key, hash_of(key));
  if (f.ix == kNone)
    return py::Ref();
  Table::Removed gone = t.remove(f);
  return std::move(gone.value); // gone.key is dropped on return, the table sound again
}

inline void del_impl(PyObject *d, PyObject *key) {
  Table &t = checked_table(d);
  const Table::Found f = t.lookup(key, hash_of(key));
  if (f.ix == kNone)
    throw_key_error(key);
  Table::Removed gone = t.remove(f);
}

// ---- the C API: the same operations, C calling convention ----------------------

PyObject *capi_create() { PY_GUARD(nullptr, return new_mapping(g_type).release();) }

PyObject *capi_get(PyObject *d, PyObject *key, int first) {
  PY_GUARD(nullptr, return get_impl(d, key, first);)
}

int capi_set(PyObject *d, PyObject *key, PyObject *value, int first) {
  PY_GUARD(-1, set_impl(d, key, value, first); return 0;)
}

PyObject *capi_pop(PyObject *d, PyObject *key) {
  PY_GUARD(nullptr, return pop_impl(d, key).release();)
}

int capi_del(PyObject *d, PyObject *key) { PY_GUARD(-1, del_impl(d, key); return 0;) }

Py_ssize_t capi_size(PyObject *d) { PY_GUARD(-1, return checked_table(d).size();) }

inline void first_impl(PyObject *d, PyObject **key, PyObject **value) {
  const Table &t = checked_table(d);
  const Index ix = t.head();
  if (ix == kNone)
    return;
  *key = t.entry(ix).key.get();
  *value = t.entry(ix).value.get();
}

int capi_first(PyObject *d, PyObject **key, PyObject **value) {
  *key = nullptr;
  *value = nullptr;
  PY_GUARD(-1, first_impl(d, key, value); return 0;)
}

CUsageOrderedDict_CAPI g_capi = {
    CUSAGEORDEREDDICT_ABI_VERSION,
    nullptr, // type: filled in when the module is initialised
    capi_create,
    capi_get,
    capi_set,
    capi_pop,
    capi_del,
    capi_size,
    capi_first,
};

// ---- argument parsing for METH_FASTCALL | METH_KEYWORDS ---------------------------

constexpr int kMaxParams = 3;

struct Signature {
  const char *name;
  const char *params[kMaxParams];
  int required;
  int max;
  // The parameter names as interned str, filled in at module initialisation
  // and kept for the life of the process: keyword names arrive interned, so
  // a pointer comparison almost always decides.
  PyObject *interned[kMaxParams];
};

// Index of the parameter called `name`, or sig.max.
int param_index(const Signature &sig, PyObject *name) {
  for (int k = 0; k < sig.max; ++k)
    if (name == sig.interned[k])
      return k;
  for (int k = 0; k < sig.max; ++k)
    if (PyUnicode_CompareWithASCIIString(name, sig.params[k]) == 0)
      return k;
  return sig.max;
}

// Fill out[0 .. sig.max) with the borrowed arguments; optional ones that were
// not passed stay nullptr.
void parse_args(const Signature &sig, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames,
                PyObject **out) {
  const Py_ssize_t nkw = kwnames ? PyTuple_GET_SIZE(kwnames) : 0;
  if (nargs + nkw > sig.max) {
    PyErr_Format(PyExc_TypeError, msg::kTooManyArguments, sig.name, sig.max, nargs + nkw);
    py::throw_error();
  }
  for (Py_ssize_t i = 0; i < sig.max; ++i)
    out[i] = i < nargs ? args[i] : nullptr;
  for (Py_ssize_t j = 0; j < nkw; ++j) {
    PyObject *name = PyTuple_GET_ITEM(kwnames, j);
    const int k = param_index(sig, name);
    if (k == sig.max) {
      PyErr_Format(PyExc_TypeError, msg::kUnexpectedKeyword, sig.name, name);
      py::throw_error();
    }
    if (out[k]) {
      PyErr_Format(PyExc_TypeError, msg::kDuplicateArgument, sig.name, sig.params[k]);
      py::throw_error();
    }
    out[k] = args[nargs + j];
  }
  for (int k = 0; k < sig.required; ++k) {
    if (!out[k]) {
      PyErr_Format(PyExc_TypeError, msg::kMissingArgument, sig.name, sig.params[k], k + 1);
      py::throw_error();
    }
  }
}

// An optional boolean argument; truth testing may run __bool__, so callers
// evaluate it before touching the table.
bool flag(PyObject *arg) { return arg && py::truth(py::Borrowed(arg)); }

Signature g_get_sig = {"get", {"key", "default", "first"}, 1, 3, {}};
Signature g_set_sig = {"Set", {"key", "value", "first"}, 2, 3, {}};
Signature g_pop_sig = {"pop", {"key", "default"}, 1, 2, {}};

void intern_params(Signature &sig) {
  for (int k = 0; k < sig.max; ++k)
    sig.interned[k] = py::intern(sig.params[k]).release(); // kept for the process's life
}

// ---- entry snapshots (_fFirst / _fLast) ------------------------------------------

struct EntryObject {
  PyObject ob_base;
  py::Ref key;
  py::Ref val;
};

EntryObject *as_entry(PyObject *op) { return reinterpret_cast<EntryObject *>(op); }

py::Ref new_entry(const Entry &e) {
  // Own the references before allocating: the allocation may run the GC.
  py::Ref key = e.key;
  py::Ref val = e.value;
  py::Ref self = py::check(g_entry_type->tp_alloc(g_entry_type, 0));
  EntryObject *obj = as_entry(self.get());
  new (&obj->key) py::Ref(std::move(key));
  new (&obj->val) py::Ref(std::move(val));
  return self;
}

int entry_traverse(PyObject *op, visitproc visit, void *arg) {
  Py_VISIT(Py_TYPE(op));
  if (int r = as_entry(op)->key.visit(visit, arg))
    return r;
  return as_entry(op)->val.visit(visit, arg);
}

int entry_clear(PyObject *op) {
  as_entry(op)->key.reset();
  as_entry(op)->val.reset();
  return 0;
}

void entry_dealloc(PyObject *op) {
  PyTypeObject *tp = Py_TYPE(op);
  PyObject_GC_UnTrack(op);
  entry_clear(op);
  as_entry(op)->key.~Ref();
  as_entry(op)->val.~Ref();
  tp->tp_free(op);
  Py_DECREF(tp);
}

PyObject *entry_get_key(PyObject *op, void *) { return py::Ref(as_entry(op)->key).release(); }
PyObject *entry_get_val(PyObject *op, void *) { return py::Ref(as_entry(op)->val).release(); }

py::Ref entry_repr_impl(PyObject *op) {
  py::Ref key = as_entry(op)->key;
  py::Ref val = as_entry(op)->val;
  return py::check(
      PyUnicode_FromFormat("CUsageOrderedDictEntry(key=%R, val=%R)", key.get(), val.get()));
}

PyObject *entry_repr(PyObject *op) { PY_GUARD(nullptr, return entry_repr_impl(op).release();) }

PyGetSetDef entry_getset[] = {
    {"key", entry_get_key, nullptr, "The entry's key.", nullptr},
    {"val", entry_get_val, nullptr, "The entry's value.", nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr},
};

PyType_Slot entry_slots[] = {
    {Py_tp_doc, const_cast<char *>("A (key, val) entry of a CUsageOrderedDict, as it was when "
                                   "read; both fields are read-only.")},
    {Py_tp_dealloc, reinterpret_cast<void *>(entry_dealloc)},
    {Py_tp_traverse, reinterpret_cast<void *>(entry_traverse)},
    {Py_tp_clear, reinterpret_cast<void *>(entry_clear)},
    {Py_tp_repr, reinterpret_cast<void *>(entry_repr)},
    {Py_tp_getset, entry_getset},
    {0, nullptr},
};

PyType_Spec entry_spec = {
    "pysource.usageordereddict.CUsageOrderedDictEntry",
    sizeof(EntryObject),
    0,
    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_HAVE_GC | Py_TPFLAGS_IMMUTABLETYPE |
        Py_TPFLAGS_DISALLOW_INSTANTIATION,
    entry_slots,
};

// ---- iterators ---------------------------------------------------------------------

enum class IterKind { kKeys, kValues, kItems };

struct IterObject {
  PyObject ob_base;
  py::Ref mapping; // empty once exhausted
  Index cursor;    // the next entry to yield, or kNone
  std::uint64_t order_version;
  Py_ssize_t remaining;
  IterKind kind;
};

IterObject *as_iter(PyObject *op) { return reinterpret_cast<IterObject *>(op); }

py::Ref new_iter(PyObject *mapping, IterKind kind) {
  const Table &t = checked_table(mapping);
  py::Ref self = py::check(g_iter_type->tp_alloc(g_iter_type, 0));
  IterObject *it = as_iter(self.get());
  new (&it->mapping) py::Ref(py::Ref::borrow(mapping));
  it->cursor = t.head();
  it->order_version = t.order_version();
  it->remaining = t.size();
  it->kind = kind;
  return self;
}

int iter_traverse(PyObject *op, visitproc visit, void *arg) {
  Py_VISIT(Py_TYPE(op));
  return as_iter(op)->mapping.visit(visit, arg);
}

int iter_clear(PyObject *op) {
  as_iter(op)->mapping.reset();
  return 0;
}

void iter_dealloc(PyObject *op) {
  PyTypeObject *tp = Py_TYPE(op);
  PyObject_GC_UnTrack(op);
  iter_clear(op);
  as_iter(op)->mapping.~Ref();
  tp->tp_free(op);
  Py_DECREF(tp);
}

py::Ref iter_step(IterObject *it) {
  if (!it->mapping)
    return py::Ref();
  const Table &t = table_of(it->mapping.get());
  if (t.order_version() != it->order_version) {
    it->mapping.reset();
    PyErr_SetString(PyExc_RuntimeError, msg::kMutatedDuringIteration);
    py::throw_error();
  }
  if (it->cursor == kNone) {
    it->mapping.reset();
    return py::Ref();
  }
  const Entry &e = t.entry(it->cursor);
  py::Ref key = e.key;
  py::Ref value = e.value;
  it->cursor = e.next;
  --it->remaining;
  switch (it->kind) {
  case IterKind::kKeys:
    return key;
  case IterKind::kValues:
    return value;
  case IterKind::kItems:
    break;
  }
  return py::check(PyTuple_Pack(2, key.get(), value.get()));
}

PyObject *iter_next(PyObject *op) { PY_GUARD(nullptr, return iter_step(as_iter(op)).release();) }

PyObject *iter_length_hint(PyObject *op, PyObject *) {
  const IterObject *it = as_iter(op);
  Py_ssize_t n = 0;
  if (it->mapping && table_of(it->mapping.get()).order_version() == it->order_version)
    n = it->remaining;
  return PyLong_FromSsize_t(n);
}

PyMethodDef iter_methods[] = {
    {"__length_hint__", iter_length_hint, METH_NOARGS, "Entries not yet yielded."},
    {nullptr, nullptr, 0, nullptr},
};

PyType_Slot iter_slots[] = {
    {Py_tp_doc, const_cast<char *>("Iterator over a CUsageOrderedDict, front to back.")},
    {Py_tp_dealloc, reinterpret_cast<void *>(iter_dealloc)},
    {Py_tp_traverse, reinterpret_cast<void *>(iter_traverse)},
    {Py_tp_clear, reinterpret_cast<void *>(iter_clear)},
    {Py_tp_iter, reinterpret_cast<void *>(PyObject_SelfIter)},
    {Py_tp_iternext, reinterpret_cast<void *>(iter_next)},
    {Py_tp_methods, iter_methods},
    {0, nullptr},
};

PyType_Spec iter_spec = {
    "pysource.usageordereddict.CUsageOrderedDictIterator",
    sizeof(IterObject),
    0,
    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_HAVE_GC | Py_TPFLAGS_IMMUTABLETYPE |
        Py_TPFLAGS_DISALLOW_INSTANTIATION,
    iter_slots,
};

// ---- CUsageOrderedDict: type slots ---------------------------------------------

int uod_init(PyObject *, PyObject *args, PyObject *kwds) {
  if ((args && PyTuple_GET_SIZE(args) != 0) || (kwds && PyDict_GET_SIZE(kwds) != 0)) {
    PyErr_SetString(PyExc_TypeError, msg::kTakesNoArguments);
    return -1;
  }
  return 0;
}

PyObject *uod_new(PyTypeObject *type, PyObject *args, PyObject *kwds) {
  // Arguments are refused here only when __init__ is ours, so that a
  // subclass may give its __init__ parameters of its own.
  if (type->tp_init == uod_init && uod_init(nullptr, args, kwds) < 0)
    return nullptr;
  PY_GUARD(nullptr, return new_mapping(type).release();)
}

int uod_traverse(PyObject *self, visitproc visit, void *arg) {
  Py_VISIT(Py_TYPE(self));
  return table_of(self).traverse(visit, arg);
}

int uod_clear(PyObject *self) {
  table_of(self).clear();
  return 0;
}

void uod_dealloc(PyObject *self) {
  PyTypeObject *tp = Py_TYPE(self);
  PyObject_GC_UnTrack(self);
  // Deeply nested mappings would otherwise recurse once per level here.
  // clang-format off
  Py_TRASHCAN_BEGIN(self, uod_dealloc)
    if (reinterpret_cast<UodObject *>(self)->weakreflist)
      PyObject_ClearWeakRefs(self);
    table_of(self).clear();
    table_of(self).~Table();
    tp->tp_free(self);
    Py_DECREF(tp);
  Py_TRASHCAN_END
  // clang-format on
}

// Py_ReprEnter / Py_ReprLeave as a scope.
class ReprScope {
public:
  explicit ReprScope(PyObject *self) : self_(self) {
    const int rc = Py_ReprEnter(self);
    if (rc < 0)
      py::throw_error();
    recursive_ = rc > 0;
  }
  ~ReprScope() {
    if (!recursive_)
      Py_ReprLeave(self_);
  }
  ReprScope(const ReprScope &) = delete;
  ReprScope &operator=(const ReprScope &) = delete;
  bool recursive() const noexcept { return recursive_; }

private:
  PyObject *self_;
  bool recursive_ = false;
};

py::Ref repr_impl(PyObject *self) {
  py::Ref name = py::check(PyType_GetName(Py_TYPE(self)));
  ReprScope scope(self);
  if (scope.recursive())
    return py::check(PyUnicode_FromFormat("%U(...)", name.get()));
  // Snapshot the pairs first: the reprs of keys and values may mutate us.
  py::Ref items = Py_IS_TYPE(self, g_type) ? new_iter(self, IterKind::kItems)
                                           : py::call_method(py::Borrowed(self), PY_NAME("items"));
  py::Ref pairs = py::check(PySequence_List(items.get()));
  if (PyList_GET_SIZE(pairs.get()) == 0)
    return py::check(PyUnicode_FromFormat("%U()", name.get()));
  return py::check(PyUnicode_FromFormat("%U(%R)", name.get(), pairs.get()));
}

PyObject *uod_repr(PyObject *self) { PY_GUARD(nullptr, return repr_impl(self).release();) }

PyObject *uod_iter(PyObject *self) {
  PY_GUARD(nullptr, return new_iter(self, IterKind::kKeys).release();)
}

Py_ssize_t uod_length(PyObject *self) { return capi_size(self); }

py::Ref subscript_impl(PyObject *self, PyObject *key) {
  PyObject *value = capi_get(self, key, 0);
  if (!value) {
    if (PyErr_Occurred())
      py::throw_error();
    throw_key_error(key);
  }
  return py::Ref::borrow(value);
}

PyObject *uod_subscript(PyObject *self, PyObject *key) {
  PY_GUARD(nullptr, return subscript_impl(self, key).release();)
}

int uod_ass_subscript(PyObject *self, PyObject *key, PyObject *value) {
  if (value) {
    PyErr_SetString(PyExc_TypeError, msg::kNoItemAssignment);
    return -1;
  }
  return capi_del(self, key);
}

int uod_contains(PyObject *self, PyObject *key) {
  PY_GUARD(-1, return checked_table(self).lookup(key, hash_of(key)).ix != kNone ? 1 : 0;)
}

// ---- CUsageOrderedDict: methods -------------------------------------------------

py::Ref get_method(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PyObject *argv[3];
  parse_args(g_get_sig, args, nargs, kwnames, argv);
  const bool first = flag(argv[2]);
  PyObject *value = capi_get(self, argv[0], first);
  if (!value) {
    if (PyErr_Occurred())
      py::throw_error();
    value = argv[1] ? argv[1] : Py_None;
  }
  return py::Ref::borrow(value);
}

py::Ref set_method(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PyObject *argv[3];
  parse_args(g_set_sig, args, nargs, kwnames, argv);
  const bool first = flag(argv[2]);
  py::check_int(capi_set(self, argv[0], argv[1], first));
  return py::Ref::none();
}

py::Ref pop_method(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PyObject *argv[2];
  parse_args(g_pop_sig, args, nargs, kwnames, argv);
  py::Ref value = py::Ref::steal(capi_pop(self, argv[0]));
  if (value)
    return value;
  if (PyErr_Occurred())
    py::throw_error();
  if (!argv[1])
    throw_key_error(argv[0]);
  return py::Ref::borrow(argv[1]);
}

PyObject *uod_get(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PY_GUARD(nullptr, return get_method(self, args, nargs, kwnames).release();)
}

PyObject *uod_set(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PY_GUARD(nullptr, return set_method(self, args, nargs, kwnames).release();)
}

PyObject *uod_pop(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames) {
  PY_GUARD(nullptr, return pop_method(self, args, nargs, kwnames).release();)
}

PyObject *uod_clear_method(PyObject *self, PyObject *) {
  PY_GUARD(nullptr, checked_table(self).clear(); return py::Ref::none().release();)
}

PyObject *uod_keys(PyObject *self, PyObject *) {
  PY_GUARD(nullptr, return new_iter(self, IterKind::kKeys).release();)
}

PyObject *uod_values(PyObject *self, PyObject *) {
  PY_GUARD(nullptr, return new_iter(self, IterKind::kValues).release();)
}

PyObject *uod_items(PyObject *self, PyObject *) {
  PY_GUARD(nullptr, return new_iter(self, IterKind::kItems).release();)
}

PyObject *uod_sizeof(PyObject *self, PyObject *) {
  const std::size_t n =
      static_cast<std::size_t>(Py_TYPE(self)->tp_basicsize) + table_of(self).allocated_bytes();
  return PyLong_FromSize_t(n);
}

py::Ref end_entry(PyObject *self, bool front) {
  const Table &t = table_of(self);
  const Index ix = front ? t.head() : t.tail();
  if (ix == kNone)
    return py::Ref::none();
  return new_entry(t.entry(ix));
}

PyObject *uod_get_first(PyObject *self, void *) {
  PY_GUARD(nullptr, return end_entry(self, true).release();)
}
PyObject *uod_get_last(PyObject *self, void *) {
  PY_GUARD(nullptr, return end_entry(self, false).release();)
}

PyMethodDef uod_methods[] = {
    {"get", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(uod_get)),
     METH_FASTCALL | METH_KEYWORDS,
     "get($self, /, key, default=None, first=False)\n--\n\n"
     "The value of key, or default when it is absent.  When first is true, an\n"
     "existing entry moves to the front."},
    {"Set", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(uod_set)),
     METH_FASTCALL | METH_KEYWORDS,
     "Set($self, /, key, value, first=False)\n--\n\n"
     "Store value under key at the front (first true) or at the back.  An\n"
     "existing key takes the new value and moves to that end."},
    {"pop", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(uod_pop)),
     METH_FASTCALL | METH_KEYWORDS,
     "pop(key[, default])\n\n"
     "Remove key and return its value; default when it is absent, or KeyError\n"
     "when no default is given."},
    {"clear", uod_clear_method, METH_NOARGS, "Remove every entry."},
    {"keys", uod_keys, METH_NOARGS, "An iterator over the keys, front to back."},
    {"values", uod_values, METH_NOARGS, "An iterator over the values, front to back."},
    {"items", uod_items, METH_NOARGS, "An iterator over (key, value) pairs, front to back."},
    {"iteritems", uod_items, METH_NOARGS, "Same as items()."},
    {"__sizeof__", uod_sizeof, METH_NOARGS, "Size in memory, in bytes, without keys and values."},
    {nullptr, nullptr, 0, nullptr},
};

PyGetSetDef uod_getset[] = {
    {"_fFirst", uod_get_first, nullptr,
     "The first entry (with read-only key and val), or None when empty.", nullptr},
    {"_fLast", uod_get_last, nullptr,
     "The last entry (with read-only key and val), or None when empty.", nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr},
};

PyMemberDef uod_members[] = {
    {"__weaklistoffset__", T_PYSSIZET, offsetof(UodObject, weakreflist), READONLY, nullptr},
    {nullptr, 0, 0, 0, nullptr},
};

PyType_Slot uod_slots[] = {
    {Py_tp_doc,
     const_cast<char *>("CUsageOrderedDict()\n--\n\n"
                        "A mapping whose order callers steer: entries are stored at either end\n"
                        "and move to the front when looked up with first=True.  Lookup, moves,\n"
                        "insertion and removal take constant time.")},
    {Py_tp_new, reinterpret_cast<void *>(uod_new)},
    {Py_tp_init, reinterpret_cast<void *>(uod_init)},
    {Py_tp_dealloc, reinterpret_cast<void *>(uod_dealloc)},
    {Py_tp_traverse, reinterpret_cast<void *>(uod_traverse)},
    {Py_tp_clear, reinterpret_cast<void *>(uod_clear)},
    {Py_tp_repr, reinterpret_cast<void *>(uod_repr)},
    {Py_tp_hash, reinterpret_cast<void *>(PyObject_HashNotImplemented)},
    {Py_tp_iter, reinterpret_cast<void *>(uod_iter)},
    {Py_tp_methods, uod_methods},
    {Py_tp_getset, uod_getset},
    {Py_tp_members, uod_members},
    {Py_mp_length, reinterpret_cast<void *>(uod_length)},
    {Py_mp_subscript, reinterpret_cast<void *>(uod_subscript)},
    {Py_mp_ass_subscript, reinterpret_cast<void *>(uod_ass_subscript)},
    {Py_sq_contains, reinterpret_cast<void *>(uod_contains)},
    {0, nullptr},
};

PyType_Spec uod_spec = {
    "pysource.usageordereddict.CUsageOrderedDict",
    sizeof(UodObject),
    0,
    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC | Py_TPFLAGS_IMMUTABLETYPE |
        Py_TPFLAGS_MAPPING,
    uod_slots,
};

// ---- module ------------------------------------------------------------------------

PyMethodDef module_methods[] = {
    {"_bench_capi", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(bench_capi)),
     METH_FASTCALL,
     "_bench_capi(op, keys, values, probe_keys, dict_first)\n--\n\n"
     "Benchmark support: time one pass of op over probe_keys through the capsule\n"
     "table and through the equivalent PyDict calls; returns the two figures in\n"
     "nanoseconds per operation."},
    {nullptr, nullptr, 0, nullptr},
};

PyModuleDef module_def = {
    PyModuleDef_HEAD_INIT,
    "pysource.usageordereddict",
    "The host's usage-ordered mapping, CUsageOrderedDict, and its C API (_C_API).",
    -1, // single-phase: the types and the capsule table are process-wide
    module_methods,
};

PyTypeObject *add_type(PyObject *module, PyType_Spec *spec) {
  py::Ref type = py::check(PyType_FromModuleAndSpec(module, spec, nullptr));
  auto *tp = reinterpret_cast<PyTypeObject *>(type.get());
  py::check_int(PyModule_AddType(module, tp));
  return reinterpret_cast<PyTypeObject *>(type.release()); // kept for the process's life
}

py::Ref init_module() {
  py::Ref module = py::check(PyModule_Create(&module_def));
  for (Signature *sig : {&g_get_sig, &g_set_sig, &g_pop_sig})
    intern_params(*sig);
  g_type = add_type(module.get(), &uod_spec);
  g_entry_type = add_type(module.get(), &entry_spec);
  g_iter_type = add_type(module.get(), &iter_spec);
  g_capi.type = g_type;
  py::Ref capsule = py::check(PyCapsule_New(&g_capi, CUSAGEORDEREDDICT_CAPSULE_NAME, nullptr));
  py::check_int(PyModule_AddObjectRef(module.get(), "_C_API", capsule.get()));
  return module;
}

} // namespace
} // namespace uod

PyMODINIT_FUNC PyInit_usageordereddict(void) {
  PY_GUARD(nullptr, return uod::init_module().release();)
}
