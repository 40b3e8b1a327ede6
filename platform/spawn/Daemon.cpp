// spawnd: domains of external services, instances and their lifecycle, busy assertions.
#include "platform/spawn/Daemon.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/pidfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <map>
#include <set>
#include <thread>

#include "platform/bundle/Bundle.h"
#include "platform/containers/Containers.h"
#include "platform/codesign/CodeSign.h"
#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/pcx/Pcx.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/spawn/Launch.h"
#include "platform/spawn/Limits.h"
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
    InstanceLimits::Group group;

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

// Why the peer may not register plug-ins for hosts, or nothing when it may.
std::optional<std::string> registrarRefusal(const rpx::Connection& connection) {
    auto signer = codesign::Handle::fromAuditToken(connection.peer().auditToken);
    if (signer && signer->valueForEntitlement(kDomainExtensionProxyEntitlement).isTrue()) return std::nullopt;
    std::string why = !signer ? "it runs code its signature does not cover"
                      : !signer->verification().valid ? signer->verification().reason
                                                      : "its signature does not grant it";
    return "spawnd accepts plug-ins only from a program with the " + std::string(kDomainExtensionProxyEntitlement) +
           " entitlement, and " + connection.peer().executablePath + " has none: " + why;
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
    if (profile && !profile->isString()) return false;
    // A container is named, never given as a path.
    const Value* container = service.find(protocol::kDataContainer);
    if (container && (!container->isString() || container->asString()->empty() || container->asString()->front() == '.' ||
                      container->asString()->find('/') != std::string::npos))
        return false;
    const Value* memory = service.find(protocol::kMemoryLimit);
    return !memory || memory->uint64Value().has_value();
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

// A busy assertion's reason as it is kept: at most this many bytes, cut at a character's start.
constexpr size_t kMaxReason = 1024;
std::string keptReason(const std::string& reason) {
    if (reason.size() <= kMaxReason) return reason;
    size_t end = kMaxReason;
    while (end > 0 && (static_cast<unsigned char>(reason[end]) & 0xc0) == 0x80) --end;
    return reason.substr(0, end);
}

// Descriptors one instance holds (its pidfd, its control connection and room for connections being
// handed over), and those kept free for new connections whatever the instances take.
constexpr size_t kDescriptorsPerInstance = 4;
constexpr size_t kDescriptorReserve = 64;

// The soft descriptor limit spawnd was started with, which its instances start with too; spawnd
// itself raises its own to the hard limit.
std::atomic<uint64_t> gOriginalDescriptorLimit{0};
uint64_t originalDescriptorLimit() { return gOriginalDescriptorLimit.load(); }

}  // namespace

// The service manager and the assertion service. Lives on: its queue.
class Manager : public std::enable_shared_from_this<Manager> {
public:
    Manager(const Options& options, dispatch::QueuePtr queue, size_t maxInstances)
        : options_(options),
          queue_(std::move(queue)),
          watcher_(std::make_shared<Watcher>(queue_)),
          limits_(options.tasksPerInstance),
          maxInstances_(maxInstances) {}

    Status serve();
    // Reaps every child that exited: instances (through instanceExited) and whatever an instance's
    // processes left to spawnd, the subreaper of all of them. `signals` is a signalfd of SIGCHLD,
    // watched from then on.
    void reapChildren(std::shared_ptr<FileDescriptor> signals);
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

    void reap() REQUIRES(*queue_);
    // Reaps once a second while instances run (and once after the last).
    void sweepWhileInstancesRun() REQUIRES(*queue_);
    // Soon, on the queue: a child for the next launch, in a cgroup of its own (when there are
    // cgroups and none is prepared yet).
    void prepareNext() REQUIRES(*queue_);

