// Functions of the engine's scope scanner module that only the synchronous
// scans use, looked up on the module at each use so that a host or a test can
// replace them.  The scanner classes and states the idle loop uses on every
// scan are host::attr() entries (hostmodules.hpp).
#pragma once

#include "host/pyref.hpp"

namespace host::scanners {

// An attribute of pysource.scopescanner (CreateClassInstInfo, ...).
py::Ref Class(py::Borrowed name);

} // namespace host::scanners
