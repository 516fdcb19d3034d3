// The information cache.
#include "host/infocache.hpp"
#include "host/hostmodules.hpp"

namespace host::infocache {

py::Ref InfoCacheClass() { return py::getattr(modules->scopeinfo, PY_NAME("CInfoCache")); }

bool WantDerivedInfo(py::Borrowed info_cache, py::Borrowed loc) {
  static py::Ref *s_loc_cache = new py::Ref(PY_NAME("fLocCache"));
  static py::Ref *s_want = new py::Ref(PY_NAME("WantDerivedInfo"));
  py::Ref loc_cache = py::getattr(info_cache, *s_loc_cache);
  return py::truth(py::call_method(loc_cache, *s_want, loc));
}

} // namespace host::infocache
