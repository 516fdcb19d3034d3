// Storage for the imported host modules and the interned boundary names.
#include "host/hostmodules.hpp"

namespace host {

Modules *modules = nullptr;

Names &names() {
  static Names *n = [] {
    auto *p = new Names;
    p->idle_add = py::interned("idle_add");
    p->idle_remove = py::interned("idle_remove");
    p->timeout_add_while_alive = py::interned("timeout_add_while_alive");
    p->timeout_remove = py::interned("timeout_remove");
    p->NoArgCallback = py::interned("NoArgCallback");
    p->NoObjCallback = py::interned("NoObjCallback");
    p->priority = py::interned("priority");
    p->IsAsyncInspectLocation = py::interned("IsAsyncInspectLocation");
    p->TreeBranchReady = py::interned("TreeBranchReady");
    p->_WaitForInspectMultiple = py::interned("_WaitForInspectMultiple");
    p->GetSingletons = py::interned("GetSingletons");
    p->fGuiMgr = py::interned("fGuiMgr");
    p->GetActiveDocument = py::interned("GetActiveDocument");
    p->GetDocuments = py::interned("GetDocuments");
    p->visible_only = py::interned("visible_only");
    p->include_help = py::interned("include_help");
    p->CSourceEditor = py::interned("CSourceEditor");
    p->fCache = py::interned("fCache");
    p->fLocation = py::interned("fLocation");
    p->editor = py::interned("editor");
    p->connect = py::interned("connect");
    p->connect_while_alive = py::interned("connect_while_alive");
    p->class_connect_while_alive = py::interned("class_connect_while_alive");
    p->disconnect = py::interned("disconnect");
    p->destroy = py::interned("destroy");
    p->get = py::interned("get");
    p->Set = py::interned("Set");
    p->pop = py::interned("pop");
    p->items = py::interned("items");
    p->first = py::interned("first");
    p->write = py::interned("write");
    p->changed = py::interned("changed");
    p->now_tree_branch_ready = py::interned("now-tree-branch-ready");
    p->inspect_failed = py::interned("inspect-failed");
    p->cleared = py::interned("cleared");
    p->active_document_changed = py::interned("active-document-changed");
    p->locations_added = py::interned("locations-added");
    p->locations_removed = py::interned("locations-removed");
    return p;
  }();
  return *n;
}

} // namespace host
