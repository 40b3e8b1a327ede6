// Name-only notifications that any process of the user can post and observe.
//
// Each name has a counter file in <runtime dir>/notify/. Posting bumps the counter under an
// exclusive lock; observers watch the directory with inotify and are called once per change they
// see (posts that land while a handler runs may be coalesced into one call, as with any name-only
// notification: the handler re-reads what it cares about). The counter also tells how many posts a
// name has had, which is what tests and tools read.
//
// Thread-safety: post and count may be called from any thread; an Observer is thread-safe.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "platform/dispatch/Dispatch.h"
#include "platform/value/Value.h"

namespace corvane::notify {

// Posts the notification `name` (any text without '/' that is not "." or ".."; others are refused).
Status post(const std::string& name);

// How many times `name` has been posted under the current platform root (0 when never).
uint64_t count(const std::string& name);

// Calls a handler on a queue after each observed post of one name, until destroyed.
class Observer {
public:
    static Result<std::unique_ptr<Observer>> observe(const std::string& name,
                                                     dispatch::QueuePtr queue,
                                                     std::function<void()> handler);
    ~Observer();
    Observer(const Observer&) = delete;
    Observer& operator=(const Observer&) = delete;

private:
    Observer(std::string name, int inotifyFd, int stopFd, dispatch::QueuePtr queue,
             std::function<void()> handler);
    void watch();

    const std::string name_;
    const int inotifyFd_;
    const int stopFd_;
    dispatch::QueuePtr queue_;
    std::function<void()> handler_;
    std::thread thread_;
};

// Tells a cache whether files of one directory changed since it last asked, without a thread of
// its own: each question is one non-blocking read of an inotify descriptor, and a change that was
// complete when the question was asked is always seen. A directory that does not exist yet is
// waited for through its nearest existing ancestor; while nothing can be watched (inotify is out of
// instances or watches) every answer is yes.
//
// Thread-safety: none; the owner asks from one thread at a time.
class ChangeWatch {
public:
    // Only changes to the file `name` count; with an empty name, changes to any file do.
    explicit ChangeWatch(std::string directory, std::string name = {});
    ~ChangeWatch();
    ChangeWatch(const ChangeWatch&) = delete;
    ChangeWatch& operator=(const ChangeWatch&) = delete;

    const std::string& directory() const { return directory_; }
    // True on the first question, and whenever a counted file was written, created, removed or
    // renamed since the last one.
    bool changed();

private:
    void watch();

    const std::string directory_;
    const std::string name_;
    int fd_ = -1;
    bool watchingAncestor_ = false;
};

}  // namespace corvane::notify