    const Options options_;
    const dispatch::QueuePtr queue_;
    const std::shared_ptr<Watcher> watcher_;
    InstanceLimits limits_ GUARDED_BY(*queue_);
    const size_t maxInstances_;
    bool sweeping_ GUARDED_BY(*queue_) = false;
    bool stopping_ GUARDED_BY(*queue_) = false;
    // Children in the cgroups of the next launches, two of them: the first made after a quiet while
    // waits a grace period, which the launch after the next should not have to wait for.
    struct Prepared {
        std::unique_ptr<PreparedChild> child;
        InstanceLimits::Group group;
    };
    static constexpr size_t kPrepared = 2;
    std::deque<Prepared> prepared_ GUARDED_BY(*queue_);
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
    // This spawnd owns its endpoints now: what an earlier one for this user and runtime directory
    // left running is ended before anything is launched.
    queue_->sync([&] {
        queue_->assertCurrent();
        limits_.endLeftovers();
        prepareNext();
        if (limits_.bounded()) {
            log::info(spawnLog(), "instances are bounded to %llu tasks each through %{public}@",
                      static_cast<unsigned long long>(options_.tasksPerInstance), limits_.description());
        } else {
            log::notice(spawnLog(), "the tasks of plug-in instances are not bounded: no cgroup is delegated to spawnd");
        }
    });
    return {};
}

