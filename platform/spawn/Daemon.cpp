// spawnd: domains of external services, instances and their lifecycle, busy assertions.
#include "platform/spawn/Daemon.h"

#include <signal.h>
#include <sys/pidfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>
#include <set>
#include <thread>

#include "platform/bundle/Bundle.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/pcx/Pcx.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/spawn/Launch.h"
#include "platform/spawn/Protocol.h"
#include "platform/spawn/Spawn.h"
#include "platform/spawn/Watcher.h"

namespace corvane::spawn {

namespace {

const log::Handle& spawnLog() {
    static const log::Handle h("com.corvane.spawnd", "spawnd");
    return h;
}

// A host process: its pid and its start time, so that a reused pid is another host.
struct HostKey {
    pid_t pid = 0;
    uint64_t startTime = 0;
    auto operator<=>(const HostKey&) const = default;
};

struct Registration {
    std::string executable;
    std::string bundlePath;
    std::string identifier;
    std::string version;
    Value overlay;
};

// A host waiting for the instance to take the connection it was handed.
struct Waiting {
    rpx::ConnectionPtr host;
    uint64_t messageId = 0;
    std::shared_ptr<FileDescriptor> hostEnd;
};

struct Instance {
    HostKey host;
    Registration registration;
    pid_t pid = 0;
    std::shared_ptr<FileDescriptor> pidfd;
    rpx::ConnectionPtr control;
    bool started = false;  // has taken a connection
    bool ending = false;
    bool exited = false;
    std::map<uint64_t, Waiting> waiting;
    uint64_t nextWaiting = 1;
    std::map<uint64_t, std::string> busy;
    uint64_t exitWatch = 0, acceptTimer = 0, idleTimer = 0, killTimer = 0;

    std::string description() const {
        return registration.identifier + " (pid " + std::to_string(pid) + ", host " + std::to_string(host.pid) + ")";
    }
};
using InstancePtr = std::shared_ptr<Instance>;

struct Domain {
    std::shared_ptr<FileDescriptor> pidfd;
    uint64_t exitWatch = 0;
    std::map<std::string, Registration> services;
    std::map<std::string, InstancePtr> instances;
};

Value errorReply(int error, const std::string& text) {
    return dict({{protocol::kErrno, int64_t{error}}, {protocol::kError, text}});
}

bool entitledRegistrar(const rpx::Connection& connection) {
    auto signer = codesign::Handle::fromAuditToken(connection.peer().auditToken);
    return signer && signer->valueForEntitlement(kDomainExtensionProxyEntitlement).isTrue();
}

// The overlay's shape: {"RPXService": {...}, "KFBundlePackageType": "RPX!"}, the environment a
// dictionary of strings, the profile a string.
bool wellShapedOverlay(const Value& overlay) {
    const Value& service = overlay[protocol::kService];
    if (!service.isDictionary() || overlay[protocol::kPackageType] != Value("RPX!")) return false;
    if (const Value* environment = service.find(protocol::kEnvironment)) {
        const Dictionary* variables = environment->asDictionary();
        if (!variables) return false;
        for (const auto& [name, value] : *variables) {
            if (name.empty() || name.find('=') != std::string::npos || !value.isString()) return false;
        }
    }
    const Value* profile = service.find(protocol::kSandboxProfile);
    return !profile || profile->isString();
}

std::string signalName(int signal) {
    const char* text = ::sigabbrev_np(signal);
    return text ? std::string("SIG") + text : "signal " + std::to_string(signal);
}

// Where an instance's standard output and error go: the journal, under the bundle's identifier.
std::shared_ptr<FileDescriptor> outputFor(const std::string& identifier) {
    const char* sink = std::getenv("CORVANE_LOG_SINK");
    if (!sink || std::strcmp(sink, "stderr") != 0) {
        int fd = ::sd_journal_stream_fd(identifier.c_str(), LOG_INFO, 1);
        if (fd >= 0) return std::make_shared<FileDescriptor>(fd);
    }
    return std::make_shared<FileDescriptor>(::fcntl(2, F_DUPFD_CLOEXEC, 3));
}

}  // namespace

// The service manager and the assertion service. Lives on: its queue.
class Manager : public std::enable_shared_from_this<Manager> {
public:
    Manager(const Options& options, dispatch::QueuePtr queue)
        : options_(options), queue_(std::move(queue)), watcher_(std::make_shared<Watcher>(queue_)) {}

