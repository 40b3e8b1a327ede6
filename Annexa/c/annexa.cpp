// The C interface over AXDaemonClient: text in, text out, codes as return values. Nothing here
// throws into C: a reply that breaks the protocol is code 4 with the library's text.
#include "Annexa/c/annexa.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <new>
#include <string>
#include <vector>

#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXPlugInRuntime.h"
#include "platform/rpx/Rpx.h"

struct annexa_plugin {
    corvane::rpx::ConnectionPtr connection;
    int notation = ANNEXA_NOTATION_TEXT;
};

// Events arrive on the connection's queue and wait here for the host; the eventfd counts while
// any wait, so a host can poll it.
struct WatchState {
    explicit WatchState(int notation) : notation(notation), wakeup(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}
    ~WatchState() {
        if (wakeup >= 0) ::close(wakeup);
    }
    // A host that reads nothing must not grow without bound: past this many waiting events the
    // watch ends and says why.
    static constexpr size_t kMaxWaiting = 65536;

    const int notation;
    const int wakeup;
    corvane::Mutex mutex;
    std::deque<std::string> events GUARDED_BY(mutex);
    std::optional<std::string> ended GUARDED_BY(mutex);

    void signal() {
        uint64_t one = 1;
        [[maybe_unused]] ssize_t n = ::write(wakeup, &one, sizeof one);
    }
    void drain() {
        uint64_t count;
        [[maybe_unused]] ssize_t n = ::read(wakeup, &count, sizeof count);
    }
};

struct annexa_watch {
    std::shared_ptr<WatchState> state;
    corvane::rpx::ConnectionPtr connection;
};

struct annexa_client {
    annexa::AXDaemonClient client;
    std::atomic<int> notation{ANNEXA_NOTATION_TEXT};
    explicit annexa_client(const char* name)
        : client(name ? std::optional<std::string>(name) : std::nullopt) {}
};

namespace {

using annexa::AXDaemonClient;
using corvane::rpx::Reply;

char* copyText(const std::string& text) {
    char* out = static_cast<char*>(std::malloc(text.size() + 1));
    if (out) std::memcpy(out, text.c_str(), text.size() + 1);
    return out;
}

bool knownNotation(int notation) { return notation == ANNEXA_NOTATION_TEXT || notation == ANNEXA_NOTATION_JSON; }

std::string written(const corvane::Value& value, int notation) {
    return notation == ANNEXA_NOTATION_JSON ? value.json() : value.description();
}

// One value in the caller's notation; the error says what is not (`what`, e.g. "the rules are") and
// where the text went wrong.
corvane::Result<corvane::Value> readText(const char* text, int notation, const char* what) {
    auto value = notation == ANNEXA_NOTATION_JSON ? corvane::Value::parseJson(text) : corvane::Value::parseReporting(text);
    if (value) return value;
    return corvane::Error{"Annexa", ANNEXA_EINVAL,
                          std::string(what) + (notation == ANNEXA_NOTATION_JSON ? " not one JSON value: " : " not one value in the text notation: ") +
                              value.error().description()};
}

int64_t report(int64_t code, const std::string& text, char** errorText) {
    if (errorText) *errorText = code == 0 ? nullptr : copyText(text);
    return code;
}

int64_t unreachable(const AXDaemonClient& client, const Reply& reply, char** errorText) {
    const std::string& service = client.serviceName();
    const char* unit = service == annexa::kDefaultServiceName ? "axd.socket" : nullptr;
    std::string why = reply.error == corvane::rpx::ErrorKind::ConnectionInvalid ? corvane::rpx::unreachableText(service, unit)
                                                                               : reply.description();
    return report(ANNEXA_EUNREACHABLE, "cannot reach the daemon at " + service + ": " + why, errorText);
}

int64_t finish(const AXDaemonClient& client, const Reply& reply, char** errorText) {
    if (!reply.ok()) return unreachable(client, reply, errorText);
    corvane::Status status = AXDaemonClient::errorInReply(reply);
    if (!status.ok()) {
        const corvane::Error& e = status.error();
        return report(e.code, e.description() + (e.cause ? ": " + *e.cause : std::string()), errorText);
    }
    return report(0, {}, errorText);
}

// The UUIDs of texts; ANNEXA_EINVAL (reported) when one is missing or does not parse, else 0.
int64_t readUuids(const char* const* texts, size_t count, std::vector<corvane::UUID>& out, char** errorText) {
    if (count > 0 && !texts) return report(ANNEXA_EINVAL, "invalid argument", errorText);
    for (size_t i = 0; i < count; ++i) {
        auto uuid = texts[i] ? corvane::UUID::parse(texts[i]) : std::nullopt;
        if (!uuid) return report(ANNEXA_EINVAL, std::string("not a UUID: ") + (texts[i] ? texts[i] : "(null)"), errorText);
        out.push_back(*uuid);
    }
    return 0;
}

bool readPaths(const char* const* paths, size_t count, std::vector<std::string>& out) {
    if (!paths && count) return false;
    for (size_t i = 0; i < count; ++i) {
        if (!paths[i]) return false;
        out.emplace_back(paths[i]);
    }
    return true;
}

}  // namespace

