// A connection's state and its socket work: framing, writing with back-pressure, reading (by the
// I/O thread or by a synchronous sender), delivery of events. Not part of the public interface.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <deque>
#include <chrono>
#include <map>
#include <set>

#include "platform/rpx/Internal.h"
#include "platform/rpx/Wire.h"

namespace corvane::rpx {

using namespace internal;

struct Connection::Impl : std::enable_shared_from_this<Connection::Impl> {
    struct Outgoing {
        wire::FrameBytes frame;
        size_t piece = 0, offset = 0;  // the next byte to send: frame.pieces[piece][offset]
        size_t sent = 0;
        std::vector<std::shared_ptr<FileDescriptor>> fds;  // sent with the first byte
        bool reply = false;
    };
    // A completion without a queue is internal (a synchronous wait) and runs right where the
    // reply is read, saving a thread hop.
    struct Pending {
        dispatch::QueuePtr queue;
        std::function<void(const Reply&)> completion;

        void complete(Reply reply) {
            if (!queue) {
                completion(reply);
                return;
            }
            queue->async([c = std::move(completion), r = std::move(reply)] { c(r); });
        }
    };

    Impl(int socket, dispatch::QueuePtr deliveryQueue, size_t maxFrame)
        : fd(socket), delivery(std::move(deliveryQueue)), reader(maxFrame, kMaxDepth) {}
    // Last owner: nobody else can hold the mutex.
    ~Impl() NO_THREAD_SAFETY_ANALYSIS {
        if (pollFd >= 0) ::close(pollFd);
    }
    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    Mutex mutex;
    int fd GUARDED_BY(mutex);
    const dispatch::QueuePtr delivery;
    wire::FrameReader reader GUARDED_BY(mutex);
    std::function<void(const Event&)> handler GUARDED_BY(mutex);
    std::shared_ptr<void> context GUARDED_BY(mutex);
    std::function<void(std::shared_ptr<void>)> finalizer GUARDED_BY(mutex);
    bool resumed GUARDED_BY(mutex) = false;
    bool invalid GUARDED_BY(mutex) = false;
    bool readPaused GUARDED_BY(mutex) = false;
    bool wantWrite GUARDED_BY(mutex) = false;
    std::deque<Event> held GUARDED_BY(mutex);  // events before resume
    // Inline delivery (Listener::setInlineDelivery): events wait in `ready` for a thread to run
    // them; `running` says one does, so handlers never overlap. Set before start, then fixed.
    bool inlineDelivery = false;
    std::deque<Event> ready GUARDED_BY(mutex);
    bool running GUARDED_BY(mutex) = false;
    // A synchronous sender reads the socket itself while it waits, instead of being woken by the
    // I/O thread, which leaves the socket alone meanwhile. One such reader at a time; it polls a
    // duplicate of the socket, which stays open (and reports the hang-up) when the connection
    // closes under it.
    bool syncReader GUARDED_BY(mutex) = false;
    int pollFd GUARDED_BY(mutex) = -1;
    std::deque<Outgoing> out GUARDED_BY(mutex);
    size_t outBytes GUARDED_BY(mutex) = 0;
    size_t outReplies GUARDED_BY(mutex) = 0;  // replies among `out`
    std::map<uint64_t, Pending> pending GUARDED_BY(mutex);
    uint64_t nextId GUARDED_BY(mutex) = 1;
    // Events delivered but not handled, plus requests not yet answered.
    size_t unfinished GUARDED_BY(mutex) = 0;
    std::set<uint64_t> unanswered GUARDED_BY(mutex);
    // When the peer last completed a frame, or began one after a complete stream: a frame begun
    // and left unfinished longer than the limit ends the connection.
    std::chrono::steady_clock::time_point partialSince GUARDED_BY(mutex);
    bool partial GUARDED_BY(mutex) = false;
    pid_t peerPid = 0;  // set before start, then fixed
    bool accepted = false;  // taken from a listener's backlog; set before start, then fixed
    // The reading allowance of an accepted connection, in bytes: refilled at read-mib-per-second
    // up to a second's worth, spent by every large frame; below zero, reading pauses until it is
    // back. One peer that sends huge requests one after another so gets its share of the daemon,
    // and no more. Small frames are bounded by the count of unfinished work instead: charging them
    // too would only make a flood of them come in bursts.
    double readAllowance GUARDED_BY(mutex) = allowancePerSecond();
    std::chrono::steady_clock::time_point allowanceAt GUARDED_BY(mutex) = std::chrono::steady_clock::now();
    bool allowanceTimer GUARDED_BY(mutex) = false;  // a resumption is already arranged
    // An accepted connection keeps itself alive until its invalid event has been delivered.
    std::shared_ptr<Connection> self GUARDED_BY(mutex);

