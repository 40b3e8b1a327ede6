// The service manager: runs plug-ins for their hosts, each in a sandbox (docs/spawnd.md).
//
// The daemon spawnd serves four rpx endpoints from one process:
//   - kEndpoint ("com.corvane.spawnd"): a registrar holding kDomainExtensionProxyEntitlement
//     registers a plug-in's executable, with its launch settings (the activation overlay), in a
//     host process's domain; a host connects to a plug-in of its own domain and gets a socket
//     connected to a running instance of it, launched on demand under the overlay's sandbox
//     profile; the registrar removes a bundle's registrations and ends its instances.
//   - kAssertionEndpoint ("com.corvane.vigild"): which plug-in instances are busy.
//   - the sandbox token broker and the privacy-consent service (platform/sandbox, platform/pcx).
//
// The functions below are the client side: each is one round trip on a connection of its own, made
// from the calling thread (never from an rpx delivery queue). InstanceControl is the plug-in's
// side of its control connection, which spawnd hands to every instance it launches.
//
// Thread-safety: every function and class here may be used from any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/Dispatch.h"
#include "platform/rpx/Rpx.h"
#include "platform/value/Value.h"

namespace corvane::spawn {

inline constexpr const char* kEndpoint = "com.corvane.spawnd";
inline constexpr const char* kAssertionEndpoint = "com.corvane.vigild";
// Registering and removing external services needs this entitlement in the caller's signature.
inline constexpr const char* kDomainExtensionProxyEntitlement = "com.corvane.private.rpx.domain-extension.proxy";
// The keys of a busy instance's description.
inline constexpr const char* kBundleIdentifierKey = "bundleIdentifier";
inline constexpr const char* kPidKey = "pid";
inline constexpr const char* kReasonKey = "reason";
// Set in a launched instance's environment: the descriptor of its control connection.
inline constexpr const char* kControlDescriptorVariable = "CORVANE_SPAWN_CONTROL_FD";
// Whether an environment variable names the instance's container or its sandbox (HOME, TMPDIR,
// KFFIXED_USER_HOME, XDG_*, CORVANE_*): spawnd sets these itself, last, from the container it
// opens, and a value in an overlay is dropped.
bool isReservedVariable(const std::string& name);

// What removeExternalService answers when no domain holds the bundle.
inline constexpr int kNothingOnRecord = 3;

// Registers `executablePath` (the executable of a plug-in bundle) as an external service of the
// process `hostPid`, with `overlay` ({"RPXService": {...}, "KFBundlePackageType": "RPX!"}) as its
// launch settings. 0, or an errno value: EPERM without the entitlement, ESRCH when the host is
// gone, ENOENT when there is no executable or no bundle around it, EINVAL for an executable that is
// not a regular file or an overlay of the wrong shape, EHOSTUNREACH when spawnd cannot be reached.
// On failure, `reason` (when given) gets what spawnd said, or why it could not be asked.
int addExternalService(pid_t hostPid, const std::string& executablePath, const Value& overlay,
                       std::string* reason = nullptr);
// Drops the registrations of a bundle from every domain and ends its running instances. 0,
// kNothingOnRecord, or an errno value as above. An empty version matches every version.
int removeExternalService(const std::string& bundleIdentifier, const std::string& bundleVersion);

// Connects the calling process to an instance of the plug-in `bundleIdentifier` registered in its
// own domain: a stream socket whose other end the instance serves. The error says why not (its
// code an errno value: ENOENT when the domain has no such service, ECONNREFUSED when the instance
// ended before accepting, ETIMEDOUT when it did not accept in time, ...).
Result<std::shared_ptr<FileDescriptor>> connectToService(const std::string& bundleIdentifier);

// The busy instances of the given bundles: dictionaries with kBundleIdentifierKey, kPidKey and
// kReasonKey. An error when the assertion service cannot be reached.
Result<Array> busyExtensionInstances(const std::vector<std::string>& bundleIdentifiers);

// The plug-in's side of its control connection to spawnd.
class InstanceControl {
public:
    // The control connection named by kControlDescriptorVariable, or null when this process was not
    // launched by spawnd. `queue` delivers the host connections. The descriptor is closed on exec
    // from then on, so that programs the plug-in runs do not inherit it.
    static std::shared_ptr<InstanceControl> fromEnvironment(dispatch::QueuePtr queue);
    ~InstanceControl();

    // Receives each host connection's socket; set before resume().
    void setConnectionHandler(std::function<void(std::shared_ptr<FileDescriptor>)> handler);
    // Called once when spawnd is gone (the control connection ended).
    void setInvalidationHandler(std::function<void()> handler);
    void resume();

    // Tells spawnd whether the instance serves no host connection now; an idle instance is ended
    // after spawnd's idle timeout.
    void setIdle(bool idle);
    // Busy assertions: while one is held, the instance is reported busy with its reason.
    uint64_t beginBusy(const std::string& reason);
    void endBusy(uint64_t assertion);

private:
    explicit InstanceControl(rpx::ConnectionPtr control) : control_(std::move(control)) {}
    rpx::ConnectionPtr control_;
    std::function<void(std::shared_ptr<FileDescriptor>)> connectionHandler_;
    std::function<void()> invalidationHandler_;
};

}  // namespace corvane::spawn
