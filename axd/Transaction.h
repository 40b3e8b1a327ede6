// One request of one client, served on the service queue: the version check, the dispatch on the
// request name, the common walks over paths and UUIDs, the handlers, and the one reply.
#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "Annexa/AXBundle.h"
#include "Annexa/AXUtilities.h"
#include "axd/AXDPlugIn.h"
#include "platform/rpx/Rpx.h"

namespace annexa {

class AXDRpxClient;
class AXDServer;
// The plug-ins held when a match began (AXDServer::heldPlugIns).
using MatchHolds = std::shared_ptr<const std::unordered_set<UUID, corvane::UUIDHash>>;
struct MatchAnswer;
struct MatchInputs;

// Lives on: the service queue, for the length of its handler (and of its slices, for a handler
// that walks many plug-ins).
class Transaction : public std::enable_shared_from_this<Transaction> {
public:
    enum class Walk { Continue, Stop };
    // The most elements a "uuids" or "paths" list may have.
    static constexpr size_t kMaxListElements = 4096;
    // How long one slice of a long walk holds the service queue before the rest waits for the
    // client's next turn.
    static constexpr std::chrono::microseconds kSlice{100};
    // A request over at least this many plug-ins leaves megabytes of freed lists and maps in the
    // heap, spread between what stays: they go back to the system when it ends (about half a
    // millisecond at 10,000; giveBackMemoryAfter).
    static constexpr size_t kTrimAfterPlugIns = 1000;
    static void giveBackMemoryAfter(size_t plugIns);

    Transaction(corvane::rpx::Event request, std::shared_ptr<AXDRpxClient> client);
    // A request must be answered once. One that a handler left unanswered is answered here, with
    // an internal error, and logged: a client never waits for ever, whatever a handler does.
    ~Transaction();
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    void dispatch();
    // A request that reads what the daemon keeps and waits on no other process ("match"), so that
    // it may run wherever the service queue's one running task may.
    bool onlyReads() const;
    // Saves the annotations the request changed, then sends the reply (dropped when the connection
    // is gone or no reply is expected): what a reply acknowledges is on disk, at one write per
    // request.
    void done();
    void failMessage(AXErrorCode code, const std::string& message,
                     const std::optional<std::string>& cause = std::nullopt);
    // An error of the domain "Annexa" answers with its own code and text; any other with
    // `fallback` and its description.
    void failError(AXErrorCode fallback, const Error& error);
    // Walks "paths": each absolute path, canonical when it resolves. False when the walk stopped
    // (the reply was sent then).
    bool marshalPaths(const std::function<Walk(const std::string& path, bool resolved)>& handler);
    void processPaths(const std::function<Walk(const std::string& path, bool resolved)>& handler);
    // Walks "uuids", looking each plug-in up. False when the walk stopped (the reply was sent).
    bool processUuidList(const std::function<Walk(const AXDPlugInPtr& plugIn)>& handler);
    // "uuids" looked up: the plug-ins of its elements in order, up to the first that names none
    // (or is no UUID), and the error the walk ends with then. Nothing when the list itself is
    // malformed or too long (answered).
    struct UuidList {
        std::vector<AXDPlugInPtr> plugIns;
        std::optional<std::pair<AXErrorCode, std::string>> end;
    };
    std::optional<UuidList> resolveUuidList();
    // Runs step(0) .. step(count - 1) on the service queue a slice at a time (kSlice): the rest of
    // a walk waits for the client's next turn (AXDServer::submitWork), and the transaction, with its
    // client's next request, waits until `finish` has run: finish(true) after the last step,
    // finish(false) when a step answered Walk::Stop.
    void inSlices(size_t count, std::function<Walk(size_t)> step, std::function<void(bool)> finish);

    // The request handlers.
    // Whether the client may change the registry that holds `path`; replies when not.
    bool maySystemRegistry(const std::string& path);
    void addPlugIns();
    void removePlugIns();
    void bulkPlugIns();
    void annotatePlugIns();
    void bulkAnnotatePlugIns();
    void matchPlugIns();
    void readyPlugIns();
    void accessPlugIns();
    void lockDownPlugIns();
    void fetchReceipt();
    void watchRegistry();

    const std::shared_ptr<AXDRpxClient>& client() const { return client_; }
    const Value& request() const { return request_.message; }
    Dictionary& reply() { return reply_; }
    uint64_t version() const { return version_; }
    AXDServer& server() const;
    corvane::rpx::ConnectionPtr connection() const;

private:
    // Why "match" leaves the plug-in out before export (visibility, the holds taken at the
    // request's start, rules, exclusions, authorization), or nothing.
    // Refusals that the log shows (exclusions, authorization) add their line to `logged`. Only a
    // `worded` reason quotes the rule or exclusion (an explanation's); otherwise it is a word, since
    // a host's rules may be long and most candidates fail one.
    std::optional<std::string> matchRefusal(const AXDPlugIn& plugIn, const Value& rules, uint64_t flags,
                                            const std::vector<Value>& exclusions, const MatchHolds& holds,
                                            std::vector<std::string>& logged, bool worded);
    // The walk of "match" over the registry's candidates, with what the request read at its start.
    std::shared_ptr<const MatchAnswer> walkForMatch(const Value& rules, uint64_t flags, bool explain,
                                                    const MatchInputs& inputs, const MatchHolds& holds);
    // The explanation of every installed plug-in: the outcome the walk gave it, or why the registry's
    // query left it out.
    Value explainAll(const std::vector<AXDPlugInPtr>& candidates, std::map<const AXDPlugIn*, std::string>& outcomes,
                     const Value& rules, uint64_t flags, const MatchInputs& inputs, const MatchHolds& holds);
    // A manager's explanation for an application ("host"): false after answering that the request
    // may not name one, or names none that is registered.
    bool readExplainedHost(bool explain);
    // The application a manager's explanation speaks for, in place of the client itself: its
    // bundle and its verified entitlements.
    struct ExplainedHost {
        std::shared_ptr<AXBundle> bundle;
        Value entitlements;
    };
    std::optional<ExplainedHost> explainedHost_;
    // The request's "flags": an unsigned number; absent, or of another type, reads as 0.
    uint64_t flagsArgument() const;

    // Saves the request's annotation changes, then posts the annotation-change notification and
    // answers; a failed save answers with its error instead.
    void commitAnnotations();
    // The request's "annotations" dictionary as a Value; nullopt after answering that it is
    // missing or holds what the annotation file cannot keep.
    std::optional<Value> annotationsArgument();

    std::shared_ptr<AXDRpxClient> client_;
    corvane::rpx::Event request_;
    Dictionary reply_;
    uint64_t version_ = 0;
    bool answered_ = false;
};

}  // namespace annexa
