// The daemon's server: the plug-in database (it is one), the service endpoint on which clients
// connect, the queues all daemon work runs on, the list of plug-in holds and the preference domain.
#pragma once

#include <atomic>
#include <memory>
#include <set>
#include <vector>

#include "axd/AXDUserPrefs.h"
#include "axd/AXDatabase.h"
#include "platform/dispatch/Dispatch.h"
#include "platform/rpx/Rpx.h"

namespace annexa {

class AXDRpxClient;

// A hold blocks a set of plug-ins on behalf of one client; while any hold exists the process has
// outstanding work. Immutable after construction.
class AXDPlugInHold {
public:
    AXDPlugInHold(const std::vector<AXDPlugInPtr>& plugIns, const std::shared_ptr<AXDRpxClient>& client);
    ~AXDPlugInHold();
    AXDPlugInHold(const AXDPlugInHold&) = delete;
    AXDPlugInHold& operator=(const AXDPlugInHold&) = delete;

    const UUID& uuid() const { return uuid_; }
    bool blocks(const AXDPlugIn& plugIn) const;
    const AXDRpxClient* client() const { return client_.lock().get(); }
    bool heldBy(const AXDRpxClient* client) const;
    Date created() const { return created_; }
    // The held plug-ins as events show them.
    const Value& plugIns() const { return plugIns_; }

private:
    const UUID uuid_;
    std::set<UUID> blocked_;
    std::weak_ptr<AXDRpxClient> client_;
    const AXDRpxClient* clientIdentity_;
    const Date created_;
    Value plugIns_;
};

// The database part lives on its queue; the holds on "serverSync"; requests run on "service".
class AXDServer : public AXDatabase, public AXDatabaseDelegate {
public:
    // The server over `registry`, or null when its endpoint cannot be served.
    static std::shared_ptr<AXDServer> initForService(const std::string& serviceName, const char* database,
                                                     std::shared_ptr<corvane::vantry::Registry> registry);
    // The process's server; null before the first construction.
    static AXDServer* server();

    // Resumes the listener and serves for the life of the process.
    [[noreturn]] void run();
    void submitWork(std::function<void()> work);
    // For work that only reads what the daemon keeps in memory and waits on no other process: it
    // runs at once on the calling thread (the listener's I/O thread) when the service queue is
    // idle, saving the hand-over to the queue's thread, and is queued otherwise.
    void submitReadingWork(const std::function<void()>& work);

    void addHold(std::shared_ptr<AXDPlugInHold> hold);
    void unholdToken(const UUID& token);
    void unholdClient(const AXDRpxClient* client);
    bool holdOnPlugIn(const AXDPlugIn& plugIn);
    // The holds as they are now, for a request that tests many plug-ins against them at once.
    // A hold's set of blocked plug-ins never changes.
    std::vector<std::shared_ptr<const AXDPlugInHold>> currentHolds();
    size_t holdCount();
    // Changes whenever a hold is added or released.
    uint64_t holdsChangeCount() const { return holdsChanges_.load(); }

    void removedPlugIns(const std::vector<corvane::vantry::PlugInRecordPtr>& records) override;

    uint32_t verbose() const { return verbose_; }
    void setVerbose(uint32_t v) { verbose_ = v; }
    const corvane::dispatch::QueuePtr& rpxQueue() const { return rpxQueue_; }
    const corvane::dispatch::QueuePtr& mainQueue() const { return mainQueue_; }
    const corvane::dispatch::QueuePtr& syncQueue() const { return syncQueue_; }
    const std::shared_ptr<corvane::rpx::Listener>& service() const { return service_; }
    const AXDUserPrefs& userPrefs() const { return *userPrefs_; }

private:
    AXDServer(const char* database, std::shared_ptr<corvane::vantry::Registry> registry);

    uint32_t verbose_ = 0;
    corvane::dispatch::QueuePtr rpxQueue_;
    corvane::dispatch::QueuePtr mainQueue_;
    std::shared_ptr<corvane::rpx::Listener> service_;
    std::unique_ptr<AXDUserPrefs> userPrefs_;
    const corvane::dispatch::QueuePtr syncQueue_;
    std::vector<std::shared_ptr<AXDPlugInHold>> holds_ GUARDED_BY(*syncQueue_);
    std::atomic<uint64_t> holdsChanges_{0};
};

}  // namespace annexa
