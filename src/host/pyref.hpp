// Thin RAII layer over CPython object references.
//
// Ownership lives in the types:
//   Ref       an owning (strong) reference; releases itself on destruction.
//   Borrowed  a non-owning reference; valid only while someone else holds a
//             strong one.  Anything that may run Python code (a __hash__, a
//             __eq__, a signal handler, a DECREF) can kill a borrowed object,
//             so take a Ref before calling out.
// A raw PyObject* appears only at the C boundary (slot functions, C API
// calls).  Conversions are explicit: Ref::steal() adopts a new reference,
// Ref::borrow() takes a new strong reference to a borrowed one, release()
// hands ownership back to C.
#pragma once

#define PY_SSIZE_T_CLEAN
#include <Python.h>

#include <cstdint>
#include <cstring>
#include <exception>
#include <utility>

namespace py {

class Borrowed;

class Ref {
public:
  Ref() noexcept = default;
  Ref(std::nullptr_t) noexcept {}
  ~Ref() { Py_XDECREF(p_); }

  Ref(const Ref &o) noexcept : p_(o.p_) { Py_XINCREF(p_); }
  Ref(Ref &&o) noexcept : p_(o.p_) { o.p_ = nullptr; }
  Ref &operator=(const Ref &o) noexcept {
    Ref tmp(o);
    swap(tmp);
    return *this;
  }
  Ref &operator=(Ref &&o) noexcept {
    Ref tmp(std::move(o));
    swap(tmp);
    return *this;
  }
  inline Ref(Borrowed b) noexcept;

  // Adopt a new reference (the result of most C API calls).  NULL is allowed
  // and means "an exception is set".
  static Ref steal(PyObject *p) noexcept {
    Ref r;
    r.p_ = p;
    return r;
  }
  // Take a new strong reference to an object owned elsewhere.
  static Ref borrow(PyObject *p) noexcept {
    Py_XINCREF(p);
    return steal(p);
  }
  static Ref none() noexcept { return borrow(Py_None); }
  static Ref of_bool(bool b) noexcept { return borrow(b ? Py_True : Py_False); }

  PyObject *get() const noexcept { return p_; }
  PyObject *release() noexcept {
    PyObject *p = p_;
    p_ = nullptr;
    return p;
  }
  // Drop the reference now.  The pointer is cleared before the DECREF so
  // that code run by a finaliser never sees a dangling field.
  void reset() noexcept { Py_CLEAR(p_); }
  void reset(Ref o) noexcept {
    PyObject *old = p_;
    p_ = o.release();
    Py_XDECREF(old);
  }
  void swap(Ref &o) noexcept { std::swap(p_, o.p_); }

  explicit operator bool() const noexcept { return p_ != nullptr; }
  bool is_none() const noexcept { return p_ == Py_None; }
  inline Borrowed borrowed() const noexcept;

  // For tp_traverse: visit the held object, if any.
  int visit(visitproc v, void *arg) const {
    if (p_)
      return v(p_, arg);
    return 0;
  }

private:
  PyObject *p_ = nullptr;
};

class Borrowed {
public:
  Borrowed() noexcept = default;
  Borrowed(std::nullptr_t) noexcept {}
  explicit Borrowed(PyObject *p) noexcept : p_(p) {}
  Borrowed(const Ref &r) noexcept : p_(r.get()) {}

