#include "axd/Transaction.h"

#include <malloc.h>

#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <unordered_set>

#include "Annexa/AXMessage.h"
#include "axd/AXDRpxClient.h"
#include "axd/AXDServer.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

namespace {

using Handler = void (Transaction::*)();

// Tested in this order, by exact, case-sensitive comparison.
const std::pair<const char*, Handler> kRequests[] = {
    {request::kAdd, &Transaction::addPlugIns},
    {request::kRemove, &Transaction::removePlugIns},
    {request::kBulk, &Transaction::bulkPlugIns},
    {request::kReady, &Transaction::readyPlugIns},
    {request::kAccess, &Transaction::accessPlugIns},
    {request::kMatch, &Transaction::matchPlugIns},
    {request::kAnnotate, &Transaction::annotatePlugIns},
    {request::kBulkAnnotate, &Transaction::bulkAnnotatePlugIns},
    {request::kLock, &Transaction::lockDownPlugIns},
    {request::kReceipt, &Transaction::fetchReceipt},
    {request::kWatch, &Transaction::watchRegistry},
};

}  // namespace

Transaction::Transaction(corvane::rpx::Event request, std::shared_ptr<AXDRpxClient> client)
    : client_(std::move(client)), request_(std::move(request)) {}

Transaction::~Transaction() {
    if (!answered_ && request_.wantsReply) {
        const std::string* name = request()[message::kRequest].asString();
        log::error(logOps(), "request %{public}s of client %d ended without a reply; answering with an internal error",
                   name ? name->c_str() : "(none)", client_->pid());
        failMessage(AXErrorCode::InvalidRequest, "internal error: the request ended without a reply");
    }
    client_->requestEnded();
}

AXDServer& Transaction::server() const { return *client_->server(); }
corvane::rpx::ConnectionPtr Transaction::connection() const { return client_->connection(); }

void Transaction::dispatch() {
    const std::string* name = request()[message::kRequest].asString();
    // The version is a number of either integer kind (a client writing JSON has no unsigned
    // one); anything else counts as none.
    const Value& version = request()[message::kVersion];
    std::string received = "0";
    version_ = 0;
    if (auto u = version.kind() == Value::Kind::UInt64 ? version.uint64Value() : std::nullopt) {
        version_ = *u;
        received = std::to_string(*u);
    } else if (auto i = version.kind() == Value::Kind::Int64 ? version.int64Value() : std::nullopt) {
        version_ = *i > 0 ? static_cast<uint64_t>(*i) : 0;
        received = std::to_string(*i);
    }
    if (version_ < kOldestProtocolVersion || version_ > kCurrentProtocolVersion) {
        // The number as it was sent, not cut to 32 bits.
        failMessage(AXErrorCode::VersionMismatch,
                    log::formatText("unsupported protocol version %s (current %llu)", received.c_str(),
                                    static_cast<unsigned long long>(kCurrentProtocolVersion)));
        return;
    }
    // The client's connection is already gone: nobody would read a reply.
    if (!client_->acceptWork()) return;
    const char* text = name ? name->c_str() : nullptr;
    log::debug(logOps(), "client %d requested %{public}s", client_->pid(), text);
    AXD_TRACE(request, client_->pid(), text ? text : "");
    if (!name) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (missing type)");
        return;
    }
    for (const auto& [requestName, handler] : kRequests) {
        if (*name == requestName) {
            (this->*handler)();
            return;
        }
    }
    failMessage(AXErrorCode::InvalidRequest, "unrecognized request");
}

uint64_t Transaction::flagsArgument() const {
    const Value& flags = request()[message::kFlags];
    return flags.kind() == Value::Kind::UInt64 ? *flags.uint64Value() : 0;
}

bool Transaction::onlyReads() const {
    const std::string* name = request()[message::kRequest].asString();
    return name && *name == request::kMatch;
}

void Transaction::done() {
    if (answered_) return;
    answered_ = true;
    // Whatever the request changed is on disk before the reply says so; a change that could not be
    // saved is undone, and the reply says that instead.
    if (Status saved = server().saveAnnotations(); !saved.ok() && !reply_.count(message::kErrorCode)) {
        reply_[message::kErrorCode] = Value(static_cast<uint64_t>(errorCodeValue(AXErrorCode::InvalidRequest)));
        reply_[message::kError] = Value("unable to save annotations: " + saved.error().description());
    }
    Value reply(reply_);
    if (AXD_TRACE_ENABLED(request__output)) {
        std::string text = reply.description();
        AXD_TRACE(request__output, client_->pid(), text.c_str());
    }
    auto conn = connection();
    if (conn && request_.wantsReply) conn->sendReply(request_.messageId, reply);
}

