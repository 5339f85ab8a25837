// The platform's own web API "KOVA.Core.ISCSI.LUN", registered for in-process
// calls (KOVA::APIRunner::Exec) when the platform library is loaded.
//
// Version 1, method "get": {"uuid": TEXT} answers {"lun": {"uuid", "name",
// "size_mb", "location"}} from the LUN registry; a missing or non-text uuid is
// error 101, an unknown one kLunErrorNotFound, an unreadable registry 100.

#ifndef KOVA_PLATFORM_SRC_LUN_API_H_
#define KOVA_PLATFORM_SRC_LUN_API_H_

namespace kova {

inline constexpr char kLunApi[] = "KOVA.Core.ISCSI.LUN";
inline constexpr int kLunErrorNotFound = 18990;  // no LUN has the uuid

}  // namespace kova

#endif  // KOVA_PLATFORM_SRC_LUN_API_H_
