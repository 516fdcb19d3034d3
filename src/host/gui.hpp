// GUI and editor: the application singletons, the GUI manager's documents.
#pragma once

#include "host/pyref.hpp"

namespace host::gui {

// singleton.GetSingletons()
py::Ref GetSingletons();
// The location of the active document when it is a source editor, else an
// empty Ref.  Imports the editor module on use, as the host expects.
py::Ref ActiveSourceEditorLocation(py::Borrowed gui_mgr);
// gui_mgr.GetDocuments(visible_only=True, include_help=False)
py::Ref VisibleDocuments(py::Borrowed gui_mgr);

} // namespace host::gui
