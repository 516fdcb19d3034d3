// The helper process, reached only through its proxy object.
#pragma once

#include "host/pyref.hpp"

namespace host::helperprocess {

// proxy.AddPairsToPrimaryQueue(pairs, first, callback=None)
void AddPairsToPrimaryQueue(py::Borrowed proxy, py::Borrowed pairs, py::Borrowed first);
// proxy.AddPairsToPrimaryQueue(pairs, priority=priority)
void AddPairsToPrimaryQueueAt(py::Borrowed proxy, py::Borrowed pairs, py::Borrowed priority);
// proxy.FlushQueue(callback=None)
void FlushQueue(py::Borrowed proxy);

} // namespace host::helperprocess