void Transaction::failMessage(AXErrorCode code, const std::string& message, const std::optional<std::string>& cause) {
    reply_[message::kErrorCode] = Value(static_cast<uint64_t>(errorCodeValue(code)));
    reply_[message::kError] = Value(message);
    if (cause) reply_[message::kReason] = Value(*cause);
    done();
}

void Transaction::failError(AXErrorCode fallback, const Error& error) {
    if (error.domain == kAnnexaErrorDomain) {
        failMessage(static_cast<AXErrorCode>(error.code), error.text.value_or(""), error.cause);
    } else {
        failMessage(fallback, error.description(), error.cause);
    }
}

bool Transaction::marshalPaths(const std::function<Walk(const std::string&, bool)>& handler) {
    const Value* paths = rpx_dictionary_get_array(request(), message::kPaths);
    if (!paths) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format");
        return false;
    }
    if (corvane::rpx::arrayCount(*paths) > kMaxListElements) {
        failMessage(AXErrorCode::InvalidRequest,
                    log::formatText("invalid request format (more than %u paths)", static_cast<unsigned>(kMaxListElements)));
        return false;
    }
    for (const Value& element : *paths->asArray()) {
        const std::string* path = element.asString();
        if (!path) {
            failMessage(AXErrorCode::InvalidRequest, "invalid request format");
            return false;
        }
        if (path->empty() || (*path)[0] != '/') {
            failMessage(AXErrorCode::BadPath, log::formatText("absolute path required: %s", *path));
            return false;
        }
        auto resolved = corvane::layout::canonicalPath(*path);
        bool ok = resolved && resolved->size() < 1024;
        if (handler(ok ? *resolved : *path, ok) == Walk::Stop) return false;
    }
    return true;
}

void Transaction::processPaths(const std::function<Walk(const std::string&, bool)>& handler) {
    if (marshalPaths(handler)) done();
}

std::optional<Transaction::UuidList> Transaction::resolveUuidList() {
    const Value* uuids = rpx_dictionary_get_array(request(), message::kUuids);
    if (!uuids) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (uuid)");
        return std::nullopt;
    }
    if (corvane::rpx::arrayCount(*uuids) > kMaxListElements) {
        failMessage(AXErrorCode::InvalidRequest,
                    log::formatText("invalid request format (more than %u uuids)", static_cast<unsigned>(kMaxListElements)));
        return std::nullopt;
    }
    // The plug-ins are looked up in one visit to the database, up to the first element that is no
    // UUID, and a run of one UUID repeated only once; the walk then answers for the elements in
    // order, as if each were looked up in turn.
    bool allUuids = true;
    std::vector<UUID> parsed = corvane::rpx::leadingUuids(*uuids, allUuids);
    std::vector<UUID> distinct;
    std::vector<size_t> runs;
    for (size_t i = 0; i < parsed.size(); ++i) {
        if (i > 0 && parsed[i] == parsed[i - 1]) {
            ++runs.back();
            continue;
        }
        distinct.push_back(parsed[i]);
        runs.push_back(1);
    }
    UuidList list;
    list.plugIns.reserve(parsed.size());
    std::vector<AXDPlugInPtr> plugIns = server().plugInsForUUIDs(distinct);
    for (size_t r = 0; r < plugIns.size(); ++r) {
        if (!plugIns[r]) {
            list.end = std::make_pair(AXErrorCode::InvalidRequest, std::string("no such plugin (uuid not found)"));
            return list;
        }
        list.plugIns.insert(list.plugIns.end(), runs[r], plugIns[r]);
    }
    if (!allUuids) list.end = std::make_pair(AXErrorCode::InvalidRequest, std::string("invalid request (bad uuid array)"));
    return list;
}

bool Transaction::processUuidList(const std::function<Walk(const AXDPlugInPtr&)>& handler) {
    auto list = resolveUuidList();
    if (!list) return false;
    for (const AXDPlugInPtr& plugIn : list->plugIns) {
        if (handler(plugIn) == Walk::Stop) return false;
    }
    if (list->end) {
        failMessage(list->end->first, list->end->second);
        return false;
    }
    return true;
}

