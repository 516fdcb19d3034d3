// Main-loop scheduling through guiutils.ostrelgtk.
#include "host/mainloop.hpp"
#include "host/hostmodules.hpp"

namespace host::mainloop {

namespace {
py::Ref fn(py::Borrowed name) { return py::module_attr(modules->ostrelgtk, name); }
} // namespace

py::Ref idle_add(py::Borrowed callback) { return py::call(fn(names().idle_add), callback); }

py::Ref idle_add(py::Borrowed callback, py::Borrowed priority) {
  static py::Ref *kwnames = new py::Ref(py::check(PyTuple_Pack(1, names().priority.get())));
  py::Ref f = fn(names().idle_add);
  PyObject *argv[] = {callback.get(), priority.get()};
  return py::call_kw(f, argv, 1, *kwnames);
}

py::Ref idle_add_while_alive(py::Borrowed callback, py::Borrowed owner) {
  static py::Ref *name = new py::Ref(PY_NAME("idle_add_while_alive"));
  return py::call(fn(*name), callback, owner);
}

void idle_remove(py::Borrowed id) { py::call(fn(names().idle_remove), id); }

py::Ref timeout_add_while_alive(long ms, py::Borrowed callback, py::Borrowed owner) {
  py::Ref interval = py::integer(ms);
  return py::call(fn(names().timeout_add_while_alive), interval, callback, owner);
}

void timeout_remove(py::Borrowed id) { py::call(fn(names().timeout_remove), id); }

py::Ref NoArgCallback(py::Borrowed f) { return py::call(fn(names().NoArgCallback), f); }
py::Ref NoObjCallback(py::Borrowed f) { return py::call(fn(names().NoObjCallback), f); }

} // namespace host::mainloop