extern "C" {

annexa_client* annexa_client_create(const char* service_name) {
    try {
        return new annexa_client(service_name);
    } catch (const std::exception&) {  // out of memory, or no thread for the reply queue
        return nullptr;
    }
}

void annexa_client_destroy(annexa_client* client) { delete client; }

int64_t annexa_client_set_notation(annexa_client* client, int notation) {
    if (!client || !knownNotation(notation)) return ANNEXA_EINVAL;
    client->notation = notation;
    return 0;
}

int64_t annexa_send(annexa_client* client, const char* message, char** reply, char** error_text) {
    if (reply) *reply = nullptr;
    if (!client || !message || !reply) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    auto value = readText(message, client->notation, "the message is");
    if (!value) return report(ANNEXA_EINVAL, value.error().description(), error_text);
    AXDaemonClient& c = client->client;
    Reply r = c.wait([&](AXDaemonClient::Completion done) { c.send(*value, std::move(done)); });
    if (!r.ok()) return unreachable(c, r, error_text);
    *reply = copyText(written(r.value, client->notation));
    return report(0, {}, error_text);
}

int64_t annexa_match(annexa_client* client, const char* rules, uint64_t flags, char** matches, char** error_text) {
    if (matches) *matches = nullptr;
    if (!client || !matches) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    corvane::Value pattern;
    if (rules) {
        auto parsed = readText(rules, client->notation, "the rules are");
        if (!parsed) return report(ANNEXA_EINVAL, parsed.error().description(), error_text);
        pattern = *parsed;
    }
    AXDaemonClient& c = client->client;
    Reply r = c.wait([&](AXDaemonClient::Completion done) { c.matchPlugIns(pattern, flags, std::move(done)); });
    int64_t code = finish(c, r, error_text);
    if (code != 0) return code;
    const corvane::Value& found = r.value[annexa::message::kMatches];
    *matches = copyText(written(found.isNull() ? corvane::Value(corvane::Array{}) : found, client->notation));
    return 0;
}

int64_t annexa_ready(annexa_client* client, const char* const* uuids, size_t count, char** error_text) {
    std::vector<corvane::UUID> list;
    if (!client) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    if (int64_t bad = readUuids(uuids, count, list, error_text)) return bad;
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.readyPlugIns(list, 0, std::move(done)); }), error_text);
}

int64_t annexa_access(annexa_client* client, const char* const* uuids, size_t count, char** tokens, char** error_text) {
    std::vector<corvane::UUID> list;
    if (tokens) *tokens = nullptr;
    if (!client || !tokens) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    if (int64_t bad = readUuids(uuids, count, list, error_text)) return bad;
    AXDaemonClient& c = client->client;
    Reply r = c.wait([&](AXDaemonClient::Completion done) { c.accessPlugIns(list, 0, std::move(done)); });
    if (int64_t code = finish(c, r, error_text)) return code;
    *tokens = copyText(written(r.value[annexa::message::kExtensions], client->notation));
    return 0;
}

int64_t annexa_lock(annexa_client* client, const char* const* paths, size_t count, uint64_t flags, char** token,
                    char** error_text) {
    std::vector<std::string> list;
    if (token) *token = nullptr;
    if (!client || !token || !readPaths(paths, count, list)) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    AXDaemonClient& c = client->client;
    Reply r = c.wait([&](AXDaemonClient::Completion done) { c.holdPlugIns(list, flags, std::move(done)); });
    if (int64_t code = finish(c, r, error_text)) return code;
    const corvane::UUID* hold = r.value[annexa::message::kUuids].asUUID();
    *token = copyText(hold ? hold->string() : std::string());
    return 0;
}