    // While paused, neither input nor a half-close is asked for: epoll is level-triggered and
    // would report them again and again. A peer that is gone entirely still shows as EPOLLHUP.
    // Nothing is read before the connection is resumed: the kernel's socket buffer, not ours, holds
    // what a connection not yet set up has sent.
    uint32_t interest() const REQUIRES(mutex) {
        return (readPaused || syncReader || !resumed ? 0u : static_cast<uint32_t>(EPOLLIN | EPOLLRDHUP)) |
               (wantWrite ? static_cast<uint32_t>(EPOLLOUT) : 0u);
    }

    void updateInterest() REQUIRES(mutex) {
        if (fd >= 0) IoLoop::shared().modify(fd, interest());
    }

    static double allowancePerSecond() { return static_cast<double>(limits().readMiBPerSecond) * (1 << 20); }

    // Adds what the time since the last refill earned, up to a second's worth.
    void refillAllowance() REQUIRES(mutex) {
        auto now = std::chrono::steady_clock::now();
        double seconds = std::chrono::duration<double>(now - allowanceAt).count();
        readAllowance = std::min(allowancePerSecond(), readAllowance + seconds * allowancePerSecond());
        allowanceAt = now;
    }

    // A large frame of an accepted connection was read: it is paid from the allowance.
    void chargeAllowance(size_t bytes) REQUIRES(mutex) {
        if (!accepted || bytes < kLargeFrameBytes) return;
        refillAllowance();
        readAllowance -= static_cast<double>(bytes);
    }

    // Whether the connection has read past its allowance. When it has, resumption is arranged for
    // when the allowance is back. Only an overspent allowance needs the clock: every frame passes
    // here.
    bool overAllowance() REQUIRES(mutex) {
        if (readAllowance >= 0) return false;
        refillAllowance();
        if (readAllowance >= 0) return false;
        if (!allowanceTimer) {
            allowanceTimer = true;
            auto wait = std::chrono::duration<double>(-readAllowance / allowancePerSecond());
            std::weak_ptr<Impl> weak = shared_from_this();
            internal::afterDelay(std::chrono::duration_cast<std::chrono::nanoseconds>(wait), [weak] {
                relieve(weak, Relief::AllowanceBack);
            });
        }
        return true;
    }

    // Back-pressure: stop reading from a peer that does not keep up, resume when it has.
    void checkPressure() REQUIRES(mutex) {
        bool overspent = overAllowance();
        bool over = outBytes > kHighWaterBytes || outReplies > kMaxQueuedReplies || unfinished > kMaxUnfinished ||
                    overspent;
        bool under = outBytes <= kHighWaterBytes / 2 && outReplies <= kMaxQueuedReplies / 2 &&
                     unfinished <= kMaxUnfinished / 2 && !overspent;
        if (!readPaused && over) {
            readPaused = true;
            updateInterest();
        } else if (readPaused && under) {
            readPaused = false;
            updateInterest();
            // Frames already read wait in the buffer; epoll will not mention them again.
            drainFrames();
        }
    }

