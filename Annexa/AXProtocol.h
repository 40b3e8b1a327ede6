// The daemon's request protocol as both sides see it: the service name, the protocol versions, the
// request names, the message keys and the error codes of replies (docs/rpx-wire.md and
// docs/client-library.md). The client library and the daemon include this one header, so a code or
// a key has one spelling.
#pragma once

#include <cstdint>

namespace annexa {

inline constexpr const char* kDefaultServiceName = "com.corvane.annexa.axd";

// The daemon serves every version from the oldest to the current alike; the client sends the
// current one.
inline constexpr uint64_t kOldestProtocolVersion = 2;
inline constexpr uint64_t kCurrentProtocolVersion = 3;

// The codes of "errorcode" in a reply, and of errors of the domain "Annexa". 0 is success.
enum class AXErrorCode : int64_t {
    None = 0,
    RegistryRefused = 2,      // the registry refused, or the caller or plug-in is unknown to it
    InvalidRequest = 4,       // malformed or unusable request; also a failed exchange in the client
    BadProtocolSpec = 6,      // a plug-in's protocol description is malformed
    VersionMismatch = 7,      // protocol or annotation-file version
    BadPath = 9,              // bad or unknown path
    NotEntitled = 11,         // caller not entitled or not authorised
    PlugInUnusable = 12,      // the plug-in's definition cannot be used
    Busy = 14,                // plug-ins busy
    ReceiptUnavailable = 15,  // the receipt file cannot be read
    BadAnnotation = 18,       // bad annotation value
};

inline constexpr int64_t errorCodeValue(AXErrorCode code) { return static_cast<int64_t>(code); }

// Request names, the value of kRequest.
namespace request {
inline constexpr const char* kAdd = "add";
inline constexpr const char* kRemove = "remove";
inline constexpr const char* kBulk = "bulk";
inline constexpr const char* kMatch = "match";
inline constexpr const char* kReady = "ready";
inline constexpr const char* kAccess = "access";
inline constexpr const char* kAnnotate = "annotate";
inline constexpr const char* kBulkAnnotate = "bulk-annotate";
inline constexpr const char* kLock = "lock";
inline constexpr const char* kReceipt = "receipt";
// Our own: keeps the connection subscribed to the registry's changes (docs/axd.md).
inline constexpr const char* kWatch = "watch";
}  // namespace request

// The option bits of a "match" request's "flags".
namespace discovery {
inline constexpr uint64_t kAllVersions = 0x1;  // every version of an identifier
inline constexpr uint64_t kDuplicates = 0x4;   // with kAllVersions: equal versions too
inline constexpr uint64_t kSystemOnly = 0x8;   // only plug-ins on the system volume
inline constexpr uint64_t kAll = 0x200;        // privileged: no visibility rules, no authorization
inline constexpr uint64_t kExplain = 0x10000;  // our own: say, for every plug-in, why it was left out
}  // namespace discovery

// Keys of requests and replies.
namespace message {
inline constexpr const char* kRequest = "request";
inline constexpr const char* kVersion = "version";
inline constexpr const char* kPaths = "paths";
inline constexpr const char* kUuids = "uuids";
inline constexpr const char* kFlags = "flags";
inline constexpr const char* kAnnotations = "annotations";
inline constexpr const char* kRules = "rules";
// With the explain flag, from a manager: the application whose view the explanation gives.
inline constexpr const char* kHost = "host";
inline constexpr const char* kExtensions = "extensions";
inline constexpr const char* kConflicts = "conflicts";
inline constexpr const char* kMatches = "matches";
inline constexpr const char* kData = "data";
inline constexpr const char* kErrorCode = "errorcode";
inline constexpr const char* kError = "error";
// Beside an error: the cause a lower layer gave (the registry, the service manager), for people.
inline constexpr const char* kReason = "reason";
}  // namespace message

}  // namespace annexa
