// The cache manager and its text buffers.
#include "host/cachemgr.hpp"

namespace host::cachemgr {

py::Ref DoesCacheBufferExist(py::Borrowed cache_mgr, py::Borrowed loc) {
  static py::Ref *n = new py::Ref(PY_NAME("DoesCacheBufferExist"));
  return py::call_method(cache_mgr, *n, loc, py::Borrowed(Py_True));
}

void ClearEOLBlindCacheAndScans(py::Borrowed cache_mgr) {
  static py::Ref *n = new py::Ref(PY_NAME("_ClearEOLBlindCacheAndScans"));
  py::call_method(cache_mgr, *n);
}

} // namespace host::cachemgr
