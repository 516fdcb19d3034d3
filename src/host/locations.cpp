// Locations and the location data cache.
#include "host/locations.hpp"
#include "host/hostmodules.hpp"

namespace host::locations {

bool IsAsyncInspectLocation(py::Borrowed loc) {
  py::Ref f = attr(Attr::IsAsyncInspectLocation);
  return py::truth(py::call(f, loc));
}

bool TreeBranchReady(py::Borrowed data_cache, py::Borrowed loc) {
  return py::truth(
      py::call_method(data_cache, names().TreeBranchReady, loc, py::Borrowed(Py_True)));
}

} // namespace host::locations