    // Hands on the complete frames already read, as long as the peer keeps up. One read can hold
    // thousands of small requests, so the pause is checked frame by frame.
    void drainFrames() REQUIRES(mutex) {
        wire::Frame frame;
        std::string error;
        while (!readPaused && !invalid) {
            auto status = reader.next(frame, error);
            if (status == wire::FrameReader::Status::NeedMore) return;
            if (status == wire::FrameReader::Status::Error) {
                closeForViolation(error);
                return;
            }
            chargeAllowance(frame.bytes);
            handleFrame(std::move(frame));
            partial = false;
            checkPressure();
        }
    }

    void postEvent(Event ev) REQUIRES(mutex) {
        if (!resumed) {
            held.push_back(std::move(ev));
            return;
        }
        ++unfinished;
        if (inlineDelivery) {
            ready.push_back(std::move(ev));
            return;
        }
        delivery->async([impl = shared_from_this(), ev = std::move(ev)] { impl->runHandler(ev); });
    }

    // Inline delivery: runs the ready events on this thread unless another thread already does (it
    // will see them). Called without the mutex, after every operation that may have made an event
    // ready.
    void runReady() EXCLUDES(mutex) {
        if (!inlineDelivery) return;
        auto keep = shared_from_this();  // the last event may release the connection's own hold
        mutex.lock();
        if (!running) {
            running = true;
            while (!ready.empty()) {
                Event ev = std::move(ready.front());
                ready.pop_front();
                mutex.unlock();
                runHandler(ev);
                ev = Event();  // its work token takes the mutex when it goes: before relocking
                mutex.lock();
            }
            running = false;
        }
        mutex.unlock();
    }

    void runHandler(const Event& ev) EXCLUDES(mutex) {
        std::function<void(const Event&)> h;
        {
            MutexLock lock(mutex);
            h = handler;
        }
        if (h) h(ev);
        std::shared_ptr<Connection> last;
        std::deque<Event> unheard;  // work tokens take the mutex when they go: outside it
        {
            MutexLock lock(mutex);
            if (unfinished) --unfinished;
            if (ev.error == ErrorKind::ConnectionInvalid) {
                // The last event: let go of the handler (and whatever it holds) and of ourselves.
                handler = nullptr;
                unheard.swap(held);
                last = std::move(self);
            } else if (!invalid) {
                checkPressure();
            }
        }
        // `last` may be the final owner of the connection; it goes here, outside the lock.
    }