void Transaction::giveBackMemoryAfter(size_t plugIns) {
    if (plugIns >= kTrimAfterPlugIns) malloc_trim(0);
}

void Transaction::inSlices(size_t count, std::function<Walk(size_t)> step, std::function<void(bool)> finish) {
    struct Walking {
        size_t next = 0;
        size_t count;
        std::function<Walk(size_t)> step;
        std::function<void(bool)> finish;
    };
    auto walking = std::make_shared<Walking>(Walking{0, count, std::move(step), std::move(finish)});
    auto slice = std::make_shared<std::function<void()>>();
    // The slice holds the transaction (and so its client's next request) until the walk ends.
    *slice = [self = shared_from_this(), walking, weakSlice = std::weak_ptr<std::function<void()>>(slice)] {
        // A client that went away meanwhile waits for nothing: the rest of its walk is dropped.
        if (walking->next > 0) {
            auto conn = self->connection();
            if (!conn || !conn->isValid()) {
                self->answered_ = true;  // there is nobody to answer
                giveBackMemoryAfter(walking->count);
                return;
            }
        }
        auto started = std::chrono::steady_clock::now();
        while (walking->next < walking->count) {
            if (walking->step(walking->next++) == Walk::Stop) return walking->finish(false);
            if (walking->next < walking->count && std::chrono::steady_clock::now() - started > kSlice) {
                // The rest is the client's next turn: every other client with work waiting is
                // served once before it.
                if (auto again = weakSlice.lock()) self->server().submitWork(self->client_->pid(), [again] { (*again)(); });
                return;
            }
        }
        walking->finish(true);
    };
    // The first slice runs now; a queued one keeps `slice` alive through its own capture.
    (*slice)();
}

// ---- registration

void Transaction::addPlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        if (!resolved) {
            failMessage(AXErrorCode::BadPath, log::formatText("invalid plugin path: %@", path));
            return Walk::Stop;
        }
        AXD_TRACE(plugin__add, path.c_str());
        if (!maySystemRegistry(path)) return Walk::Stop;
        if (Status added = server().addPlugIn(path); !added.ok()) {
            log::notice(logOps(), "failed to register plug-in at %@", path);
            failMessage(AXErrorCode::RegistryRefused, log::formatText("unable to register plug-in at %@", path),
                        added.error().cause);
            return Walk::Stop;
        }
        return Walk::Continue;
    });
}

bool Transaction::maySystemRegistry(const std::string& path) {
    // The system registry is the machine's: only root, or a manager, changes it through axd (and
    // then only when this axd may write it).
    if (!server().isSystemBundle(path) || client_->uid() == 0 || client_->hasEntitlement(keys::kManagerEntitlement))
        return true;
    log::notice(log::defaultLog(), "refused request from pid=%d to change the system registry at %@", client_->pid(), path);
    failMessage(AXErrorCode::NotEntitled, "caller lacks entitlement for this operation",
                "only root or a manager may change the system registry; packages keep it in step");
    return false;
}

void Transaction::removePlugIns() {
    processPaths([this](const std::string& path, bool resolved) {
        AXD_TRACE(plugin__remove, path.c_str(), resolved);
        if (!client_->hasEntitlement(keys::kManagerEntitlement)) {
            log::notice(log::defaultLog(),
                        "refused request from pid=%d to remove plug-in at %@ - client lacks required entitlement",
                        client_->pid(), path);
            failMessage(AXErrorCode::NotEntitled, "caller lacks entitlement for this operation");
            return Walk::Stop;
        }
        if (!maySystemRegistry(path)) return Walk::Stop;
        if (Status removed = server().removePlugIn(path); !removed.ok()) {
            failMessage(AXErrorCode::BadPath, log::formatText("no plugin at %@", path), removed.error().cause);
            return Walk::Stop;
        }
        return Walk::Continue;
    });
}

void Transaction::bulkPlugIns() {
    uint64_t flags = flagsArgument();
    log::info(logOps(), "bulk options 0x%lx not supported", static_cast<unsigned long>(flags & 0xffffffffu));
    done();
}

// ---- annotations