void Manager::serveManager(const rpx::ConnectionPtr& connection, const rpx::Event& ev) {
    if (!ev.wantsReply) return;
    const std::string* request = ev.message[protocol::kRequest].asString();
    if (request && *request == protocol::kConnect) return connect(connection, ev.messageId, ev.message);
    int result = EINVAL;
    std::string reason = "the request is not one spawnd knows";
    if (request && (*request == protocol::kAdd || *request == protocol::kRemove)) {
        if (auto refusal = registrarRefusal(*connection)) {
            log::error(spawnLog(), "refused %{public}s from pid %d %{public}@: %{public}@", *request, connection->pid(),
                       connection->peer().executablePath, *refusal);
            result = EPERM;
            reason = *refusal;
        } else {
            result = *request == protocol::kAdd ? add(*connection, ev.message) : remove(*connection, ev.message);
            reason = "spawnd could not " + *request + " the plug-in: " + std::strerror(result);
        }
    }
    Dictionary reply{{protocol::kResult, Value(int64_t{result})}};
    if (result != 0) reply[protocol::kError] = Value(reason);
    connection->sendReply(ev.messageId, Value(std::move(reply)));
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
    log::info(spawnLog(), "pid %d %{public}@ registered %{public}@ for host %d", registrar.pid(),
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
    log::info(spawnLog(), "pid %d removed %{public}@ (%{public}@): %{public}s", registrar.pid(), *identifier, *version,
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
                                                                 std::to_string(token.pid) +
                                                                 ": the host gets the plug-in ready first (the \"ready\" "
                                                                 "request: annexa_ready, axctl ready)"));
    }
    auto running = domain->second.instances.find(*identifier);
    bool launching = running == domain->second.instances.end() || !running->second || running->second->ending;
    if (launching && domain->second.instances.size() >= options_.instancesPerHost) {
        log::error(spawnLog(), "refused to launch %{public}@ for host %d: too many instances for that host", *identifier, token.pid);
        return host->sendReply(messageId, errorReply(EAGAIN, "too many instances for host " + std::to_string(token.pid)));
    }
    if (launching && live_.size() >= maxInstances_) {
        log::error(spawnLog(), "refused to launch %{public}@ for host %d: %zu instances run", *identifier, token.pid,
                   live_.size());
        return host->sendReply(messageId, errorReply(EAGAIN, "too many instances (" + std::to_string(live_.size()) + ")"));
    }
    InstancePtr& instance = domain->second.instances[*identifier];
    if (instance && instance->ending) instance = nullptr;
    if (!instance) {
        auto launched = launchInstance(domain->first, *service);
        if (!launched) {
            domain->second.instances.erase(*identifier);
            log::error(spawnLog(), "cannot launch %{public}@ for host %d: %{public}@", *identifier, token.pid, launched.error());
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

namespace {

// The bundle, opened as the directory it is (a symbolic link in its place is not followed), and
// the executable found beneath it without leaving it.
Result<std::shared_ptr<FileDescriptor>> openBundle(const Registration& registration) {
    int fd = ::open(registration.bundlePath.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) return Error::posix(errno, "bundle " + registration.bundlePath);
    auto bundle = std::make_shared<FileDescriptor>(fd);
    const std::string prefix = registration.bundlePath + "/";
    if (registration.executable.compare(0, prefix.size(), prefix) != 0)
        return Error::posix(EACCES, "the executable " + registration.executable + " is not inside its bundle");
    open_how how{};
    how.flags = O_PATH | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
    std::string relative = registration.executable.substr(prefix.size());
    long executable = ::syscall(SYS_openat2, bundle->get(), relative.c_str(), &how, sizeof how);
    if (executable < 0)
        return Error::posix(errno, "the executable " + registration.executable + " is not inside its bundle");
    ::close(static_cast<int>(executable));
    return bundle;
}

}  // namespace

Result<InstancePtr> Manager::launchInstance(const HostKey& host, const Registration& registration) {
    const Value& service = registration.overlay[protocol::kService];
    std::map<std::string, std::string> environment;
    if (const Dictionary* variables = service[protocol::kEnvironment].asDictionary()) {
        // The reserved ones are set below, from the container opened here: no overlay (and no
        // plug-in's own "EnvironmentVariables" in it) points them elsewhere.
        for (const auto& [name, value] : *variables)
            if (!isReservedVariable(name)) environment[name] = *value.asString();
    }
    if (!layout::root().empty()) environment["CORVANE_ROOT"] = layout::root();
    const std::string* profileName = service[protocol::kSandboxProfile].asString();
    auto bundle = openBundle(registration);
    if (!bundle) return bundle.error();
    ConfinementTargets targets{*bundle, nullptr, nullptr};
    std::string workingDirectory = "/";
    // The container comes by name and is opened here, beneath the user's containers, without
    // following a symbolic link the plug-in may have put in it: its paths and the sandbox's rules
    // are made from what was opened, never from an environment value.
    if (const std::string* container = service[protocol::kDataContainer].asString()) {
        auto home = containers::openDataContainer(containers::kPlugInDataClass, *container, true);
        if (!home) return Error::posix(EACCES, home.error().description());
        auto tmp = containers::openBeneath(*home, "tmp", true);
        if (!tmp) return Error::posix(EACCES, tmp.error().description());
        environment["HOME"] = home->path;
        environment["KFFIXED_USER_HOME"] = home->path;
        environment["TMPDIR"] = tmp->path;
        environment["XDG_CONFIG_HOME"] = home->path + "/.config";
        environment["XDG_DATA_HOME"] = home->path + "/.local/share";
        environment["XDG_STATE_HOME"] = home->path + "/.local/state";
        environment["XDG_CACHE_HOME"] = home->path + "/.cache";
        targets.home = home->fd;
        targets.tmpdir = tmp->fd;
        workingDirectory = home->path;
    }
    auto confinement = prepareConfinement(profileName ? *profileName : "plugin", targets);
    if (!confinement) return confinement.error();
    // The extension point's memory, within bounds; the default otherwise.
    auto asked = service[protocol::kMemoryLimit].uint64Value();
    uint64_t memory = asked ? std::clamp<uint64_t>(*asked, uint64_t{16} << 20, uint64_t{64} << 30) : options_.memoryPerInstance;
    uint64_t dataLimit = options_.memoryPerInstance == 0 ? 0 : memory;
    // Its cgroup, with a child that has joined it already when one was prepared.
    InstanceLimits::Group group;
    std::unique_ptr<PreparedChild> prepared;
    if (limits_.bounded()) {
        if (!prepared_.empty()) {
            group = std::move(prepared_.front().group);
            prepared = std::move(prepared_.front().child);
            prepared_.pop_front();
        } else {
            auto made = limits_.makeGroup();
            if (!made) return made.error();
            group = std::move(*made);
        }
        if (memory) limits_.setMemory(group, memory);
    }

    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0) return Error::posix(errno, "socketpair");
    auto ours = std::make_shared<FileDescriptor>(ends[0]);
    auto theirs = std::make_shared<FileDescriptor>(ends[1]);
    LaunchSettings settings{registration.executable, environment, workingDirectory, *confinement, theirs,
                            outputFor(registration.identifier), group.joins, dataLimit, originalDescriptorLimit()};
    auto launched = launch(settings, std::move(prepared));
    prepareNext();
    if (!launched) {
        limits_.endGroup(group);
        return launched.error();
    }

    auto instance = std::make_shared<Instance>();
    instance->host = host;
    instance->registration = registration;
    instance->pid = launched->pid;
    instance->pidfd = launched->pidfd;
    instance->group = std::move(group);
    // Recorded soon after, not on the way to the host's answer: its start time is readable only once
    // its exec is complete. (Its pid names it until spawnd reaps it.)
    std::weak_ptr<Instance> recorded = instance;
    queue_->async([weak = weak_from_this(), recorded] {
        auto self = weak.lock();
        auto target = recorded.lock();
        if (!self || !target) return;
        self->queue_->assertCurrent();
        if (!target->exited) self->limits_.record(target->pid, rpx::processStartTime(target->pid));
    });
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
    sweepWhileInstancesRun();
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
            log::error(spawnLog(), "%{public}@ did not take its first connection in time; ending it", target->description());
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
            log::error(spawnLog(), "%{public}@ holds too many busy assertions; ignoring another", instance->description());
            return;
        }
        instance->busy[*assertion] = keptReason(*reason);
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
    log::info(spawnLog(), "ending %{public}@: %{public}s", instance->description(), why);
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
        log::notice(spawnLog(), "%{public}@ outlived its grace period; killing it", target->description());
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
    // What it started ends with it: its process group, and its cgroup where it has one.
    ::kill(-instance->pid, SIGKILL);
    limits_.endGroup(instance->group);
    limits_.forget(instance->pid);
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
    log::notice(spawnLog(), "%{public}@ %{public}@", instance->description(), how);
    for (auto& [id, waiting] : instance->waiting) {
        Value refusal = errorReply(ECONNREFUSED, instance->registration.identifier + " " + how +
                                                     " before accepting the connection");
        Dictionary reply = *refusal.asDictionary();
        if (const Dictionary* extra = status.asDictionary()) reply.insert(extra->begin(), extra->end());
        waiting.host->sendReply(waiting.messageId, Value(std::move(reply)));
    }
    instance->waiting.clear();
}