    // Writes what the socket takes now.
    void flush() REQUIRES(mutex) {
        while (!out.empty() && fd >= 0) {
            Outgoing& o = out.front();
            // As many pieces as one call takes, from where the last one stopped.
            constexpr size_t kMaxPieces = 64;
            struct iovec iov[kMaxPieces];
            size_t count = 0;
            for (size_t i = o.piece; i < o.frame.pieces.size() && count < kMaxPieces; ++i) {
                std::string_view piece = o.frame.pieces[i];
                size_t skip = i == o.piece ? o.offset : 0;
                iov[count++] = {const_cast<char*>(piece.data()) + skip, piece.size() - skip};
            }
            struct msghdr msg {};
            msg.msg_iov = iov;
            msg.msg_iovlen = count;
            std::vector<char> control;
            if (o.sent == 0 && !o.fds.empty()) {
                control.resize(CMSG_SPACE(sizeof(int) * o.fds.size()));
                msg.msg_control = control.data();
                msg.msg_controllen = control.size();
                struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
                c->cmsg_level = SOL_SOCKET;
                c->cmsg_type = SCM_RIGHTS;
                c->cmsg_len = CMSG_LEN(sizeof(int) * o.fds.size());
                auto* slots = reinterpret_cast<int*>(CMSG_DATA(c));
                for (size_t i = 0; i < o.fds.size(); ++i) slots[i] = o.fds[i]->get();
            }
            ssize_t n = sendmsg(fd, &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
            if (n < 0) {
                if (errno == EINTR) continue;
                if (errno == EAGAIN || errno == EWOULDBLOCK) break;
                closeLocked();
                return;
            }
            o.sent += static_cast<size_t>(n);
            outBytes -= static_cast<size_t>(n);
            gQueuedReplyBytes -= static_cast<size_t>(n);
            for (size_t left = static_cast<size_t>(n); left > 0;) {
                size_t rest = o.frame.pieces[o.piece].size() - o.offset;
                if (left < rest) {
                    o.offset += left;
                    break;
                }
                left -= rest;
                ++o.piece;
                o.offset = 0;
            }
            if (o.sent == o.frame.size) {
                if (o.reply) --outReplies;
                out.pop_front();
            } else {
                o.fds.clear();  // they went with the first bytes
            }
        }
        bool want = !out.empty() && fd >= 0;
        if (want != wantWrite) {
            wantWrite = want;
            updateInterest();
        }
        if (fd >= 0) checkPressure();
    }

    bool sendFrame(wire::FrameKind kind, uint64_t id, const Value& body) REQUIRES(mutex) {
        std::vector<int> raw;
        auto bytes = wire::encodeFramePieces(wire::Frame{kind, id, body}, raw, kMaxDepth);
        if (!bytes) {
            log::error(rpxLog(), "rpx: message to pid %d nested too deeply; not sent", peerPid);
            return false;
        }
        Outgoing o;
        o.frame = std::move(*bytes);
        o.reply = kind == wire::FrameKind::Reply;
        for (int f : raw) {
            int copy = fcntl(f, F_DUPFD_CLOEXEC, 0);
            if (copy < 0) {
                log::error(rpxLog(), "rpx: cannot pass a descriptor to pid %d: %{public}s", peerPid,
                           std::strerror(errno));
                return false;
            }
            o.fds.push_back(std::make_shared<FileDescriptor>(copy));
        }
        if (invalid) return false;
        outBytes += o.frame.size;
        size_t queued = gQueuedReplyBytes += o.frame.size;
        if (o.reply) ++outReplies;
        out.push_back(std::move(o));
        flush();
        // Past the bound for all peers together, a peer that holds more than its share goes.
        if (!invalid && queued > (limits().queuedReplyMiB << 20) && outBytes >= kHighWaterBytes / 2) {
            log::error(rpxLog(), "rpx: closing connection to pid %d: %llu bytes of replies it does not read",
                       peerPid, static_cast<unsigned long long>(outBytes));
            closeLocked();
            return false;
        }
        return true;
    }

    // The peer broke the protocol (`why` says how): the connection ends with a log line, and the
    // peer process of an accepted one is counted against its allowance of violations.
    void closeForViolation(const std::string& why) REQUIRES(mutex) {
        log::error(rpxLog(), "rpx: closing connection to pid %d: %{public}s", peerPid, why);
        if (accepted && !invalid) internal::recordViolation(peerPid);
        closeLocked(Closing::ByReaper);
    }

    // Who closes the socket: this thread, or the reaper (a peer that broke the protocol may have
    // left descriptors in flight whose release takes long).
    enum class Closing { Here, ByReaper };

    // The connection ends: no more I/O, pending replies fail, the invalid event is delivered.
    void closeLocked(Closing closing = Closing::Here) REQUIRES(mutex) {
        if (invalid) return;
        invalid = true;
        if (fd >= 0) {
            IoLoop::shared().remove(fd);
            ::shutdown(fd, SHUT_RDWR);  // wakes a synchronous reader polling its duplicate
            if (closing == Closing::ByReaper) {
                internal::closeSoon(fd);
            } else {
                ::close(fd);
            }
            fd = -1;
        }
        out.clear();
        outReplies = 0;
        gQueuedReplyBytes -= outBytes;
        outBytes = 0;
        reader.clear();  // buffered bytes and descriptors go now, not with the last reference
        ++gClosedSinceTrim;
        for (auto& [id, p] : pending) p.complete(Reply{ErrorKind::ConnectionInvalid, Value()});
        pending.clear();
        {
            MutexLock lock(gLiveMutex);
            live().erase(shared_from_this());
        }
        Event ev;
        ev.error = ErrorKind::ConnectionInvalid;
        postEvent(std::move(ev));
    }

    // Ends the connection when the peer began a frame and sent nothing more for too long.
    void endIfStuck(std::chrono::steady_clock::time_point now) EXCLUDES(mutex) {
        {
            MutexLock lock(mutex);
            if (invalid || !partial || now - partialSince < std::chrono::seconds(limits().partialFrameSeconds)) return;
            closeForViolation(
                log::formatText("a frame begun %u s ago was not finished", limits().partialFrameSeconds));
        }
        runReady();
    }

    enum class ReadStatus { More, Drained, Closed };

    // One read from the socket and the frames it completes.
    ReadStatus readOnce() REQUIRES(mutex) {
        char buf[65536];
        struct iovec iov {buf, sizeof buf};
        alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 64)];
        struct msghdr msg {};
        msg.msg_iov = &iov;
        msg.msg_iovlen = 1;
        msg.msg_control = control;
        msg.msg_controllen = sizeof control;
        ssize_t n = recvmsg(fd, &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        if (n < 0) {
            if (errno == EINTR) return ReadStatus::More;
            if (errno == EAGAIN || errno == EWOULDBLOCK) return ReadStatus::Drained;
            closeLocked();
            return ReadStatus::Closed;
        }
        for (struct cmsghdr* c = CMSG_FIRSTHDR(&msg); c; c = CMSG_NXTHDR(&msg, c)) {
            if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
            size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            auto* slots = reinterpret_cast<int*>(CMSG_DATA(c));
            for (size_t i = 0; i < count; ++i) reader.appendFd(std::make_shared<FileDescriptor>(slots[i]));
        }
        if (msg.msg_flags & MSG_CTRUNC) {
            closeForViolation("too many descriptors");
            return ReadStatus::Closed;
        }
        if (n == 0) {
            closeLocked();
            return ReadStatus::Closed;
        }
        reader.append(buf, static_cast<size_t>(n));
        drainFrames();
        if (invalid) return ReadStatus::Closed;
        // Descriptors travel with the first bytes of the frame that names them: any that the frame
        // being read cannot claim were sent with none, and would stay open for nothing.
        if (reader.holdsUnclaimedDescriptors()) {
            closeForViolation("descriptors that no frame names");
            return ReadStatus::Closed;
        }
        bool nowPartial = reader.buffered() > 0;
        if (nowPartial && !partial) partialSince = std::chrono::steady_clock::now();
        partial = nowPartial;
        // A short read took all there was: the socket's interest is level-triggered, so whatever
        // comes next is reported again, and asking now would only hear EAGAIN.
        return static_cast<size_t>(n) < sizeof buf ? ReadStatus::Drained : ReadStatus::More;
    }

