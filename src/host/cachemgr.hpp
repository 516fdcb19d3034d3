// The cache manager and its text buffers.
#pragma once

#include "host/pyref.hpp"

namespace host::cachemgr {

// cache_mgr.DoesCacheBufferExist(loc, True): the open buffer or None
py::Ref DoesCacheBufferExist(py::Borrowed cache_mgr, py::Borrowed loc);
// cache_mgr._ClearEOLBlindCacheAndScans()
void ClearEOLBlindCacheAndScans(py::Borrowed cache_mgr);

} // namespace host::cachemgr
