// GUI and editor.
#include "host/gui.hpp"
#include "host/hostmodules.hpp"

namespace host::gui {

py::Ref GetSingletons() { return py::call(py::getattr(modules->singleton, names().GetSingletons)); }

py::Ref ActiveSourceEditorLocation(py::Borrowed gui_mgr) {
  // from edit import editor
  py::Ref fromlist = py::check(PyTuple_Pack(1, names().editor.get()));
  py::Ref edit = py::check(PyImport_ImportModuleLevel("edit", nullptr, nullptr, fromlist.get(), 0));
  py::Ref editor = py::getattr(edit, names().editor);
  py::Ref doc = py::call_method(gui_mgr, names().GetActiveDocument);
  py::Ref cls = py::getattr(editor, names().CSourceEditor);
  int is = PyObject_IsInstance(doc.get(), cls.get());
  if (is < 0)
    py::throw_error();
  if (!is)
    return py::Ref();
  return py::getattr(py::getattr(doc, names().fCache), names().fLocation);
}

py::Ref VisibleDocuments(py::Borrowed gui_mgr) {
  static py::Ref *kwnames = new py::Ref(
      py::check(PyTuple_Pack(2, names().visible_only.get(), names().include_help.get())));
  py::Ref f = py::getattr(gui_mgr, names().GetDocuments);
  PyObject *argv[] = {Py_True, Py_False};
  return py::call_kw(f, argv, 0, *kwnames);
}

} // namespace host::gui
