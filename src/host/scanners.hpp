// Scanner classes and states of the engine's scope scanner module, looked up
// on the module at each use so that a host or a test can replace them.
#pragma once

#include "host/pyref.hpp"

namespace host::scanners {

// A state constant of pysource.scopescanner (kWaitingForData, ...).
py::Ref State(py::Borrowed name);
// A scanner class of pysource.scopescanner.
py::Ref Class(py::Borrowed name);

} // namespace host::scanners
