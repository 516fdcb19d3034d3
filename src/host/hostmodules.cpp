// Storage for the imported host modules and the interned boundary names.
#include "host/hostmodules.hpp"

namespace host {

Modules *modules = nullptr;

Names &names() {
  static Names *n = [] {
    auto *p = new Names;
    p->idle_add = PY_NAME("idle_add");
    p->idle_remove = PY_NAME("idle_remove");
    p->timeout_add_while_alive = PY_NAME("timeout_add_while_alive");
    p->timeout_remove = PY_NAME("timeout_remove");
    p->NoArgCallback = PY_NAME("NoArgCallback");
    p->NoObjCallback = PY_NAME("NoObjCallback");
    p->priority = PY_NAME("priority");
    p->IsAsyncInspectLocation = PY_NAME("IsAsyncInspectLocation");
    p->TreeBranchReady = PY_NAME("TreeBranchReady");
    p->_WaitForInspectMultiple = PY_NAME("_WaitForInspectMultiple");
    p->GetSingletons = PY_NAME("GetSingletons");
    p->fGuiMgr = PY_NAME("fGuiMgr");
    p->GetActiveDocument = PY_NAME("GetActiveDocument");
    p->GetDocuments = PY_NAME("GetDocuments");
    p->visible_only = PY_NAME("visible_only");
    p->include_help = PY_NAME("include_help");
    p->CSourceEditor = PY_NAME("CSourceEditor");
    p->fCache = PY_NAME("fCache");
    p->fLocation = PY_NAME("fLocation");
    p->editor = PY_NAME("editor");
    p->connect = PY_NAME("connect");
    p->connect_while_alive = PY_NAME("connect_while_alive");
    p->class_connect_while_alive = PY_NAME("class_connect_while_alive");
    p->disconnect = PY_NAME("disconnect");
    p->destroy = PY_NAME("destroy");
    p->get = PY_NAME("get");
    p->Set = PY_NAME("Set");
    p->pop = PY_NAME("pop");
    p->items = PY_NAME("items");
    p->first = PY_NAME("first");
    p->write = PY_NAME("write");
    p->changed = PY_NAME("changed");
    p->now_tree_branch_ready = PY_NAME("now-tree-branch-ready");
    p->inspect_failed = PY_NAME("inspect-failed");
    p->cleared = PY_NAME("cleared");
    p->active_document_changed = PY_NAME("active-document-changed");
    p->locations_added = PY_NAME("locations-added");
    p->locations_removed = PY_NAME("locations-removed");
    return p;
  }();
  return *n;
}

namespace {

Snapshot *g_snapshot = nullptr;

struct AttrSource {
  py::Ref Modules::*module;
  const char *name;
};
constexpr AttrSource kSources[] = {{&Modules::scopescanner, "kWaitingForData"},
                                   {&Modules::scopescanner, "kFinishedScanning"},
                                   {&Modules::scopescanner, "kScanAbandoned"},
                                   {&Modules::scopescanner, "CWholeFilePrimaryScanner"},
                                   {&Modules::scopescanner, "CSingleScopePrimaryScanner"},
                                   {&Modules::scopescanner, "CWholeFileSecondaryScanner"},
                                   {&Modules::scopescanner, "CSingleScopeSecondaryScanner"},
                                   {&Modules::scopescanner, "CScanner"},
                                   {&Modules::location, "IsAsyncInspectLocation"},
                                   {&Modules::utils, "IsPythonSource"},
                                   {&Modules::analysis, "CPySourceAnalysis"}};
static_assert(sizeof(kSources) / sizeof(kSources[0]) == static_cast<size_t>(Attr::kCount));

PyObject *source_name(int i) {
  static PyObject **names = [] {
    auto **n = new PyObject *[static_cast<int>(Attr::kCount)];
    for (int k = 0; k < static_cast<int>(Attr::kCount); ++k)
      n[k] = py::intern(kSources[k].name).release();
    return n;
  }();
  return names[i];
}

} // namespace

py::Ref attr(Attr a) {
  const int i = static_cast<int>(a);
  py::Ref *slot = g_snapshot ? &g_snapshot->values_[i] : nullptr;
  if (slot && *slot)
    return *slot;
  py::Ref v = py::module_attr(modules->*kSources[i].module, py::Borrowed(source_name(i)));
  if (slot)
    *slot = v;
  return v;
}

Snapshot::Snapshot() noexcept {
  if (!g_snapshot) {
    g_snapshot = this;
    active_ = true;
  }
}

Snapshot::~Snapshot() {
  if (active_)
    g_snapshot = nullptr;
}

py::Ref Snapshot::floating(double t) {
  Snapshot *s = g_snapshot;
  if (s && s->float_obj_ && s->float_value_ == t)
    return s->float_obj_;
  py::Ref f = py::floating(t);
  if (s) {
    s->float_value_ = t;
    s->float_obj_ = f;
  }
  return f;
}

} // namespace host
