// Scanner classes and states.
#include "host/scanners.hpp"
#include "host/hostmodules.hpp"

namespace host::scanners {

py::Ref State(const char *name) { return py::getattr(modules->scopescanner, name); }
py::Ref Class(const char *name) { return py::getattr(modules->scopescanner, name); }

} // namespace host::scanners