int64_t annexa_unlock(annexa_client* client, const char* token, char** error_text) {
    std::vector<corvane::UUID> list;
    if (!client || !token) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    if (int64_t bad = readUuids(&token, 1, list, error_text)) return bad;
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.releaseHold(list[0], std::move(done)); }), error_text);
}

int64_t annexa_receipt(annexa_client* client, void** bytes, size_t* size, char** error_text) {
    if (bytes) *bytes = nullptr;
    if (size) *size = 0;
    if (!client || !bytes || !size) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    AXDaemonClient& c = client->client;
    Reply r = c.wait([&](AXDaemonClient::Completion done) { c.copyReceipt(std::move(done)); });
    if (int64_t code = finish(c, r, error_text)) return code;
    const corvane::Bytes* data = r.value[annexa::message::kData].asData();
    size_t n = data ? data->size() : 0;
    *bytes = std::malloc(n ? n : 1);
    if (!*bytes) return report(ANNEXA_EINVAL, "out of memory", error_text);
    if (n) std::memcpy(*bytes, data->data(), n);
    *size = n;
    return 0;
}

annexa_watch* annexa_watch_start(annexa_client* client, char** error_text) {
    if (!client) {
        report(ANNEXA_EINVAL, "invalid argument", error_text);
        return nullptr;
    }
    auto state = std::make_shared<WatchState>(client->notation);
    if (state->wakeup < 0) {
        report(ANNEXA_EINVAL, std::string("eventfd: ") + std::strerror(errno), error_text);
        return nullptr;
    }
    AXDaemonClient& c = client->client;
    auto connection = corvane::rpx::Connection::connect(c.serviceName(), corvane::dispatch::Queue::create("annexa_watch"));
    connection->setEventHandler([state, weak = std::weak_ptr<corvane::rpx::Connection>(connection)](const corvane::rpx::Event& ev) {
        corvane::MutexLock lock(state->mutex);
        if (state->ended) return;
        if (ev.isError()) {
            state->ended = "the daemon ended the watch";
        } else if (state->events.size() >= WatchState::kMaxWaiting) {
            state->ended = "events were lost: the host left " + std::to_string(WatchState::kMaxWaiting) + " unread";
            state->events.clear();
            if (auto self = weak.lock()) self->cancel();
        } else {
            state->events.push_back(written(ev.message, state->notation));
        }
        state->signal();
    });
    connection->resume();
    corvane::Dictionary request = c.request(annexa::request::kWatch);
    Reply r = connection->sendWithReplySync(corvane::Value(std::move(request)));
    if (finish(c, r, error_text) != 0) {
        connection->cancel();
        return nullptr;
    }
    return new annexa_watch{state, connection};
}

int annexa_watch_fd(const annexa_watch* watch) { return watch ? watch->state->wakeup : -1; }

int64_t annexa_watch_next(annexa_watch* watch, int timeout_ms, char** event, char** error_text) {
    if (event) *event = nullptr;
    if (!watch || !event) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    WatchState& state = *watch->state;
    for (;;) {
        {
            corvane::MutexLock lock(state.mutex);
            if (!state.events.empty()) {
                *event = copyText(state.events.front());
                state.events.pop_front();
                if (state.events.empty() && !state.ended) state.drain();
                return report(0, {}, error_text);
            }
            if (state.ended) return report(ANNEXA_EUNREACHABLE, *state.ended, error_text);
        }
        pollfd ready{state.wakeup, POLLIN, 0};
        int n = ::poll(&ready, 1, timeout_ms);
        if (n == 0) return report(ANNEXA_ETIMEDOUT, "no event came in time", error_text);
        if (n < 0 && errno != EINTR) return report(ANNEXA_EINVAL, std::string("poll: ") + std::strerror(errno), error_text);
    }
}

void annexa_watch_stop(annexa_watch* watch) {
    if (!watch) return;
    watch->connection->cancel();
    delete watch;
}

annexa_plugin* annexa_plugin_connect(const char* bundle_identifier, char** error_text) {
    if (!bundle_identifier) {
        report(ANNEXA_EINVAL, "invalid argument", error_text);
        return nullptr;
    }
    auto connection = annexa::connectToPlugIn(bundle_identifier, corvane::dispatch::Queue::create("annexa_plugin"),
                                              [](const corvane::rpx::Event&) {});
    if (!connection) {
        report(ANNEXA_EUNREACHABLE, connection.error().description(), error_text);
        return nullptr;
    }
    report(0, {}, error_text);
    return new annexa_plugin{*connection, ANNEXA_NOTATION_TEXT};
}