    Status serve();
    // Ends every instance and waits (up to the grace period and a little) until they are gone.
    void stop();

private:
    void serveManager(const rpx::ConnectionPtr& connection, const rpx::Event& ev) REQUIRES(*queue_);
    void serveAssertions(const rpx::ConnectionPtr& connection, const rpx::Event& ev) REQUIRES(*queue_);
    int add(const rpx::Connection& registrar, const Value& request) REQUIRES(*queue_);
    int remove(const rpx::Connection& registrar, const Value& request) REQUIRES(*queue_);
    void connect(const rpx::ConnectionPtr& host, uint64_t messageId, const Value& request) REQUIRES(*queue_);

    Result<InstancePtr> launchInstance(const HostKey& host, const Registration& registration) REQUIRES(*queue_);
    void handOver(const InstancePtr& instance, const rpx::ConnectionPtr& host, uint64_t messageId) REQUIRES(*queue_);
    void controlEvent(const InstancePtr& instance, const rpx::Event& ev) REQUIRES(*queue_);
    void updateIdleTimer(const InstancePtr& instance, bool idle) REQUIRES(*queue_);
    void terminate(const InstancePtr& instance, const char* why) REQUIRES(*queue_);
    void instanceExited(const InstancePtr& instance) REQUIRES(*queue_);
    void hostExited(const HostKey& host) REQUIRES(*queue_);

    const Options options_;
    const dispatch::QueuePtr queue_;
    const std::shared_ptr<Watcher> watcher_;
    std::vector<std::shared_ptr<rpx::Listener>> listeners_;
    std::map<HostKey, Domain> domains_ GUARDED_BY(*queue_);
    std::set<InstancePtr> live_ GUARDED_BY(*queue_);
};

Status Manager::serve() {
    for (const char* endpoint : {kEndpoint, kAssertionEndpoint}) {
        auto listener = rpx::Listener::create(endpoint, queue_);
        if (!listener) return listener.error();
        bool assertions = std::strcmp(endpoint, kAssertionEndpoint) == 0;
        std::weak_ptr<Manager> weak = weak_from_this();
        (*listener)->setConnectionHandler([weak, assertions](rpx::ConnectionPtr c) {
            std::weak_ptr<rpx::Connection> weakConnection = c;
            c->setEventHandler([weak, weakConnection, assertions](const rpx::Event& ev) {
                auto self = weak.lock();
                auto connection = weakConnection.lock();
                if (!self || !connection || ev.isError()) return;
                self->queue_->async([self, connection, ev, assertions] {
                    self->queue_->assertCurrent();
                    if (assertions) {
                        self->serveAssertions(connection, ev);
                    } else {
                        self->serveManager(connection, ev);
                    }
                });
            });
            c->resume();
        });
        listeners_.push_back(*listener);
    }
    for (auto& listener : listeners_) listener->resume();
    return {};
}

void Manager::serveManager(const rpx::ConnectionPtr& connection, const rpx::Event& ev) {
    if (!ev.wantsReply) return;
    const std::string* request = ev.message[protocol::kRequest].asString();
    if (request && *request == protocol::kConnect) return connect(connection, ev.messageId, ev.message);
    int result = EINVAL;
    if (request && (*request == protocol::kAdd || *request == protocol::kRemove)) {
        if (!entitledRegistrar(*connection)) {
            log::error(spawnLog(), "refused %{public}s from pid %d %@: no %{public}s entitlement", *request,
                       connection->pid(), connection->peer().executablePath, kDomainExtensionProxyEntitlement);
            result = EPERM;
        } else {
            result = *request == protocol::kAdd ? add(*connection, ev.message) : remove(*connection, ev.message);
        }
    }
    connection->sendReply(ev.messageId, dict({{protocol::kResult, int64_t{result}}}));
}

int Manager::add(const rpx::Connection& registrar, const Value& request) {
    auto hostPid = request[protocol::kHost].int64Value();
    const std::string* executable = request[protocol::kExecutable].asString();
    const Value& overlay = request[protocol::kOverlay];
    if (!hostPid || *hostPid <= 0 || *hostPid > INT32_MAX || !executable || !wellShapedOverlay(overlay)) return EINVAL;
    struct stat st {};
    if (::stat(executable->c_str(), &st) != 0) return errno;
    if (!S_ISREG(st.st_mode)) return EINVAL;
    auto bundle = bundle::Bundle::openExecutable(*executable);
    auto bundlePath = bundle ? bundle->property(bundle::kPropertyBundlePath) : std::nullopt;
    Value info = bundle ? bundle->infoDictionary() : Value();
    const std::string* identifier = info["KFBundleIdentifier"].asString();
    if (!bundlePath || !identifier || identifier->empty()) return ENOENT;
    const std::string* version = info["KFBundleVersion"].asString();

    pid_t pid = static_cast<pid_t>(*hostPid);
    int pidfd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
    if (pidfd < 0) return errno;
    auto hostPidfd = std::make_shared<FileDescriptor>(pidfd);
    HostKey key{pid, rpx::identityOfProcess(pid, 0, 0, hostPidfd).auditToken.startTime};
    // The start time was read while the pidfd held the process: it is the host's own.
    if (::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) != 0) return ESRCH;

