// Per-user data containers: private directories, one per class and identifier, made with mode
// 0700 under <per-user data>/containers/<class>/<identifier>.
//
// Classes in use: 4, the data container of a plug-in (identifier: the plug-in's identifier);
// 10, the data container of a daemon (identifier: the daemon's name).
//
// Thread-safe.
#pragma once

#include <string>

#include "platform/value/Value.h"

namespace corvane::containers {

inline constexpr const char* kErrorDomain = "com.corvane.containers";
inline constexpr int64_t kInvalidArgument = 22;
inline constexpr int64_t kNotFound = 2;
inline constexpr int64_t kCannotCreate = 5;

inline constexpr int kPlugInDataClass = 4;
inline constexpr int kDaemonDataClass = 10;

// The container's path; with `create`, made when missing. Errors carry kErrorDomain and one of the
// codes above.
Result<std::string> lookupDataContainer(int containerClass, const std::string& identifier, bool create);

}  // namespace corvane::containers
