// Install and uninstall events across processes: a journal table written in each registration's
// transaction, and a wake-up file whose change inotify reports to every process that watches.
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>

#include "platform/plist/Plist.h"
#include "platform/vantry/Store.h"

namespace corvane::vantry {

Subscription Store::subscribe(Observer& observer) {
    MutexLock lock(observersMutex_);
    if (!watching_) {
        startWatcher();
        watching_ = true;
    }
    uint64_t id = nextObserver_++;
    observers_.emplace(id, &observer);
    return Subscription(weak_from_this(), id);
}

void Store::unsubscribe(uint64_t id) {
    {
        MutexLock lock(observersMutex_);
        observers_.erase(id);
    }
    // Waits out a round of delivery that may still be calling the observer, unless this is that
    // round's own thread (an observer ending its own subscription).
    if (watcherId_.load() != std::this_thread::get_id()) {
        MutexLock wait(deliveryMutex_);
    }
}

void Store::startWatcher() {
    {
        MutexLock lock(mutex_);
        Statement q(db_, "SELECT ifnull(max(seq), 0) FROM journal");
        lastSeq_ = q && q.step() == SQLITE_ROW ? q.integer(0) : 0;
    }
    int in = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    inotify_add_watch(in, directory().c_str(), IN_CLOSE_WRITE | IN_MOVED_TO);
    stopFd_ = eventfd(0, EFD_CLOEXEC);
    std::string wakeName = this->wakeName();
    std::weak_ptr<Store> weak = weak_from_this();
    int stop = stopFd_;
    watcher_ = std::thread([weak, in, stop, wakeName] {
        pthread_setname_np(pthread_self(), "vantry.events");
        alignas(struct inotify_event) char buf[4096];
        for (;;) {
            struct pollfd fds[2] = {{in, POLLIN, 0}, {stop, POLLIN, 0}};
            if (poll(fds, 2, -1) < 0 && errno != EINTR) break;
            if (fds[1].revents) break;
            bool woke = false;
            ssize_t n;
            while ((n = ::read(in, buf, sizeof buf)) > 0) {
                for (char* p = buf; p < buf + n;) {
                    auto* ev = reinterpret_cast<struct inotify_event*>(p);
                    if (ev->len && wakeName == ev->name) woke = true;
                    p += sizeof(struct inotify_event) + ev->len;
                }
            }
            if (!woke) continue;
            auto store = weak.lock();
            if (!store) break;
            store->deliverNewEvents();
        }
        ::close(in);
    });
    watcherId_.store(watcher_.get_id());
}

std::vector<JournalEntry> Store::newJournalEntries() {
    std::vector<JournalEntry> entries;
    std::vector<Array> named;  // per install entry, what it names: UUIDs (records, before this release)
    std::unordered_map<std::string, PlugInRecordPtr> removed;
    // One read transaction: an installed plug-in whose row is gone was removed by a later entry
    // that this read sees too, and which keeps its record.
    if (!exec("BEGIN").ok()) return entries;
    Statement q(db_, "SELECT seq, kind, records FROM journal WHERE seq > ? ORDER BY seq");
    q.bind(1, lastSeq_);
    while (q && q.step() == SQLITE_ROW) {
        lastSeq_ = q.integer(0);
        JournalEntry entry{static_cast<JournalKind>(q.integer(1)), {}};
        auto list = decodeRecord(q.blob(2));
        Array items = list && list->isArray() ? *list->asArray() : Array{};
        if (entry.kind == JournalKind::Uninstall) {
            for (const Value& v : items) {
                if (auto r = PlugInRecord::read(v, nullptr, {})) {
                    nameReadersContainer(*r);
                    removed.emplace(r->uuid().string(), r);
                    entry.records.push_back(std::move(r));
                }
            }
            items.clear();
        }
        named.push_back(std::move(items));
        entries.push_back(std::move(entry));
    }
    q.reset();
    for (size_t i = 0; i < entries.size(); ++i) {
        for (const Value& v : named[i]) {
            PlugInRecordPtr r;
            if (const std::string* uuid = v.asString()) {
                r = recordByUUIDText(*uuid);
                if (auto gone = removed.find(*uuid); !r && gone != removed.end()) r = gone->second;
            } else {
                r = PlugInRecord::deserialize(v, nullptr);  // an entry of an earlier release
            }
            if (r) entries[i].records.push_back(std::move(r));
        }
    }
    (void)exec("COMMIT");
    return entries;
}

void Store::deliverNewEvents() {
    std::vector<JournalEntry> entries;
    {
        MutexLock lock(mutex_);
        checkFreshness();
        entries = newJournalEntries();
    }
    MutexLock round(deliveryMutex_);
    for (const auto& entry : entries) {
        std::vector<uint64_t> ids;
        {
            MutexLock lock(observersMutex_);
            for (const auto& [id, observer] : observers_) ids.push_back(id);
        }
        for (uint64_t id : ids) {
            Observer* observer;
            {
                // One that unsubscribed meanwhile is not called any more.
                MutexLock lock(observersMutex_);
                auto it = observers_.find(id);
                if (it == observers_.end()) continue;
                observer = it->second;
            }
            if (entry.kind == JournalKind::Install) {
                observer->pluginsDidInstall(entry.records);
            } else {
                observer->pluginsWillUninstall(entry.records);
            }
        }
    }
}

// ---- Subscription

Subscription::Subscription(std::weak_ptr<Store> store, uint64_t id) : store_(std::move(store)), id_(id) {}

Subscription::Subscription(Subscription&& other) noexcept
    : store_(std::move(other.store_)), id_(std::exchange(other.id_, 0)), next_(std::move(other.next_)) {}

Subscription& Subscription::operator=(Subscription&& other) noexcept {
    if (this != &other) {
        cancel();
        store_ = std::move(other.store_);
        id_ = std::exchange(other.id_, 0);
        next_ = std::move(other.next_);
    }
    return *this;
}

Subscription::~Subscription() { cancel(); }

void Subscription::join(Subscription&& more) {
    if (next_) return next_->join(std::move(more));
    next_ = std::make_unique<Subscription>(std::move(more));
}

void Subscription::cancel() {
    if (next_) next_->cancel();
    next_.reset();
    if (id_ == 0) return;
    if (auto store = store_.lock()) store->unsubscribe(id_);
    id_ = 0;
    store_.reset();
}

}  // namespace corvane::vantry
