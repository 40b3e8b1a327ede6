// The client side of the daemon's request protocol: one operation per request; each builds the
// request message, sends it with a reply expected and hands the raw reply to the completion, once,
// on the queue "axd_client". errorInReply and convertFromRPX turn a reply into an error or into
// in-memory values.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Annexa/AXUtilities.h"
#include "platform/rpx/Rpx.h"

namespace annexa {


// Thread-safe: requests may be made from any thread; completions and connection events run on the
// queue "axd_client", one at a time.
//
// A request made after the connection ended (the daemon restarted, or was not there yet) connects
// again first, once per request: a long-running host survives a daemon restart without making a
// new client. A request under way when the connection ends fails with "Connection invalid".
class AXDaemonClient {
public:
    using Completion = std::function<void(const corvane::rpx::Reply&)>;

    // Connects to the named endpoint, or to "com.corvane.annexa.axd" without a name.
    explicit AXDaemonClient(const std::optional<std::string>& serviceName = std::nullopt);
    ~AXDaemonClient();
    AXDaemonClient(const AXDaemonClient&) = delete;
    AXDaemonClient& operator=(const AXDaemonClient&) = delete;

    void addPlugIns(const std::vector<std::string>& paths, Completion reply);
    void removePlugIns(const std::vector<std::string>& paths, Completion reply);
    void bulkPlugIns(uint64_t flags, Completion reply);
    void readyPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply);
    void accessPlugIns(const std::vector<UUID>& uuids, uint64_t flags, Completion reply);
    void matchPlugIns(const Value& rules, uint64_t flags, Completion reply);
    void setPlugInAnnotations(const std::vector<UUID>& uuids, const Value& annotations, Completion reply);
    void bulkSetPlugInAnnotations(const Value& annotations, Completion reply);
    void holdPlugIns(const std::vector<std::string>& paths, uint64_t flags, Completion reply);
    void releaseHold(const UUID& token, Completion reply);
    void copyReceipt(Completion reply);

    // {"request": name, "version": protocolVersion as an unsigned integer}
    Dictionary request(const std::string& name) const;
    Dictionary requestPaths(const std::string& name, const std::vector<std::string>& paths) const;
    static void setUuids(Dictionary& message, const std::vector<UUID>& uuids);
    void send(const Value& message, Completion reply);

    // Runs one request operation and waits for its reply: for tools and tests, e.g.
    //   auto r = client.wait([&](auto done) { client.addPlugIns({path}, done); });
    // The request is sent and its reply read on the calling thread, and the completion runs there.
    corvane::rpx::Reply wait(const std::function<void(Completion)>& operation);

    // The error a reply carries, or an ok status for success. A failed exchange is code 4 with the
    // transport's description. A reply with a text but code 0 breaks the protocol: that is code 4
    // "axd reported error without a code: <text>", never an exception into the host.
    static Status errorInReply(const corvane::rpx::Reply& reply);
    // The in-memory form of a reply at protocol version 3; nothing at other versions.
    std::optional<Value> convertFromRPX(const Value& message) const;
    static std::optional<Value> convertToRPX(const Value& value, uint64_t version);

    uint64_t protocolVersion() const { return protocolVersion_; }
    void setProtocolVersion(uint64_t version) { protocolVersion_ = version; }

    const std::string& serviceName() const { return serviceName_; }

private:
    // The live connection, made anew when the last one has ended.
    std::shared_ptr<corvane::rpx::Connection> connection() EXCLUDES(mutex_);
    std::shared_ptr<corvane::rpx::Connection> connectLocked() REQUIRES(mutex_);

    const std::string serviceName_;
    corvane::dispatch::QueuePtr replyQueue_;
    corvane::Mutex mutex_;
    std::shared_ptr<corvane::rpx::Connection> axd_ GUARDED_BY(mutex_);
    std::atomic<uint64_t> protocolVersion_{kCurrentProtocolVersion};
};

}  // namespace annexa
