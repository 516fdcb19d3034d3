// The information cache: scope information storage and its location cache.
#pragma once

#include "host/pyref.hpp"

namespace host::infocache {

// scopeinfo.CInfoCache, looked up on the module at each use.
py::Ref InfoCacheClass();
// info_cache.fLocCache.WantDerivedInfo(loc), as a truth value
bool WantDerivedInfo(py::Borrowed info_cache, py::Borrowed loc);

} // namespace host::infocache