  PyObject *get() const noexcept { return p_; }
  explicit operator bool() const noexcept { return p_ != nullptr; }
  bool is_none() const noexcept { return p_ == Py_None; }
  Ref ref() const noexcept { return Ref::borrow(p_); }

private:
  PyObject *p_ = nullptr;
};

inline Ref::Ref(Borrowed b) noexcept : p_(b.get()) { Py_XINCREF(p_); }
inline Borrowed Ref::borrowed() const noexcept { return Borrowed(p_); }

// Thrown inside the C++ layer when a Python exception is set; caught at the
// boundary (see PY_GUARD) and left as the pending Python exception.  Used for
// error propagation only, never for control flow on a hot path.
struct PyError : std::exception {
  const char *what() const noexcept override { return "python error set"; }
};

[[noreturn]] inline void throw_error() { throw PyError(); }

// Return r or throw if it carries no object (an exception is set).
inline Ref check(Ref r) {
  if (!r)
    throw_error();
  return r;
}
inline Ref check(PyObject *new_ref) { return check(Ref::steal(new_ref)); }
inline void check_int(int rc) {
  if (rc < 0)
    throw_error();
}

// Convert any C++ exception escaping a slot into a Python exception.
inline void translate_exception() noexcept {
  try {
    throw;
  } catch (const PyError &) {
    if (!PyErr_Occurred())
      PyErr_SetString(PyExc_SystemError, "error return without exception set");
  } catch (const std::bad_alloc &) {
    PyErr_NoMemory();
  } catch (const std::exception &e) {
    PyErr_SetString(PyExc_RuntimeError, e.what());
  } catch (...) {
    PyErr_SetString(PyExc_RuntimeError, "unknown C++ exception");
  }
}

// Wrap the body of a function called from Python.  `fail` is the value to
// return when an exception is pending (nullptr, -1, ...).
#define PY_GUARD(fail, ...)                                                                        \
  try {                                                                                            \
    __VA_ARGS__                                                                                    \
  } catch (...) {                                                                                  \
    ::py::translate_exception();                                                                   \
    return fail;                                                                                   \
  }

// ---- small helpers used everywhere ---------------------------------------

inline Ref str(const char *s) { return check(PyUnicode_FromString(s)); }

// A new reference to the interned str of `s`.  Interning decodes the text
// and looks it up in the interpreter's table, so this is for one-time setup;
// code that runs repeatedly names things with PY_NAME.
inline Ref intern(const char *s) { return check(PyUnicode_InternFromString(s)); }

// The interned str of a constant text (an attribute, method, signal or
// message name), made the first time this call site runs and kept for the
// life of the process: afterwards naming it costs one load, with no
// conversion or comparison of C strings.  `text` must be a constant
// expression; a failed first creation throws and is retried next time.
#define PY_NAME(text)                                                                              \
  (::py::Borrowed([]() -> PyObject * {                                                             \
    static PyObject *const name_ = ::py::intern(text).release();                                   \
    return name_;                                                                                  \
  }()))

inline Ref integer(long long v) { return check(PyLong_FromLongLong(v)); }
inline Ref floating(double v) { return check(PyFloat_FromDouble(v)); }

inline bool truth(Borrowed o) {
  if (o.get() == Py_True)
    return true;
  if (o.get() == Py_False || o.get() == Py_None)
    return false;
  int r = PyObject_IsTrue(o.get());
  if (r < 0)
    throw_error();
  return r != 0;
}

inline Ref getattr(Borrowed o, Borrowed name) {
  return check(PyObject_GetAttr(o.get(), name.get()));
}
inline void setattr(Borrowed o, Borrowed name, Borrowed v) {
  check_int(PyObject_SetAttr(o.get(), name.get(), v.get()));
}

// An attribute of a module object: its namespace dictionary first (what a
// module attribute lookup finds for any ordinary name), the full protocol
// only when the name is not there.
inline Ref module_attr(Borrowed module, Borrowed name) {
  if (PyModule_CheckExact(module.get())) {
    PyObject *dict = PyModule_GetDict(module.get()); // borrowed
    PyObject *v = PyDict_GetItemWithError(dict, name.get());
    if (v)
      return Ref::borrow(v);
    if (PyErr_Occurred())
      throw_error();
  }
  return getattr(module, name);
}

// Vectorcall helpers: call(f, a, b, ...) with borrowed arguments.
template <typename... A> Ref call(Borrowed f, A... args) {
  PyObject *argv[sizeof...(A) + 1] = {nullptr, Borrowed(args).get()...};
  return check(PyObject_Vectorcall(f.get(), argv + 1, sizeof...(A) | PY_VECTORCALL_ARGUMENTS_OFFSET,
                                   nullptr));
}
inline Ref call(Borrowed f) { return check(PyObject_CallNoArgs(f.get())); }

// obj.name(args...) without building a bound method.
template <typename... A> Ref call_method(Borrowed obj, Borrowed name, A... args) {
  PyObject *argv[sizeof...(A) + 1] = {obj.get(), Borrowed(args).get()...};
  return check(PyObject_VectorcallMethod(
      name.get(), argv, (sizeof...(A) + 1) | PY_VECTORCALL_ARGUMENTS_OFFSET, nullptr));
}

// Call with positional arguments and keyword arguments given as a tuple of
// names (kwnames) and values appended to the positional ones.
inline Ref call_kw(Borrowed f, PyObject *const *args, size_t npos, Borrowed kwnames) {
  return check(PyObject_Vectorcall(f.get(), args, npos, kwnames.get()));
}

inline long long as_ll(Borrowed o) {
  long long v = PyLong_AsLongLong(o.get());
  if (v == -1 && PyErr_Occurred())
    throw_error();
  return v;
}

inline Py_hash_t hash(Borrowed o) {
  Py_hash_t h = PyObject_Hash(o.get());
  if (h == -1)
    throw_error();
  return h;
}

// a == b: identity first; two exact strs compare as text without the rich
// comparison protocol; anything else through ==.
inline bool eq(Borrowed a, Borrowed b) {
  if (a.get() == b.get())
    return true;
  if (PyUnicode_CheckExact(a.get()) && PyUnicode_CheckExact(b.get()))
    return _PyUnicode_EQ(a.get(), b.get()) != 0;
  int r = PyObject_RichCompareBool(a.get(), b.get(), Py_EQ);
  if (r < 0)
    throw_error();
  return r != 0;
}

// Container helpers (each throws on error).
inline Ref new_dict() { return check(PyDict_New()); }
inline Ref new_set() { return check(PySet_New(nullptr)); }
inline Ref new_list(Py_ssize_t n = 0) { return check(PyList_New(n)); }

// dict lookup returning a new strong reference, or an empty Ref if absent.
inline Ref dict_get(Borrowed d, Borrowed key) {
  PyObject *v = PyDict_GetItemWithError(d.get(), key.get());
  if (!v) {
    if (PyErr_Occurred())
      throw_error();
    return Ref();
  }
  return Ref::borrow(v);
}
inline void dict_set(Borrowed d, Borrowed key, Borrowed v) {
  check_int(PyDict_SetItem(d.get(), key.get(), v.get()));
}
inline bool dict_contains(Borrowed d, Borrowed key) {
  int r = PyDict_Contains(d.get(), key.get());
  if (r < 0)
    throw_error();
  return r != 0;
}
inline void dict_del(Borrowed d, Borrowed key) { check_int(PyDict_DelItem(d.get(), key.get())); }
// The dictionary's version tag: it changes whenever the dictionary changes,
// so a value looked up earlier is still current while the tag is the same.
inline uint64_t dict_version(Borrowed d) {
  return reinterpret_cast<PyDictObject *>(d.get())->ma_version_tag;
}

inline bool set_contains(Borrowed s, Borrowed key) {
  int r = PySet_Contains(s.get(), key.get());
  if (r < 0)
    throw_error();
  return r != 0;
}
inline void set_add(Borrowed s, Borrowed key) { check_int(PySet_Add(s.get(), key.get())); }
inline bool set_discard(Borrowed s, Borrowed key) {
  int r = PySet_Discard(s.get(), key.get());
  if (r < 0)
    throw_error();
  return r != 0;
}

inline void list_append(Borrowed l, Borrowed v) { check_int(PyList_Append(l.get(), v.get())); }

// Iterate any iterable: for_each(obj, [&](Borrowed item){...}).
// for_each_while stops early when f returns false.  Exact tuples and lists
// are walked by index, without an iterator object.
template <typename F> void for_each_while(Borrowed iterable, F &&f) {
  PyObject *o = iterable.get();
  if (PyTuple_CheckExact(o)) {
    Ref keep = iterable.ref();
    for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(o); ++i)
      if (!f(Borrowed(PyTuple_GET_ITEM(o, i))))
        return;
    return;
  }
  if (PyList_CheckExact(o)) {
    // As a list iterator walks it: by index, the length read at every step,
    // each item held while f runs.
    Ref keep = iterable.ref();
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(o); ++i) {
      Ref item = Ref::borrow(PyList_GET_ITEM(o, i));
      if (!f(item.borrowed()))
        return;
    }
    return;
  }
  Ref it = check(PyObject_GetIter(iterable.get()));
  for (;;) {
    Ref item = Ref::steal(PyIter_Next(it.get()));
    if (!item) {
      if (PyErr_Occurred())
        throw_error();
      return;
    }
    if (!f(item.borrowed()))
      return;
  }
}
template <typename F> void for_each(Borrowed iterable, F &&f) {
  for_each_while(iterable, [&](Borrowed item) {
    f(item);
    return true;
  });
}

} // namespace py