    auto [it, made] = domains_.try_emplace(key);
    Domain& domain = it->second;
    if (made) {
        domain.pidfd = hostPidfd;
        std::weak_ptr<Manager> weak = weak_from_this();
        domain.exitWatch = watcher_->whenReadable(pidfd, [weak, key] {
            if (auto self = weak.lock()) {
                self->queue_->assertCurrent();
                self->hostExited(key);
            }
        });
    }
    domain.services[*identifier] = Registration{*executable, *bundlePath, *identifier, version ? *version : "", overlay};
    log::info(spawnLog(), "pid %d %@ registered %{public}@ for host %d", registrar.pid(),
              registrar.peer().executablePath, *identifier, pid);
    log::debug(spawnLog(), "overlay of %{public}@ for host %d: %@", *identifier, pid, overlay);
    return 0;
}

int Manager::remove(const rpx::Connection& registrar, const Value& request) {
    const std::string* identifier = request[protocol::kBundleIdentifier].asString();
    const std::string* version = request[protocol::kBundleVersion].asString();
    if (!identifier || !version) return EINVAL;
    bool found = false;
    for (auto& [key, domain] : domains_) {
        auto service = domain.services.find(*identifier);
        if (service == domain.services.end() || (!version->empty() && service->second.version != *version)) continue;
        found = true;
        domain.services.erase(service);
    }
    for (const InstancePtr& instance : live_) {
        if (instance->registration.identifier == *identifier &&
            (version->empty() || instance->registration.version == *version)) {
            found = true;
            terminate(instance, "its service was removed");
        }
    }
    log::info(spawnLog(), "pid %d removed %{public}@ (%@): %{public}s", registrar.pid(), *identifier, *version,
              found ? "done" : "nothing on record");
    return found ? 0 : kNothingOnRecord;
}

void Manager::connect(const rpx::ConnectionPtr& host, uint64_t messageId, const Value& request) {
    const std::string* identifier = request[protocol::kBundleIdentifier].asString();
    if (!identifier) return host->sendReply(messageId, errorReply(EINVAL, "the request names no bundleIdentifier"));
    const rpx::AuditToken& token = host->peer().auditToken;
    auto domain = domains_.find(HostKey{token.pid, token.startTime});
    const Registration* service = nullptr;
    if (domain != domains_.end()) {
        auto found = domain->second.services.find(*identifier);
        if (found != domain->second.services.end()) service = &found->second;
    }
    if (!service) {
        return host->sendReply(messageId, errorReply(ENOENT, "no service " + *identifier + " in the domain of pid " +
                                                                 std::to_string(token.pid)));
    }
    InstancePtr& instance = domain->second.instances[*identifier];
    if (instance && instance->ending) instance = nullptr;
    if (!instance) {
        auto launched = launchInstance(domain->first, *service);
        if (!launched) {
            domain->second.instances.erase(*identifier);
            log::error(spawnLog(), "cannot launch %{public}@ for host %d: %@", *identifier, token.pid, launched.error());
            return host->sendReply(messageId, errorReply(static_cast<int>(launched.error().code),
                                                         "cannot launch " + *identifier + ": " + launched.error().description()));
        }
        instance = *launched;
    }
    if (instance->waiting.size() >= options_.waitingPerInstance) {
        return host->sendReply(messageId, errorReply(EAGAIN, *identifier + " has not taken the connections it was handed"));
    }
    handOver(instance, host, messageId);
}