std::optional<Value> Transaction::annotationsArgument() {
    const Value* annotations = rpx_dictionary_get_dictionary(request(), message::kAnnotations);
    // A null or a descriptor inside cannot be carried, and a value the annotation file cannot hold
    // (a UUID, a control character, a date past year 9999) would make every later save fail: both
    // are refused before anything changes.
    Value converted = annotations ? convertMessageToValue(*annotations) : Value();
    if (converted.isNull() || !corvane::plist::toXML(converted)) {
        failMessage(AXErrorCode::InvalidRequest, "invalid request format (bad annotations dictionary)");
        return std::nullopt;
    }
    return converted;
}

void Transaction::annotatePlugIns() {
    auto argument = annotationsArgument();
    if (!argument) return;
    const Value& d = *argument;
    Dictionary changes;
    if (const Value* election = d.find(keys::kElection)) {
        if (!election->isNumber()) {
            failMessage(AXErrorCode::InvalidRequest, "invalid request format (annotation election)");
            return;
        }
        changes.emplace(keys::kElection, *election);
    }
    if (const Value* extension = d.find(keys::kAnnotationExtension)) {
        if (!extension->isDictionary()) {
            failMessage(AXErrorCode::InvalidRequest, "invalid request format (annotation extension)");
            return;
        }
        changes.emplace(keys::kAnnotationExtension, *extension);
    }
    if (changes.empty()) {
        done();
        return;
    }
    Value c(changes);
    // A plug-in named again in the same request is already changed.
    std::unordered_set<const AXDPlugIn*> changed;
    const AXDPlugIn* last = nullptr;
    bool walked = processUuidList([&](const AXDPlugInPtr& p) {
        if (p.get() == last || !changed.insert(p.get()).second) return Walk::Continue;
        last = p.get();
        log::debug(logOps(), "client %d plug-in %@(%{public}@) annotation change: %@", client_->pid(), p->identifier(),
                   p->uuid(), c);
        if (changes.count(keys::kElection)) {
            log::info(logOps(), "client %d plug-in %@(%{public}@) election := %@", client_->pid(), p->identifier(),
                      p->uuid(), changes.at(keys::kElection));
        }
        server().setAnnotationForPlugIn(c, *p);
        return Walk::Continue;
    });
    if (walked) commitAnnotations();
}

void Transaction::commitAnnotations() {
    if (Status saved = server().saveAnnotations(); !saved.ok()) {
        failMessage(AXErrorCode::InvalidRequest, "unable to save annotations: " + saved.error().description());
        return;
    }
    server().notifyAnnotationChange();
    done();
}

void Transaction::bulkAnnotatePlugIns() {
    auto argument = annotationsArgument();
    if (!argument) return;
    const Value& d = *argument;
    const Dictionary* entries = d.asDictionary();
    size_t count = entries ? entries->size() : 0;
    log::debug(logOps(), "bulk change requested for %u plug-ins", static_cast<unsigned>(count));
    // Every entry is checked and its plug-in looked up before any change is made, so that nothing
    // else (a record built on the way, with its auto-election) is saved between this request's
    // changes. The entries before a failing one are changed all the same, and saved with the reply.
    std::vector<std::pair<AXDPlugInPtr, const Value*>> changes;
    std::optional<std::pair<AXErrorCode, const char*>> failure;
    if (entries) {
        for (const auto& [key, value] : *entries) {
            auto uuid = UUID::parse(key);
            AXDPlugInPtr p = value.isDictionary() && uuid ? server().findPlugIn(*uuid) : nullptr;
            if (!value.isDictionary()) {
                failure.emplace(AXErrorCode::BadAnnotation, "annotations values must be dictionaries");
            } else if (!uuid) {
                failure.emplace(AXErrorCode::BadAnnotation, "invalid plug-in UUID value");
            } else if (!p) {
                failure.emplace(AXErrorCode::RegistryRefused, "no plug-in with the requested uuid");
            } else {
                changes.emplace_back(std::move(p), &value);
                continue;
            }
            break;
        }
    }
    for (const auto& [p, value] : changes) {
        log::debug(logOps(), "client %d plug-in %@(%{public}@) extension := %@", client_->pid(), p->identifier(),
                   p->uuid(), *value);
        server().setAnnotationForPlugIn(corvane::dict({{keys::kAnnotationExtension, *value}}), *p);
    }
    if (failure) {
        failMessage(failure->first, failure->second);
        return;
    }
    commitAnnotations();
}

}  // namespace annexa
