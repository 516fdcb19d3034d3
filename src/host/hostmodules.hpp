// The host modules the coordinator imports when it loads, and the names it
// reaches them by.
//
// The module body imports its collaborators by name, once, in a fixed order
// (see the module's init).  Functions are then looked up on these module
// objects at call time, as Python code would, so a host application or a
// test can stand in for any of them by replacing a module attribute.
//
// Everything here is created once per process and deliberately never freed:
// the module supports a single initialisation per process, and freeing
// references from static destructors after the interpreter has finalised
// would be unsafe.
#pragma once

#include "host/pyref.hpp"

namespace host {

struct Modules {
  // standard library
  py::Ref bisect, collections, itertools, sys, time;
  // host application
  py::Ref textcache, ostrelgtk, logicalline, destroyable, location, mime, callutils, reflect,
      config, singleton;
  // the engine's own package
  py::Ref analysis, inferenceengine, inferencer, prefs, scopescanner, scopeinfo, symbolinfo,
      usageordereddict, utils, fastaccess, strutils;
};

// Filled by the module's init, in import order.
extern Modules *modules;

// Interned attribute and signal names used on the host boundary.  Created on
// first use of `names()`.
struct Names {
  py::Ref idle_add, idle_remove, timeout_add_while_alive, timeout_remove, NoArgCallback,
      NoObjCallback, priority;
  py::Ref IsAsyncInspectLocation, TreeBranchReady, _WaitForInspectMultiple;
  py::Ref GetSingletons, fGuiMgr, GetActiveDocument, GetDocuments, visible_only, include_help,
      CSourceEditor, fCache, fLocation, editor;
  py::Ref connect, connect_while_alive, class_connect_while_alive, disconnect, destroy;
  py::Ref get, Set, pop, items, first, write;
  py::Ref changed, now_tree_branch_ready, inspect_failed, cleared, active_document_changed,
      locations_added, locations_removed;
};

Names &names();

// Module attributes that the idle loop reaches on every scan.
enum class Attr : int {
  kWaitingForData, // scopescanner
  kFinishedScanning,
  kScanAbandoned,
  CWholeFilePrimaryScanner,
  CSingleScopePrimaryScanner,
  CWholeFileSecondaryScanner,
  CSingleScopeSecondaryScanner,
  CScanner,
  IsAsyncInspectLocation, // ostrelbase.location
  IsPythonSource,         // utils
  CPySourceAnalysis,      // analysis
  kCount
};

// The attribute as the module holds it now, or, while a Snapshot is open, as
// it held it when first read under that snapshot.
py::Ref attr(Attr a);

// One call of the idle callback reads each attribute of `Attr` at most once:
// the callback opens a Snapshot, and attr() keeps what it reads until the
// snapshot closes.  A host or a test that replaces a module attribute is
// seen from the next idle call on.  AddScanPairs, called from Python with a
// batch of pairs, opens one for the batch in the same way.  Snapshots do not nest: an inner one (a
// synchronous scan started by a collaborator inside the slice) shares the
// outer one.  Main thread only, like everything on this boundary.
class Snapshot {
public:
  Snapshot() noexcept;
  ~Snapshot();
  Snapshot(const Snapshot &) = delete;
  Snapshot &operator=(const Snapshot &) = delete;

  // The float object of `t`; the same object for repeated calls with the
  // same value while the snapshot is open (a slice's deadline is passed to
  // every scanner of the slice).
  static py::Ref floating(double t);

private:
  friend py::Ref attr(Attr a);
  bool active_ = false;
  py::Ref values_[static_cast<int>(Attr::kCount)];
  double float_value_ = 0.0;
  py::Ref float_obj_;
};

} // namespace host
