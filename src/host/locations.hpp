// Locations and the location data cache: whether a file's data is available.
#pragma once

#include "host/pyref.hpp"

namespace host::locations {

// location.IsAsyncInspectLocation(loc)
bool IsAsyncInspectLocation(py::Borrowed loc);
// data_cache.TreeBranchReady(loc, True), as a truth value
bool TreeBranchReady(py::Borrowed data_cache, py::Borrowed loc);

} // namespace host::locations