Result<InstancePtr> Manager::launchInstance(const HostKey& host, const Registration& registration) {
    const Value& service = registration.overlay[protocol::kService];
    std::map<std::string, std::string> environment;
    if (const Dictionary* variables = service[protocol::kEnvironment].asDictionary()) {
        for (const auto& [name, value] : *variables) environment[name] = *value.asString();
    }
    if (!layout::root().empty()) environment["CORVANE_ROOT"] = layout::root();
    const std::string* profileName = service[protocol::kSandboxProfile].asString();
    ConfinementPaths paths{registration.bundlePath, environment["HOME"], environment["TMPDIR"]};
    for (const std::string* dir : {&paths.home, &paths.tmpdir}) {
        if (dir->empty()) continue;
        if (auto made = layout::makeDirectories(*dir, 0700); !made.ok()) return made.error();
    }
    if (paths.home.empty()) environment.erase("HOME");
    if (paths.tmpdir.empty()) environment.erase("TMPDIR");
    auto confinement = prepareConfinement(profileName ? *profileName : "plugin", paths);
    if (!confinement) return confinement.error();

    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return Error::posix(errno, "socketpair");
    auto ours = std::make_shared<FileDescriptor>(ends[0]);
    auto theirs = std::make_shared<FileDescriptor>(ends[1]);
    LaunchSettings settings{registration.executable, environment, paths.home.empty() ? "/" : paths.home,
                            *confinement, theirs, outputFor(registration.identifier)};
    auto launched = launch(settings);
    if (!launched) return launched.error();

    auto instance = std::make_shared<Instance>();
    instance->host = host;
    instance->registration = registration;
    instance->pid = launched->pid;
    instance->pidfd = launched->pidfd;
    instance->control = rpx::Connection::adopt(ours, queue_);
    std::weak_ptr<Manager> weak = weak_from_this();
    std::weak_ptr<Instance> weakInstance = instance;
    instance->control->setEventHandler([weak, weakInstance](const rpx::Event& ev) {
        auto self = weak.lock();
        auto target = weakInstance.lock();
        if (!self || !target) return;
        self->queue_->assertCurrent();
        self->controlEvent(target, ev);
    });
    instance->control->resume();
    // The watch keeps the instance alive until its process is reaped.
    instance->exitWatch = watcher_->whenReadable(instance->pidfd->get(), [weak, instance] {
        if (auto self = weak.lock()) {
            self->queue_->assertCurrent();
            self->instanceExited(instance);
        }
    });
    live_.insert(instance);
    log::info(spawnLog(), "launched %{public}@ in pid %d for host %d under the %{public}@ profile",
              registration.identifier, instance->pid, host.pid, confinement->profile);
    return instance;
}

void Manager::handOver(const InstancePtr& instance, const rpx::ConnectionPtr& host, uint64_t messageId) {
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) {
        return host->sendReply(messageId, errorReply(errno, std::string("socketpair: ") + std::strerror(errno)));
    }
    auto hostEnd = std::make_shared<FileDescriptor>(ends[0]);
    auto instanceEnd = std::make_shared<FileDescriptor>(ends[1]);
    uint64_t id = instance->nextWaiting++;
    instance->waiting[id] = Waiting{host, messageId, hostEnd};
    updateIdleTimer(instance, false);
    if (!instance->started && instance->acceptTimer == 0) {
        std::weak_ptr<Manager> weak = weak_from_this();
        std::weak_ptr<Instance> weakInstance = instance;
        instance->acceptTimer = watcher_->after(options_.acceptTimeout, [weak, weakInstance] {
            auto self = weak.lock();
            auto target = weakInstance.lock();
            if (!self || !target) return;
            self->queue_->assertCurrent();
            target->acceptTimer = 0;
            log::error(spawnLog(), "%@ did not take its first connection in time; ending it", target->description());
            for (auto& [waitingId, waiting] : target->waiting) {
                waiting.host->sendReply(waiting.messageId,
                                        errorReply(ETIMEDOUT, target->registration.identifier + " did not accept the connection in time"));
            }
            target->waiting.clear();
            self->terminate(target, "it did not accept in time");
        });
    }
    std::weak_ptr<Manager> weak = weak_from_this();
    std::weak_ptr<Instance> weakInstance = instance;
    instance->control->sendWithReply(dict({{protocol::kConnection, Value(instanceEnd)}}), queue_,
                                     [weak, weakInstance, id](const rpx::Reply& reply) {
        auto self = weak.lock();
        auto target = weakInstance.lock();
        if (!self || !target || !reply.ok()) return;  // an instance that ended answers in instanceExited
        self->queue_->assertCurrent();
        auto it = target->waiting.find(id);
        if (it == target->waiting.end()) return;
        it->second.host->sendReply(it->second.messageId, dict({{protocol::kFd, Value(it->second.hostEnd)}}));
        target->waiting.erase(it);
        if (!target->started) {
            target->started = true;
            if (target->acceptTimer) self->watcher_->cancel(target->acceptTimer);
            target->acceptTimer = 0;
        }
    });
}