void Manager::reapChildren(std::shared_ptr<FileDescriptor> signals) {
    std::weak_ptr<Manager> weak = weak_from_this();
    watcher_->whenReadable(signals->get(), [weak, signals] {
        auto self = weak.lock();
        if (!self) return;
        self->queue_->assertCurrent();
        signalfd_siginfo info[16];
        while (::read(signals->get(), info, sizeof info) > 0) {
        }
        self->reap();
        self->reapChildren(signals);
    });
    queue_->async([weak] {
        if (auto self = weak.lock()) {
            self->queue_->assertCurrent();
            self->reap();
        }
    });
}

void Manager::reap() {
    // __WALL: a child made with another exit signal than SIGCHLD (or none) is reaped too; such a
    // child signals nothing when it exits, which is why the instances' lifetime has a sweep as well.
    for (;;) {
        siginfo_t info{};
        if (::waitid(P_ALL, 0, &info, WEXITED | WNOHANG | WNOWAIT | __WALL) != 0 || info.si_pid == 0) break;
        pid_t pid = info.si_pid;
        auto found = std::find_if(live_.begin(), live_.end(), [&](const InstancePtr& i) { return i->pid == pid; });
        if (found != live_.end()) {
            InstancePtr instance = *found;  // instanceExited takes it out of live_
            instanceExited(instance);       // and reaps it through its pidfd, with its status
        } else {
            // A process an instance started that was left to spawnd (re-parented, or made with
            // CLONE_PARENT): nothing is waiting for it.
            log::debug(spawnLog(), "reaped pid %d, which an instance left behind", pid);
        }
        ::waitpid(pid, nullptr, WNOHANG | __WALL);
    }
    limits_.sweep();
}

