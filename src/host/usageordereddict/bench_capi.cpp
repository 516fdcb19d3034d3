// _bench_capi: benchmark support for bench/bench_uod.py.
//
// Times one pass of an operation over a list of keys through the capsule
// table, exactly as a consuming extension module calls it (fetched from the
// module's `_C_API`, called through the function pointers), and one pass of
// the equivalent PyDict call over the same keys, so that both figures come
// from the same process, keys and moment.  Filling the containers before a
// pass is not timed.  Returns (ns per op on the mapping, ns per op on a dict).
//
// Operations (probe_keys are the keys in the order the timed pass uses them):
//   get, get_first          lookup of present keys (get_first moves to front)
//   set_front, set_back     Set of present keys to a new value
//   insert_front, insert_back  Set of absent keys into empty containers
//   pop, del                removal of every present key
#include "host/usageordereddict/object.hpp"

#include "host/usageordereddict/messages.hpp"
#include "host/usageordereddict_capi.h"

#include <chrono>

namespace uod {
namespace {

using Clock = std::chrono::steady_clock;

enum class Op { kGet, kGetFirst, kSetFront, kSetBack, kInsertFront, kInsertBack, kPop, kDel };

struct OpName {
  const char *name;
  Op op;
};
constexpr OpName kOps[] = {
    {"get", Op::kGet},
    {"get_first", Op::kGetFirst},
    {"set_front", Op::kSetFront},
    {"set_back", Op::kSetBack},
    {"insert_front", Op::kInsertFront},
    {"insert_back", Op::kInsertBack},
    {"pop", Op::kPop},
    {"del", Op::kDel},
};

Op parse_op(PyObject *name) {
  for (const OpName &o : kOps)
    if (PyUnicode_CompareWithASCIIString(name, o.name) == 0)
      return o.op;
  PyErr_Format(PyExc_ValueError, msg::kBenchUnknownOp, name);
  py::throw_error();
}

const CUsageOrderedDict_CAPI *api_of(PyObject *module) {
  py::Ref capsule = py::getattr(py::Borrowed(module), PY_NAME("_C_API"));
  void *p = PyCapsule_GetPointer(capsule.get(), CUSAGEORDEREDDICT_CAPSULE_NAME);
  if (!p)
    py::throw_error();
  return static_cast<const CUsageOrderedDict_CAPI *>(p);
}

// The mapping's pass.  `n` keys from `probe`, values from `values`.
double time_mapping(const CUsageOrderedDict_CAPI *api, Op op, PyObject *keys, PyObject *values,
                    PyObject *probe) {
  const Py_ssize_t n = PyList_GET_SIZE(probe);
  const Py_ssize_t nv = PyList_GET_SIZE(values);
  py::Ref d = py::check(api->create());
  const bool prefill = op != Op::kInsertFront && op != Op::kInsertBack;
  if (prefill)
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(keys); ++i)
      py::check_int(api->set(d.get(), PyList_GET_ITEM(keys, i), PyList_GET_ITEM(values, i), 0));

  const auto start = Clock::now();
  switch (op) {
  case Op::kGet:
  case Op::kGetFirst: {
    const int first = op == Op::kGetFirst;
    for (Py_ssize_t i = 0; i < n; ++i)
      if (!api->get(d.get(), PyList_GET_ITEM(probe, i), first))
        py::throw_error(); // every probe key is present
    break;
  }
  case Op::kSetFront:
  case Op::kSetBack:
  case Op::kInsertFront:
  case Op::kInsertBack: {
    const int first = op == Op::kSetFront || op == Op::kInsertFront;
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check_int(api->set(d.get(), PyList_GET_ITEM(probe, i),
                             PyList_GET_ITEM(values, (i + 1) % nv), first));
    break;
  }
  case Op::kPop:
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check(api->pop(d.get(), PyList_GET_ITEM(probe, i)));
    break;
  case Op::kDel:
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check_int(api->del(d.get(), PyList_GET_ITEM(probe, i)));
    break;
  }
  const auto stop = Clock::now();
  return std::chrono::duration<double, std::nano>(stop - start).count() / static_cast<double>(n);
}

// The dict's pass over the same keys with the nearest PyDict calls.
double time_dict(Op op, PyObject *keys, PyObject *values, PyObject *probe) {
  const Py_ssize_t n = PyList_GET_SIZE(probe);
  const Py_ssize_t nv = PyList_GET_SIZE(values);
  py::Ref d = py::new_dict();
  const bool prefill = op != Op::kInsertFront && op != Op::kInsertBack;
  if (prefill)
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(keys); ++i)
      py::check_int(PyDict_SetItem(d.get(), PyList_GET_ITEM(keys, i), PyList_GET_ITEM(values, i)));

  const auto start = Clock::now();
  switch (op) {
  case Op::kGet:
  case Op::kGetFirst:
    for (Py_ssize_t i = 0; i < n; ++i)
      if (!PyDict_GetItemWithError(d.get(), PyList_GET_ITEM(probe, i)))
        py::throw_error();
    break;
  case Op::kSetFront:
  case Op::kSetBack:
  case Op::kInsertFront:
  case Op::kInsertBack:
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check_int(PyDict_SetItem(d.get(), PyList_GET_ITEM(probe, i),
                                   PyList_GET_ITEM(values, (i + 1) % nv)));
    break;
  case Op::kPop:
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check(_PyDict_Pop(d.get(), PyList_GET_ITEM(probe, i), nullptr));
    break;
  case Op::kDel:
    for (Py_ssize_t i = 0; i < n; ++i)
      py::check_int(PyDict_DelItem(d.get(), PyList_GET_ITEM(probe, i)));
    break;
  }
  const auto stop = Clock::now();
  return std::chrono::duration<double, std::nano>(stop - start).count() / static_cast<double>(n);
}

py::Ref bench(PyObject *module, PyObject *const *args, Py_ssize_t nargs) {
  if (nargs != 5 || !PyUnicode_Check(args[0]) || !PyList_CheckExact(args[1]) ||
      !PyList_CheckExact(args[2]) || !PyList_CheckExact(args[3])) {
    PyErr_SetString(PyExc_TypeError, msg::kBenchUsage);
    py::throw_error();
  }
  const Op op = parse_op(args[0]);
  PyObject *keys = args[1];
  PyObject *values = args[2];
  PyObject *probe = args[3];
  const bool dict_first = py::truth(py::Borrowed(args[4]));
  if (PyList_GET_SIZE(values) < PyList_GET_SIZE(keys) || PyList_GET_SIZE(probe) == 0) {
    PyErr_SetString(PyExc_ValueError, msg::kBenchNeedKeys);
    py::throw_error();
  }
  const CUsageOrderedDict_CAPI *api = api_of(module);
  double mapping_ns, dict_ns;
  if (dict_first) {
    dict_ns = time_dict(op, keys, values, probe);
    mapping_ns = time_mapping(api, op, keys, values, probe);
  } else {
    mapping_ns = time_mapping(api, op, keys, values, probe);
    dict_ns = time_dict(op, keys, values, probe);
  }
  py::Ref a = py::floating(mapping_ns);
  py::Ref b = py::floating(dict_ns);
  return py::check(PyTuple_Pack(2, a.get(), b.get()));
}

} // namespace

PyObject *bench_capi(PyObject *module, PyObject *const *args, Py_ssize_t nargs) {
  PY_GUARD(nullptr, return bench(module, args, nargs).release();)
}

} // namespace uod
