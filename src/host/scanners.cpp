// Scanner classes and states.
#include "host/scanners.hpp"
#include "host/hostmodules.hpp"

namespace host::scanners {

py::Ref Class(py::Borrowed name) { return py::getattr(modules->scopescanner, name); }

} // namespace host::scanners