void Manager::controlEvent(const InstancePtr& instance, const rpx::Event& ev) {
    if (ev.isError()) {
        // An instance without its control connection can be handed nothing: end it.
        if (!instance->exited) terminate(instance, "its control connection ended");
        return;
    }
    const Value& message = ev.message;
    if (auto idle = message[protocol::kIdle].boolValue()) {
        updateIdleTimer(instance, *idle);
    } else if (const std::string* reason = message[protocol::kBusy].asString()) {
        auto assertion = message[protocol::kAssertion].uint64Value();
        if (!assertion) return;
        if (instance->busy.size() >= options_.assertionsPerInstance) {
            log::error(spawnLog(), "%@ holds too many busy assertions; ignoring another", instance->description());
            return;
        }
        instance->busy[*assertion] = *reason;
    } else if (auto assertion = message[protocol::kUnbusy].uint64Value()) {
        instance->busy.erase(*assertion);
    }
}

void Manager::updateIdleTimer(const InstancePtr& instance, bool idle) {
    if (instance->idleTimer) watcher_->cancel(instance->idleTimer);
    instance->idleTimer = 0;
    if (!idle || instance->ending || !instance->waiting.empty()) return;
    std::weak_ptr<Manager> weak = weak_from_this();
    std::weak_ptr<Instance> weakInstance = instance;
    instance->idleTimer = watcher_->after(options_.idle, [weak, weakInstance] {
        auto self = weak.lock();
        auto target = weakInstance.lock();
        if (!self || !target) return;
        self->queue_->assertCurrent();
        target->idleTimer = 0;
        self->terminate(target, "it was idle");
    });
}

void Manager::terminate(const InstancePtr& instance, const char* why) {
    if (instance->ending || instance->exited) return;
    instance->ending = true;
    log::info(spawnLog(), "ending %@: %{public}s", instance->description(), why);
    // Until the leader is reaped its pid, and so its process group, cannot be reused.
    ::syscall(SYS_pidfd_send_signal, instance->pidfd->get(), SIGTERM, nullptr, 0);
    ::kill(-instance->pid, SIGTERM);
    std::weak_ptr<Manager> weak = weak_from_this();
    std::weak_ptr<Instance> weakInstance = instance;
    instance->killTimer = watcher_->after(options_.grace, [weak, weakInstance] {
        auto self = weak.lock();
        auto target = weakInstance.lock();
        if (!self || !target || target->exited) return;
        self->queue_->assertCurrent();
        target->killTimer = 0;
        log::notice(spawnLog(), "%@ outlived its grace period; killing it", target->description());
        ::kill(-target->pid, SIGKILL);
        ::syscall(SYS_pidfd_send_signal, target->pidfd->get(), SIGKILL, nullptr, 0);
    });
}

