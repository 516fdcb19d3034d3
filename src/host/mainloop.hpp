// Main-loop scheduling: idle and timeout callbacks of the host's GUI loop
// (guiutils.ostrelgtk), looked up on the module at each call so that a host
// or a test can replace them.
#pragma once

#include "host/pyref.hpp"

namespace host::mainloop {

// ostrelgtk.idle_add(callback) -> id
py::Ref idle_add(py::Borrowed callback);
// ostrelgtk.idle_add(callback, priority=priority) -> id
py::Ref idle_add(py::Borrowed callback, py::Borrowed priority);
void idle_remove(py::Borrowed id);
// ostrelgtk.idle_add_while_alive(callback, owner) -> id
py::Ref idle_add_while_alive(py::Borrowed callback, py::Borrowed owner);
// ostrelgtk.timeout_add_while_alive(ms, callback, owner) -> id
py::Ref timeout_add_while_alive(long ms, py::Borrowed callback, py::Borrowed owner);
void timeout_remove(py::Borrowed id);
py::Ref NoArgCallback(py::Borrowed fn);
py::Ref NoObjCallback(py::Borrowed fn);

} // namespace host::mainloop