int64_t annexa_plugin_send(annexa_plugin* plugin, const char* message, char** reply, char** error_text) {
    if (reply) *reply = nullptr;
    if (!plugin || !message || !reply) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    auto value = readText(message, plugin->notation, "the message is");
    if (!value) return report(ANNEXA_EINVAL, value.error().description(), error_text);
    Reply r = plugin->connection->sendWithReplySync(*value);
    if (!r.ok()) return report(ANNEXA_EUNREACHABLE, "the plug-in's connection ended: " + r.description(), error_text);
    *reply = copyText(written(r.value, plugin->notation));
    return report(0, {}, error_text);
}

void annexa_plugin_close(annexa_plugin* plugin) {
    if (!plugin) return;
    plugin->connection->cancel();
    delete plugin;
}

int64_t annexa_plugin_set_notation(annexa_plugin* plugin, int notation) {
    if (!plugin || !knownNotation(notation)) return ANNEXA_EINVAL;
    plugin->notation = notation;
    return 0;
}

int64_t annexa_plugin_run(annexa_plugin_handler handler, void* context) {
    return annexa_plugin_serve(handler, context, ANNEXA_NOTATION_TEXT);
}

int64_t annexa_plugin_serve(annexa_plugin_handler handler, void* context, int notation) {
    if (!handler || !knownNotation(notation)) return ANNEXA_EINVAL;
    int served = annexa::AXPlugInRuntime::run([handler, context, notation](const corvane::rpx::ConnectionPtr& host,
                                                                           const corvane::rpx::Event& ev) {
        char* answer = handler(written(ev.message, notation).c_str(), context);
        corvane::Value reply = corvane::Value(corvane::Dictionary{});
        if (answer) {
            // A reply the handler wrote badly is an error for the host, not silence.
            auto parsed = readText(answer, notation, "the plug-in's reply is");
            reply = parsed ? *parsed : corvane::dict({{"error", parsed.error().description()}});
            std::free(answer);
        }
        if (ev.wantsReply) host->sendReply(ev.messageId, reply);
    });
    return served == 0 ? 0 : ANNEXA_EINVAL;
}

uint64_t annexa_plugin_begin_busy(const char* reason) {
    return annexa::AXPlugInRuntime::beginBusy(reason ? reason : "busy");
}

void annexa_plugin_end_busy(uint64_t assertion) { annexa::AXPlugInRuntime::endBusy(assertion); }

void annexa_log_to_stderr(int enabled) { corvane::log::setStandardErrorFallback(enabled != 0); }

int64_t annexa_add(annexa_client* client, const char* const* paths, size_t count, char** error_text) {
    std::vector<std::string> list;
    if (!client || !readPaths(paths, count, list)) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.addPlugIns(list, std::move(done)); }), error_text);
}

int64_t annexa_remove(annexa_client* client, const char* const* paths, size_t count, char** error_text) {
    std::vector<std::string> list;
    if (!client || !readPaths(paths, count, list)) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.removePlugIns(list, std::move(done)); }),
                  error_text);
}

int64_t annexa_annotate(annexa_client* client, const char* const* uuids, size_t count, const char* annotations,
                        char** error_text) {
    std::vector<corvane::UUID> list;
    if (!client || !annotations) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    if (int64_t bad = readUuids(uuids, count, list, error_text)) return bad;
    auto value = readText(annotations, client->notation, "the annotations are");
    if (!value) return report(ANNEXA_EINVAL, value.error().description(), error_text);
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.setPlugInAnnotations(list, *value, std::move(done)); }),
                  error_text);
}

int64_t annexa_bulk_annotate(annexa_client* client, const char* annotations, char** error_text) {
    if (!client || !annotations) return report(ANNEXA_EINVAL, "invalid argument", error_text);
    auto value = readText(annotations, client->notation, "the annotations are");
    if (!value) return report(ANNEXA_EINVAL, value.error().description(), error_text);
    AXDaemonClient& c = client->client;
    return finish(c, c.wait([&](AXDaemonClient::Completion done) { c.bulkSetPlugInAnnotations(*value, std::move(done)); }),
                  error_text);
}

void annexa_free(void* text) { std::free(text); }

char* annexa_copy_text(const char* text) { return text ? copyText(text) : nullptr; }

}  // extern "C"
