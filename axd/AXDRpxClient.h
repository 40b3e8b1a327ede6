// One connected client of the daemon: who the peer is (process id, executable, bundle, code-signing
// identity for entitlements), the wrapping of its requests into transactions on the service
// queue, and its end.
#pragma once

#include <atomic>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "Annexa/AXBundle.h"
#include "Annexa/AXUtilities.h"
#include "platform/codesign/CodeSign.h"
#include "platform/rpx/Rpx.h"

namespace annexa {

class AXDServer;

// Owned by its connection (as the connection's context, and held by its event handler); refers back
// to the connection weakly. Thread-safe: acceptWork only goes from true to false; requestCount
// lives on the service queue.
class AXDRpxClient : public std::enable_shared_from_this<AXDRpxClient> {
public:
    static std::shared_ptr<AXDRpxClient> initWithConnectionServer(const corvane::rpx::ConnectionPtr& connection,
                                                                  AXDServer* server);

    // The peer's process id; 0 once the connection is gone.
    int pid() const;
    // The peer's user, from the kernel when it connected.
    uid_t uid() const { return auditToken_.uid; }
    const std::string& path() const { return path_; }
    const std::shared_ptr<AXBundle>& bundle() const { return identity().bundle; }
    AXDServer* server() const { return server_; }
    corvane::rpx::ConnectionPtr connection() const { return connection_.lock(); }
    bool acceptWork() const { return acceptWork_.load(); }
    uint32_t requestCount() const { return requestCount_; }
    // Counts one request; called on the service queue.
    uint32_t countRequest() { return ++requestCount_; }

    Value entitlementValueForKey(const std::string& key) const;
    bool hasEntitlement(const std::string& key) const;

    void dying();
    void dead();
    std::string description() const;

    // A request of this client has ended (its Transaction is gone): the next one it sent, if any,
    // goes to the service queue now. A client's requests are served one after another, so that one
    // served in slices lets other clients' requests run between its slices but never this client's
    // own next one, and a client that sends thousands at once has one of them queued at a time.
    void requestEnded();

    // Its holds have been released as it went (set by the server, on its hold queue): it makes no
    // more.
    bool holdsReleased() const { return holdsReleased_.load(); }
    void setHoldsReleased() { holdsReleased_.store(true); }

private:
    AXDRpxClient(const corvane::rpx::ConnectionPtr& connection, AXDServer* server);
    void handleEvent(const corvane::rpx::Event& event);
    // The bundle and code-signing identity of the executable that connected, found when the first
    // request arrives: a connection that never sends one (a flood of them) costs no file reads.
    // The handle still refuses a process that is no longer the one that connected.
    struct Identity {
        std::shared_ptr<AXBundle> bundle;
        std::shared_ptr<corvane::codesign::Handle> task;
    };
    const Identity& identity() const;
    // Logs a message that is no request: a few a second per client, each cut short, so that a
    // client sending garbage cannot fill the log (or keep the I/O thread busy writing it).
    void logUnexpected(const corvane::rpx::Event& event);

    std::atomic<bool> acceptWork_{true};
    std::atomic<bool> holdsReleased_{false};
    std::weak_ptr<corvane::rpx::Connection> connection_;
    AXDServer* const server_;
    const int pid_;
    std::string path_;
    corvane::rpx::AuditToken auditToken_;
    mutable std::once_flag identityOnce_;
    mutable Identity identity_;  // written once, under identityOnce_
    uint32_t requestCount_ = 0;  // on the service queue
    // Requests that wait for the one being served.
    struct Waiting {
        std::function<void()> work;
        bool reading;
    };
    void start(Waiting request);
    corvane::Mutex sequenceMutex_;
    bool serving_ GUARDED_BY(sequenceMutex_) = false;
    std::deque<Waiting> waiting_ GUARDED_BY(sequenceMutex_);
    // On the connection's delivery, one event at a time.
    int64_t unexpectedSecond_ = 0;
    uint32_t unexpectedInSecond_ = 0;
};

}  // namespace annexa