    // One read per wake-up: the interest is level-triggered, so what is left is reported again,
    // after the other connections that are ready have had their turn. A peer sending a frame of
    // megabytes holds the I/O thread for one read at a time, not for the whole frame.
    void onReadable() EXCLUDES(mutex) {
        MutexLock lock(mutex);
        if (fd < 0 || readPaused || syncReader) return;
        (void)readOnce();
    }

    // Becomes the synchronous reader, if the connection allows one now.
    bool claimSyncReader() REQUIRES(mutex) {
        if (syncReader || fd < 0 || invalid || readPaused) return false;
        if (pollFd < 0) pollFd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
        if (pollFd < 0) return false;
        syncReader = true;
        updateInterest();
        return true;
    }

    // The synchronous reader's loop: reads until `done` says the awaited reply came, the
    // connection ends, or reading must pause (then the I/O thread takes over again).
    void readAsSyncReader(const std::function<bool()>& done) EXCLUDES(mutex) {
        int watched;
        {
            // Only this reader closes or replaces the duplicate, and not before it ends.
            MutexLock lock(mutex);
            watched = pollFd;
        }
        for (;;) {
            if (done()) break;
            struct pollfd p {watched, POLLIN, 0};
            if (::poll(&p, 1, -1) < 0 && errno != EINTR) break;
            bool stop;
            {
                MutexLock lock(mutex);
                stop = fd < 0 || readPaused;
                // Until the socket is empty, or the awaited reply has come (what follows it is
                // the I/O thread's again).
                while (!stop && !done()) {
                    ReadStatus status = readOnce();
                    if (status != ReadStatus::More) {
                        stop = status == ReadStatus::Closed;
                        break;
                    }
                    stop = fd < 0 || readPaused;
                }
            }
            runReady();
            if (stop) break;
        }
        MutexLock lock(mutex);
        syncReader = false;
        updateInterest();
    }

