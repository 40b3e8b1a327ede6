// The keys of spawnd's messages (docs/spawnd.md), shared by its clients and the daemon.
#pragma once

namespace corvane::spawn::protocol {

// Requests on the service manager's endpoint.
inline constexpr const char* kRequest = "request";
inline constexpr const char* kAdd = "add";
inline constexpr const char* kRemove = "remove";
inline constexpr const char* kConnect = "connect";
inline constexpr const char* kHost = "host";
inline constexpr const char* kExecutable = "executable";
inline constexpr const char* kOverlay = "overlay";
inline constexpr const char* kBundleIdentifier = "bundleIdentifier";
inline constexpr const char* kBundleVersion = "bundleVersion";
// Replies.
inline constexpr const char* kResult = "result";
inline constexpr const char* kFd = "fd";
inline constexpr const char* kErrno = "errno";
inline constexpr const char* kError = "error";
inline constexpr const char* kStatus = "status";
inline constexpr const char* kSignal = "signal";
// The assertion service.
inline constexpr const char* kBundleIdentifiers = "bundleIdentifiers";
inline constexpr const char* kInstances = "instances";
// The control connection between spawnd and an instance.
inline constexpr const char* kConnection = "connection";
inline constexpr const char* kIdle = "idle";
inline constexpr const char* kBusy = "busy";
inline constexpr const char* kAssertion = "assertion";
inline constexpr const char* kUnbusy = "unbusy";
// The overlay.
inline constexpr const char* kService = "RPXService";
inline constexpr const char* kEnvironment = "EnvironmentVariables";
inline constexpr const char* kSandboxProfile = "_SandboxProfile";
// The plug-in's data container, by its identifier: spawnd opens it in the user's containers (class
// 4) itself and makes HOME, TMPDIR and the XDG directories of it.
inline constexpr const char* kDataContainer = "_DataContainer";
// The memory the instance may use, in bytes (from the extension point's SDK definition).
inline constexpr const char* kMemoryLimit = "_MemoryLimit";
inline constexpr const char* kPackageType = "KFBundlePackageType";

}  // namespace corvane::spawn::protocol
