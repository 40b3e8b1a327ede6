#include "Annexa/AXPlugInRuntime.h"

#include <cerrno>
#include <set>

#include "platform/spawn/Spawn.h"

namespace annexa {

namespace {

using corvane::MutexLock;
using corvane::rpx::ConnectionPtr;

// The process's one runtime.
struct Runtime {
    corvane::Mutex mutex;
    corvane::ConditionVariable ended;
    bool running GUARDED_BY(mutex) = false;
    bool invalid GUARDED_BY(mutex) = false;
    std::shared_ptr<corvane::spawn::InstanceControl> control GUARDED_BY(mutex);
    std::set<ConnectionPtr> hosts GUARDED_BY(mutex);
};

Runtime& runtime() {
    static auto* r = new Runtime();
    return *r;
}

std::shared_ptr<corvane::spawn::InstanceControl> currentControl() {
    MutexLock lock(runtime().mutex);
    return runtime().control;
}

void serveHost(const std::shared_ptr<corvane::FileDescriptor>& socket, const corvane::dispatch::QueuePtr& queue,
               const AXPlugInRuntime::Handler& handler) {
    Runtime& r = runtime();
    ConnectionPtr host = corvane::rpx::Connection::adopt(socket, queue);
    std::weak_ptr<corvane::rpx::Connection> weak = host;
    host->setEventHandler([weak, handler](const corvane::rpx::Event& ev) {
        auto connection = weak.lock();
        if (!connection) return;
        if (!ev.isError()) return handler(connection, ev);
        if (*ev.error != corvane::rpx::ErrorKind::ConnectionInvalid) return;
        Runtime& state = runtime();
        std::shared_ptr<corvane::spawn::InstanceControl> control;
        {
            MutexLock lock(state.mutex);
            if (state.hosts.erase(connection) == 0 || !state.hosts.empty()) return;
            control = state.control;
        }
        if (control) control->setIdle(true);
    });
    bool first;
    {
        MutexLock lock(r.mutex);
        first = r.hosts.empty();
        r.hosts.insert(host);
    }
    if (first) {
        if (auto control = currentControl()) control->setIdle(false);
    }
    host->resume();
}

}  // namespace

int AXPlugInRuntime::run(Handler handler) {
    Runtime& r = runtime();
    auto queue = corvane::dispatch::Queue::create("com.corvane.annexa.plugin");
    auto control = corvane::spawn::InstanceControl::fromEnvironment(queue);
    if (!control) return EINVAL;
    {
        MutexLock lock(r.mutex);
        if (r.running) return EALREADY;
        r.running = true;
        r.invalid = false;
        r.control = control;
    }
    control->setConnectionHandler([queue, handler](std::shared_ptr<corvane::FileDescriptor> socket) {
        serveHost(socket, queue, handler);
    });
    control->setInvalidationHandler([] {
        Runtime& state = runtime();
        MutexLock lock(state.mutex);
        state.invalid = true;
        state.ended.notify_all();
    });
    control->resume();
    std::set<ConnectionPtr> hosts;
    {
        MutexLock lock(r.mutex);
        while (!r.invalid) r.ended.wait(lock);
        r.running = false;
        r.control = nullptr;
        hosts.swap(r.hosts);
    }
    for (const ConnectionPtr& host : hosts) host->cancel();
    return 0;
}

uint64_t AXPlugInRuntime::beginBusy(const std::string& reason) {
    auto control = currentControl();
    return control ? control->beginBusy(reason) : 0;
}

void AXPlugInRuntime::endBusy(uint64_t assertion) {
    if (auto control = currentControl()) control->endBusy(assertion);
}

Result<ConnectionPtr> connectToPlugIn(const std::string& bundleIdentifier, corvane::dispatch::QueuePtr queue,
                                      std::function<void(const corvane::rpx::Event&)> events) {
    auto socket = corvane::spawn::connectToService(bundleIdentifier);
    if (!socket) return socket.error();
    ConnectionPtr connection = corvane::rpx::Connection::adopt(*socket, std::move(queue), corvane::rpx::kDefaultClientMaxFrame);
    connection->setEventHandler(std::move(events));
    connection->resume();
    return connection;
}

}  // namespace annexa
