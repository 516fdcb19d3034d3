// CScanCoordinator: status reporting and database writes.
//
// While scans are queued a one-second timeout emits "scan-status-update"
// with a CScanStatus; the timeout removes itself (its callback returns False
// after clearing __fStatusTimeout) once the queues are empty.  When the idle
// loop finds the queue empty it schedules one database-write idle; a request
// while one is pending is ignored.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/hostmodules.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"
#include "host/orderedmap.hpp"

namespace scancoord::co {

Ref GetStatus(C *c) {
  ScanQueueObject *q = queue(c);
  Ref list = py::new_list();
  Ref queues = q->f._fOrderedQueues;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(queues.get()); ++i) {
    Ref sq_obj = Ref::borrow(PyList_GET_ITEM(queues.get(), i));
    SingleQueueObject *sq = as_single_queue(sq_obj.get());
    const Py_ssize_t count = host::orderedmap::size(sq->f.fOrderedDict);
    if (count == 0)
      continue;
    Ref name = or_none(sq->f.fScanName);
    Ref prio = py::integer(sq->f.fPriority);
    Ref n = py::check(PyLong_FromSsize_t(count));
    py::list_append(list, py::call(state->CSingleQueueStatus, name, prio, n));
  }
  Ref waiting = py::check(PyLong_FromSsize_t(sq::GetWaitingCount(q)));
  return py::call(state->CScanStatus, list, waiting);
}

void EnsureStatusTimeout(C *c) {
  if (call::QueuesEmpty(c, false))
    return;
  if (c->f.fStatusTimeout && !c->f.fStatusTimeout.is_none())
    return;
  Ref cb = py::getattr(self_of(c), PY_NAME("_CB_UpdateStatus"));
  c->f.fStatusTimeout = host::mainloop::timeout_add_while_alive(1000, cb, self_of(c));
}

bool CB_UpdateStatus(C *c) {
  Ref status = call::GetStatus(c);
  host::objectmodel::emit(self_of(c), PY_NAME("scan-status-update"), self_of(c), status);
  if (call::QueuesEmpty(c, false)) {
    c->f.fStatusTimeout = Ref::none();
    return false;
  }
  return true;
}

void ScheduleWriteToDatabaseIdle(C *c) {
  if (c->f._fIdleToWriteToDatabase && !c->f._fIdleToWriteToDatabase.is_none())
    return;
  Ref cb = py::getattr(self_of(c), PY_NAME("_CB_WriteToDatabase"));
  c->f._fIdleToWriteToDatabase = host::mainloop::idle_add_while_alive(cb, self_of(c));
}

void CB_WriteToDatabase(C *c) {
  c->f._fIdleToWriteToDatabase = Ref::none();
  Ref info_cache = py::getattr(c->f.fAnaMgr, PY_NAME("fInfoCache"));
  py::call_method(info_cache, PY_NAME("WriteToDatabase"));
}

} // namespace scancoord::co