void Manager::instanceExited(const InstancePtr& instance) {
    siginfo_t info{};
    if (::waitid(P_PIDFD, static_cast<id_t>(instance->pidfd->get()), &info, WEXITED | WNOHANG) != 0 || info.si_pid == 0) {
        // Readable but not reapable: someone else reaped it. Nothing more can be learnt.
        info.si_code = 0;
    }
    // What it started ends with it.
    ::kill(-instance->pid, SIGKILL);
    instance->exited = true;
    for (uint64_t* timer : {&instance->acceptTimer, &instance->idleTimer, &instance->killTimer}) {
        if (*timer) watcher_->cancel(*timer);
        *timer = 0;
    }
    instance->control->cancel();
    live_.erase(instance);
    auto domain = domains_.find(instance->host);
    if (domain != domains_.end()) {
        auto it = domain->second.instances.find(instance->registration.identifier);
        if (it != domain->second.instances.end() && it->second == instance) domain->second.instances.erase(it);
    }

    std::string how;
    Value status;
    if (info.si_code == CLD_EXITED) {
        how = "exited with status " + std::to_string(info.si_status);
        status = dict({{protocol::kStatus, int64_t{info.si_status}}});
    } else if (info.si_code == CLD_KILLED || info.si_code == CLD_DUMPED) {
        how = "was killed by " + signalName(info.si_status);
        status = dict({{protocol::kSignal, int64_t{info.si_status}}});
    } else {
        how = "ended";
    }
    log::notice(spawnLog(), "%@ %{public}@", instance->description(), how);
    for (auto& [id, waiting] : instance->waiting) {
        Value refusal = errorReply(ECONNREFUSED, instance->registration.identifier + " " + how +
                                                     " before accepting the connection");
        Dictionary reply = *refusal.asDictionary();
        if (const Dictionary* extra = status.asDictionary()) reply.insert(extra->begin(), extra->end());
        waiting.host->sendReply(waiting.messageId, Value(std::move(reply)));
    }
    instance->waiting.clear();
}

void Manager::hostExited(const HostKey& host) {
    auto domain = domains_.find(host);
    if (domain == domains_.end()) return;
    log::info(spawnLog(), "host %d exited; dropping its domain", host.pid);
    for (auto& [identifier, instance] : domain->second.instances) terminate(instance, "its host exited");
    domains_.erase(domain);
}

void Manager::serveAssertions(const rpx::ConnectionPtr& connection, const rpx::Event& ev) {
    if (!ev.wantsReply) return;
    std::set<std::string> wanted;
    if (const Array* identifiers = ev.message[protocol::kBundleIdentifiers].asArray()) {
        for (const Value& identifier : *identifiers) {
            if (const std::string* text = identifier.asString()) wanted.insert(*text);
        }
    }
    Array instances;
    for (const InstancePtr& instance : live_) {
        if (instance->busy.empty() || !wanted.count(instance->registration.identifier)) continue;
        instances.push_back(dict({{kBundleIdentifierKey, instance->registration.identifier},
                                  {kPidKey, int64_t{instance->pid}},
                                  {kReasonKey, instance->busy.begin()->second}}));
    }
    connection->sendReply(ev.messageId, dict({{protocol::kInstances, Value(std::move(instances))}}));
}

void Manager::stop() {
    for (auto& listener : listeners_) listener->cancel();
    queue_->sync([&] {
        queue_->assertCurrent();
        for (const InstancePtr& instance : std::set<InstancePtr>(live_)) terminate(instance, "spawnd is stopping");
    });
    auto deadline = std::chrono::steady_clock::now() + options_.grace + std::chrono::milliseconds(500);
    while (std::chrono::steady_clock::now() < deadline) {
        bool empty = queue_->syncResult([&] {
            queue_->assertCurrent();
            return live_.empty();
        });
        if (empty) return;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
}

struct Daemon::Parts {
    std::shared_ptr<Manager> manager;
    std::unique_ptr<sandbox::Broker> broker;
    std::unique_ptr<pcx::Service> consent;
};

Result<std::unique_ptr<Daemon>> Daemon::start(const Options& options) {
    auto parts = std::make_unique<Parts>();
    parts->manager = std::make_shared<Manager>(options, dispatch::Queue::create("com.corvane.spawnd"));
    if (auto served = parts->manager->serve(); !served.ok()) return served.error();
    auto broker = sandbox::Broker::start(dispatch::Queue::create("com.corvane.sandbox.broker"));
    if (!broker) return broker.error();
    parts->broker = std::move(*broker);
    auto consent = pcx::Service::start(dispatch::Queue::create("com.corvane.pcx"));
    if (!consent) return consent.error();
    parts->consent = std::move(*consent);
    return std::unique_ptr<Daemon>(new Daemon(std::move(parts)));
}

Daemon::Daemon(std::unique_ptr<Parts> parts) : parts_(std::move(parts)) {}

Daemon::~Daemon() { parts_->manager->stop(); }

}  // namespace corvane::spawn
