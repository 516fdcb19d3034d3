// Every message text the usage-ordered mapping raises, in one place.  Tests
// assert these verbatim, so change them here and in the tests together.
#pragma once

namespace uod::msg {

inline constexpr const char kMutatedDuringIteration[] =
    "CUsageOrderedDict mutated during iteration";
inline constexpr const char kMutatedDuringLookup[] =
    "CUsageOrderedDict kept changing while a key was being compared";
inline constexpr const char kTakesNoArguments[] = "CUsageOrderedDict() takes no arguments";
inline constexpr const char kNoItemAssignment[] =
    "CUsageOrderedDict does not support item assignment; use Set(key, value, first)";
inline constexpr const char kFull[] = "CUsageOrderedDict cannot hold more entries";
// %s: the type name of the object that was passed instead.
inline constexpr const char kExpectedMapping[] = "expected a CUsageOrderedDict, got %s";

// Argument parsing of the methods (same wording as CPython's own).
// %s: method name, %d: limit, %zd: given.
inline constexpr const char kTooManyArguments[] = "%s() takes at most %d arguments (%zd given)";
// %s: method name, %s: parameter name, %d: position.
inline constexpr const char kMissingArgument[] = "%s() missing required argument '%s' (pos %d)";
// %s: method name, %U: keyword.
inline constexpr const char kUnexpectedKeyword[] = "%s() got an unexpected keyword argument '%U'";
// %s: method name, %s: parameter name.
inline constexpr const char kDuplicateArgument[] = "%s() got multiple values for argument '%s'";

// _bench_capi, the benchmark support function.
inline constexpr const char kBenchUsage[] =
    "_bench_capi(op: str, keys: list, values: list, probe_keys: list, dict_first: bool)";
// %R: the operation name.
inline constexpr const char kBenchUnknownOp[] = "unknown benchmark operation %R";
inline constexpr const char kBenchNeedKeys[] = "need a value per key and at least one probe key";

} // namespace uod::msg
