// The engine's usage-ordered mapping (pysource.usageordereddict), as the
// single scan queues use it.
//
// For a mapping whose type is exactly CUsageOrderedDict the calls go straight
// to the C entry points exported by its module; for anything else (a Python
// subclass, a host replacement) they go through the Python methods, so that
// overrides are honoured.  Both paths have the same semantics.
#pragma once

#include "host/pyref.hpp"
#include "host/usageordereddict_capi.h"

namespace host::orderedmap {

void import_api();
const CUsageOrderedDict_CAPI &api();

// CUsageOrderedDict()
py::Ref create();
// d.get(key, None, first); empty Ref when absent
py::Ref get(py::Borrowed d, py::Borrowed key, bool first);
// d.get(key); empty Ref when absent
py::Ref get(py::Borrowed d, py::Borrowed key);
// get(d, key), for a key that is often the first entry's own key object: then
// the first entry's value, without hashing or comparing the key.
py::Ref get_likely_first(py::Borrowed d, py::Borrowed key);
// d.Set(key, value, first=first)
void set(py::Borrowed d, py::Borrowed key, py::Borrowed value, bool first);
// d.pop(key, None); empty Ref when absent
py::Ref pop(py::Borrowed d, py::Borrowed key);
// del d[key]
void del(py::Borrowed d, py::Borrowed key);
Py_ssize_t size(py::Borrowed d);
// d._fFirst.key / .val; false when empty
bool first(py::Borrowed d, py::Ref &key, py::Ref &value);
// d.items() as an iterable
py::Ref items(py::Borrowed d);

} // namespace host::orderedmap
