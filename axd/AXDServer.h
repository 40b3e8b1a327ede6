// The daemon's server: the plug-in database (it is one), the service endpoint on which clients
// connect, the queues all daemon work runs on, the list of plug-in holds and the preference domain.
#pragma once

#include <atomic>
#include <memory>
#include <set>
#include <unordered_map>
#include <unordered_set>
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
    // A number that names the hold in events: the token itself is never shown to anyone but the
    // client that holds it (whoever knows it may release the hold).
    uint64_t serial() const { return serial_; }
    pid_t holderPid() const { return holderPid_; }
    const AXDRpxClient* client() const { return client_; }
    // The plug-ins it holds, each once.
    const std::vector<AXDPlugInPtr>& plugIns() const { return plugIns_; }
    Date created() const { return created_; }
    // The held plug-ins as events show them; made when an event is sent, so that a hold costs
    // little more than its pointers (a client may keep a thousand).
    Value summaries() const;

private:
    const UUID uuid_;
    const uint64_t serial_;
    const pid_t holderPid_;
    std::vector<AXDPlugInPtr> plugIns_;
    const AXDRpxClient* const client_;  // an identity only: its holds are released before it goes
    const Date created_;
};

// The plug-ins some hold blocks, as a match reads them.
using HeldPlugIns = std::unordered_set<UUID, corvane::UUIDHash>;

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
    // Work for a client process goes to the service queue in turns: the processes with work
    // waiting take one task each in rotation, so that a process with many connections, or one
    // served in slices, delays another's requests by at most one task of its own.
    void submitWork(pid_t client, std::function<void()> work);
    // For work that only reads what the daemon keeps in memory and waits on no other process: it
    // runs at once on the calling thread (the listener's I/O thread) when the service queue is
    // idle, saving the hand-over to the queue's thread, and is queued otherwise.
    void submitReadingWork(pid_t client, const std::function<void()>& work);

    // The most holds one connection may keep.
    static constexpr size_t kMaxHoldsPerClient = 1024;
    // False (and the hold dropped) when its client keeps kMaxHoldsPerClient holds already, or has
    // gone meanwhile.
    bool addHold(std::shared_ptr<AXDPlugInHold> hold);
    void unholdToken(const UUID& token);
    // Releases every hold of the client, in the order they were made; from then on the client can
    // make no more.
    void unholdClient(AXDRpxClient* client);
    bool holdOnPlugIn(const AXDPlugIn& plugIn);
    // The plug-ins held now, for a request that tests many plug-ins against them at once; made
    // again only after the holds changed.
    std::shared_ptr<const HeldPlugIns> heldPlugIns();
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
    corvane::dispatch::Turns turns_;  // on mainQueue_
    std::shared_ptr<corvane::rpx::Listener> service_;
    std::unique_ptr<AXDUserPrefs> userPrefs_;
    const corvane::dispatch::QueuePtr syncQueue_;
    // Where released holds are announced and freed, away from the I/O thread and the service queue.
    const corvane::dispatch::QueuePtr releaseQueue_;
    std::atomic<size_t> releasesQueued_{0};
    size_t holdsFreedSinceTrim_ = 0;  // on releaseQueue_
    // The holds by token; the tokens of each client, in the order they were made; how many holds
    // block each plug-in. Each release costs what the hold holds, never what others hold.
    std::unordered_map<UUID, std::shared_ptr<AXDPlugInHold>, corvane::UUIDHash> holds_ GUARDED_BY(*syncQueue_);
    std::unordered_map<const AXDRpxClient*, std::vector<UUID>> holdsByClient_ GUARDED_BY(*syncQueue_);
    std::unordered_map<UUID, uint32_t, corvane::UUIDHash> heldCounts_ GUARDED_BY(*syncQueue_);
    std::shared_ptr<const HeldPlugIns> heldSnapshot_ GUARDED_BY(*syncQueue_);
    uint64_t heldSnapshotChanges_ GUARDED_BY(*syncQueue_) = 0;
    std::atomic<uint64_t> holdsChanges_{0};
    // Removes one hold from the indexes (not from holdsByClient_).
    std::shared_ptr<AXDPlugInHold> forgetHold(const UUID& token) REQUIRES(*syncQueue_);
};

}  // namespace annexa