void Manager::prepareNext() {
    std::weak_ptr<Manager> weak = weak_from_this();
    queue_->async([weak] {
        auto self = weak.lock();
        if (!self) return;
        self->queue_->assertCurrent();
        if (self->prepared_.size() >= kPrepared || !self->limits_.bounded() || self->stopping_) return;
        auto group = self->limits_.makeGroup();
        if (!group) return;  // the next launch makes its group itself, and says why not
        auto child = PreparedChild::make(group->joins);
        if (!child) {
            self->limits_.endGroup(*group);
            return;
        }
        self->prepared_.push_back(Prepared{std::move(*child), std::move(*group)});
        self->prepareNext();
    });
}

void Manager::sweepWhileInstancesRun() {
    if (sweeping_) return;
    sweeping_ = true;
    std::weak_ptr<Manager> weak = weak_from_this();
    watcher_->after(std::chrono::seconds(1), [weak] {
        auto self = weak.lock();
        if (!self) return;
        self->queue_->assertCurrent();
        self->sweeping_ = false;
        self->reap();
        if (!self->live_.empty()) self->sweepWhileInstancesRun();
    });
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
        stopping_ = true;
        for (Prepared& p : prepared_) {
            p.child.reset();
            limits_.endGroup(p.group);
        }
        prepared_.clear();
        for (const InstancePtr& instance : std::set<InstancePtr>(live_)) terminate(instance, "spawnd is stopping");
    });
    auto deadline = std::chrono::steady_clock::now() + options_.grace + std::chrono::milliseconds(500);
    while (std::chrono::steady_clock::now() < deadline) {
        bool empty = queue_->syncResult([&] {
            queue_->assertCurrent();
            reap();
            if (live_.empty()) limits_.removeAll();
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
    // Whatever an instance's processes leave behind is re-parented to spawnd, which reaps it.
    if (::prctl(PR_SET_CHILD_SUBREAPER, 1, 0, 0, 0) != 0) return Error::posix(errno, "child subreaper");
    sigset_t childSignal;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    int signals = ::signalfd(-1, &childSignal, SFD_NONBLOCK | SFD_CLOEXEC);
    if (signals < 0) return Error::posix(errno, "signalfd");
    auto childSignals = std::make_shared<FileDescriptor>(signals);
    // Many instances need many descriptors: the soft limit goes up to the hard one, and the
    // instances that fit beside a reserve are the most that run.
    rlimit descriptors{};
    ::getrlimit(RLIMIT_NOFILE, &descriptors);
    gOriginalDescriptorLimit.store(descriptors.rlim_cur);
    descriptors.rlim_cur = descriptors.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &descriptors);
    ::getrlimit(RLIMIT_NOFILE, &descriptors);
    size_t room = descriptors.rlim_cur > kDescriptorReserve * 2 ? (descriptors.rlim_cur - kDescriptorReserve * 2) / kDescriptorsPerInstance : 1;
    size_t maxInstances = std::min(options.instances, room);
    if (maxInstances < options.instances)
        log::notice(spawnLog(), "at most %zu instances run: the descriptor limit is %llu", maxInstances,
                    static_cast<unsigned long long>(descriptors.rlim_cur));

    auto parts = std::make_unique<Parts>();
    parts->manager = std::make_shared<Manager>(options, dispatch::Queue::create("com.corvane.spawnd"), maxInstances);
    // The token broker and consent first: once spawnd's own endpoint answers (what a service
    // manager and the tests wait for), every endpoint it hosts does.
    auto broker = sandbox::Broker::start(dispatch::Queue::create("com.corvane.sandbox.broker"));
    if (!broker) return broker.error();
    parts->broker = std::move(*broker);
    auto consent = pcx::Service::start(dispatch::Queue::create("com.corvane.pcx"));
    if (!consent) return consent.error();
    parts->consent = std::move(*consent);
    if (auto served = parts->manager->serve(); !served.ok()) return served.error();
    parts->manager->reapChildren(std::move(childSignals));
    return std::unique_ptr<Daemon>(new Daemon(std::move(parts)));
}

Daemon::Daemon(std::unique_ptr<Parts> parts) : parts_(std::move(parts)) {}

Daemon::~Daemon() { parts_->manager->stop(); }

}  // namespace corvane::spawn