    // Counts one unit of the connection's work until the last copy of the token goes.
    std::shared_ptr<void> workToken() REQUIRES(mutex) {
        ++unfinished;
        std::weak_ptr<Impl> weak = shared_from_this();
        return std::shared_ptr<void>(nullptr, [weak](void*) {
            relieve(weak, Relief::WorkDone);
        });
    }

    // What may have held reading back: a unit of work, or the wait for the allowance.
    enum class Relief { WorkDone, AllowanceBack };

    // It ended: looks at the back-pressure again, and runs the events that resuming made ready.
    static void relieve(const std::weak_ptr<Impl>& weak, Relief relief) {
        auto impl = weak.lock();
        if (!impl) return;
        {
            MutexLock lock(impl->mutex);
            if (relief == Relief::WorkDone && impl->unfinished) --impl->unfinished;
            if (relief == Relief::AllowanceBack) impl->allowanceTimer = false;
            if (!impl->invalid) impl->checkPressure();
        }
        impl->runReady();
    }

    void handleFrame(wire::Frame frame) REQUIRES(mutex) {
        if (frame.kind == wire::FrameKind::Reply) {
            auto it = pending.find(frame.id);
            if (it == pending.end()) return;  // a reply nobody waits for any more
            it->second.complete(Reply{std::nullopt, std::move(frame.body)});
            pending.erase(it);
            return;
        }
        Event ev;
        ev.message = std::move(frame.body);
        ev.messageId = frame.id;
        ev.wantsReply = frame.kind == wire::FrameKind::Request;
        if (ev.wantsReply) {
            // Replies are bound to requests by id: a second request under the id of one not yet
            // answered could never get its own.
            if (!unanswered.insert(frame.id).second) {
                closeForViolation(log::formatText("request id %llu is already waiting for its reply",
                                                  static_cast<unsigned long long>(frame.id)));
                return;
            }
            ++unfinished;
        } else {
            ev.work = workToken();
        }
        postEvent(std::move(ev));
    }

    void onEvents(uint32_t events) EXCLUDES(mutex) {
        if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR)) onReadable();
        if (events & EPOLLOUT) {
            MutexLock lock(mutex);
            flush();
        }
        if (events & (EPOLLHUP | EPOLLERR)) {
            MutexLock lock(mutex);
            // Read what is left first (above), then end. A synchronous reader reads what is left
            // itself and ends the connection when it reaches the end.
            if (fd >= 0 && !(events & EPOLLIN) && !syncReader) closeLocked();
        }
        runReady();
    }

    void start() EXCLUDES(mutex) {
        startSweeper();
        MutexLock lock(mutex);
        if (fd < 0) return;
        {
            MutexLock liveLock(gLiveMutex);
            live().insert(shared_from_this());
        }
        std::weak_ptr<Impl> weak = shared_from_this();
        IoLoop::shared().add(fd, interest(), [weak](uint32_t events) {
            if (auto impl = weak.lock()) impl->onEvents(events);
        });
    }
};

}  // namespace corvane::rpx
