// rpx: local IPC between the processes of one user.
//
// A listener serves a named endpoint, a Unix-domain stream socket at <runtime dir>/rpx/<name>
// (docs/platform-layout.md); clients connect to it by name. Messages are Values (every kind,
// file descriptors included, passed with SCM_RIGHTS), carried in length-prefixed frames
// (docs/rpx-wire.md). A message may expect a reply; the reply is bound to it by id and reaches the
// sender's completion exactly once, on the queue the sender chose: either the reply Value or an
// error (the connection is invalid).
//
// Each connection delivers its events one at a time, in order: received messages, then, once,
// "connection invalid" when the peer is gone or the connection was cancelled. A process that calls
// handleTermination() delivers "termination imminent" to every connection when it receives
// SIGTERM, then exits.
//
// Identity comes from the kernel when a connection is accepted or made: pid, uid, gid, a pidfd and
// the executable path, bundled with the process's start time and the executable's file identity
// as an audit token that the code-signing layer can check later.
//
// Limits: frames larger than the receiver's maximum, values nested deeper than kMaxDepth, frames
// that do not decode, descriptors that no frame claims, a second request with the id of one not yet
// answered, and a frame begun but not finished within Limits::partialFrameSeconds end that
// connection (with a log line) and no other. A peer that stops reading its replies, or whose
// messages' work is still under way, is not read from until it catches up, so the memory kept for
// it stays bounded; when the replies queued for all peers pass Limits::queuedReplyMiB, the peers
// holding the most are dropped. A connection is read from only once it is resumed.
//
// Thread-safety: every class here is safe to use from any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/dispatch/Dispatch.h"
#include "platform/value/Value.h"

namespace corvane::rpx {

inline constexpr size_t kMaxDepth = 128;
// What a listener accepts by default: requests are small.
inline constexpr size_t kDefaultListenerMaxFrame = 4u << 20;
// What a client accepts by default: a discovery reply over thousands of plug-ins must fit.
inline constexpr size_t kDefaultClientMaxFrame = 128u << 20;

// The identity of a process as the kernel told it when the connection was made. The pidfd keeps
// referring to that very process even after its pid is reused.
struct AuditToken {
    pid_t pid = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    std::shared_ptr<FileDescriptor> pidfd;
    // Identity of /proc/<pid>/exe at that moment, and the process's start time in clock ticks
    // since boot (/proc/<pid>/stat), which together tell a reused pid apart.
    dev_t exeDevice = 0;
    ino_t exeInode = 0;
    uint64_t startTime = 0;
};

struct PeerIdentity {
    pid_t pid = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    std::string executablePath;  // empty when it could not be read
    AuditToken auditToken;
};

// A process's start time in clock ticks since boot (/proc/<pid>/stat), 0 when it cannot be read.
uint64_t processStartTime(pid_t pid);

// Reads the identity of a live process (what a listener does for each peer).
PeerIdentity identityOfProcess(pid_t pid, uid_t uid, gid_t gid,
                               std::shared_ptr<FileDescriptor> pidfd);

enum class ErrorKind {
    ConnectionInvalid,
    TerminationImminent,
};
// "Connection invalid" / "Termination imminent".
const char* errorDescription(ErrorKind kind);

// Limits that keep one peer from starving the others (docs/rpx-wire.md). Read once, from
// CORVANE_RPX_LIMITS ("name=value,..." with the names below), else these defaults.
struct Limits {
    size_t connectionsPerProcess = 64;    // "connections-per-process": a listener refuses more
    size_t queuedReplyMiB = 64;           // "queued-reply-mib": replies queued for all peers together
    unsigned partialFrameSeconds = 10;    // "partial-frame-seconds": a frame begun and not finished
    unsigned violationsPerSecond = 8;     // "violations-per-second": more bar a process's new connections
    size_t readMiBPerSecond = 4;          // "read-mib-per-second": large frames one accepted connection may send
};
const Limits& limits();

// An event of a connection: a received message, or an error.
struct Event {
    std::optional<ErrorKind> error;
    Value message;             // the received value (any kind; requests are dictionaries)
    uint64_t messageId = 0;    // identifies the message for its reply
    bool wantsReply = false;   // the sender waits for a reply to this message
    // A message that expects no reply counts as its connection's work for as long as this (or a
    // copy) lives, so that a receiver that queues the work somewhere keeps the sender back-pressured
    // until the work is done. A request counts until its reply.
    std::shared_ptr<void> work;

    bool isError() const { return error.has_value(); }
    std::string description() const;
};

// What a sender gets back: the reply value, or the error that ended the wait.
struct Reply {
    std::optional<ErrorKind> error;
    Value value;

    bool ok() const { return !error.has_value(); }
    std::string description() const;
};

class Listener;

class Connection : public std::enable_shared_from_this<Connection> {
public:
    // Connects to a named endpoint. Events and replies of the connection are delivered on
    // `queue`. The connection starts suspended: set the event handler, then resume(). When the
    // endpoint cannot be reached the connection is invalid at once: resume() delivers
    // "connection invalid" and every send gets that error.
    static std::shared_ptr<Connection> connect(const std::string& name, dispatch::QueuePtr queue);

    // Adopts a connected stream socket (one end of a socketpair, or a descriptor received in a
    // message) as a connection, suspended like one that connect() made. The peer's identity is
    // what the kernel says of the socket: for a socketpair, the process that made the pair. A
    // descriptor that is not a stream socket gives a connection that is invalid at once.
    static std::shared_ptr<Connection> adopt(std::shared_ptr<FileDescriptor> socket, dispatch::QueuePtr queue,
                                             size_t maxFrameSize = kDefaultListenerMaxFrame);

    ~Connection();
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    void setEventHandler(std::function<void(const Event&)> handler);
    // Data the owner hangs on the connection; the finalizer gets it when the connection is
    // destroyed.
    void setContext(std::shared_ptr<void> context,
                    std::function<void(std::shared_ptr<void>)> finalizer = {});
    std::shared_ptr<void> context() const;
    // Starts delivering events. Call once.
    void resume();
    // Ends the connection: "connection invalid" is delivered, pending replies fail.
    void cancel();

    // The other side: the client for an accepted connection, the server for a connected one.
    const PeerIdentity& peer() const { return peer_; }
    pid_t pid() const { return peer_.pid; }
    bool isValid() const;

    // Sends without a reply.
    void send(const Value& message);
    // Sends and delivers the reply (or the error) once, on `queue`.
    void sendWithReply(const Value& message, dispatch::QueuePtr queue,
                       std::function<void(const Reply&)> completion);
    // Sends and waits for the reply. Must not be called on the connection's delivery queue.
    Reply sendWithReplySync(const Value& message);
    // Sends the reply to a received message. A quiet no-op when the connection is gone.
    void sendReply(uint64_t messageId, const Value& reply);

    // The largest frame this side accepts.
    void setMaxFrameSize(size_t bytes);
    // Bytes sent on this connection that the peer has not read yet.
    size_t queuedOutgoingBytes() const;

    std::string description() const;

    struct Impl;

private:
    friend class Listener;
    friend struct Impl;
    Connection(std::shared_ptr<Impl> impl, PeerIdentity peer);
    static std::shared_ptr<Connection> open(int fd, dispatch::QueuePtr queue, size_t maxFrameSize);

    std::shared_ptr<Impl> impl_;
    PeerIdentity peer_;
};

using ConnectionPtr = std::shared_ptr<Connection>;

class Listener {
public:
    // Creates the endpoint, suspended: clients may connect, but nothing is accepted until
    // resume(). Fails when another live process serves the name (a socket left by a dead one is
    // replaced) or the runtime directory cannot be made. Under socket activation the listening
    // socket the service manager passed for the endpoint (named by LISTEN_FDNAMES, or bound to the
    // endpoint's path) is used instead, and its file is left in place when the listener ends. New connections are handed to the
    // handler on `queue`; their own events are delivered on a delivery queue of the listener, one
    // connection's events in order.
    static Result<std::shared_ptr<Listener>> create(const std::string& name, dispatch::QueuePtr queue);
    ~Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    void setConnectionHandler(std::function<void(ConnectionPtr)> handler);
    void setMaxFrameSize(size_t bytes);
    // Runs the event handlers of connections accepted from now on without a delivery queue: on the
    // thread that made the event ready (the I/O thread for received messages, or a thread that
    // replied, resumed or cancelled), still one at a time and in order for each connection. This
    // saves a thread hand-over per message, so it suits handlers that only look at a message and
    // pass work on; a handler that blocks would hold up the I/O of every connection.
    void setInlineDelivery(bool enabled);
    void resume();
    void cancel();
    const std::string& path() const;

    struct Impl;

private:
    explicit Listener(std::shared_ptr<Impl> impl);
    static std::shared_ptr<Listener> adoptListening(int fd, const std::string& path, dispatch::QueuePtr queue,
                                                    bool inherited);
    std::shared_ptr<Impl> impl_;
};

// Serves `name` with one answer per request: `answer` gets the connection and the message, on the
// listener's delivery, and gives the reply; messages that expect none are passed over. The listener
// is resumed; it serves until cancelled.
Result<std::shared_ptr<Listener>> serveRequests(const std::string& name, dispatch::QueuePtr queue,
                                                std::function<Value(const Connection&, const Value&)> answer);

// Closes the listening sockets a service manager passed that no listener took (a socket for an
// endpoint this process does not serve, or one under another platform root): their clients are
// refused at once instead of waiting for ever. A daemon calls it once all its listeners exist.
void closeUnclaimedSockets();

// The UUIDs at the start of an array, up to its first element that is no UUID; `all` tells whether
// every element was one. An array that arrived encoded is read straight from its bytes, without
// making a value per element: a request that names thousands of plug-ins costs a copy of their
// UUIDs.
std::vector<UUID> leadingUuids(const Value& array, bool& all);
// The number of elements of an array, read from its encoding when it is still encoded (nothing is
// decoded); 0 for anything else.
size_t arrayCount(const Value& array);

// The socket path of an endpoint under the current platform root.
std::string endpointPath(const std::string& name);
// Why a connection to the endpoint `name` failed, for a message: what is wrong with the platform's
// places (layout::checkPlaces), or the socket path that nothing answers on, followed, when
// `socketUnit` is given, by how to start the daemon ("systemctl --user start UNIT").
std::string unreachableText(const std::string& name, const char* socketUnit = nullptr);

// Makes SIGTERM deliver "termination imminent" to every connection of this process and then end
// the process with status 0. Call from main before any thread is started (it blocks SIGTERM for
// the threads that follow).
void handleTermination();

// Units of outstanding work: while any is outstanding the process has work that must not be cut
// short.
void beginWork();
void endWork();
uint64_t outstandingWork();

}  // namespace corvane::rpx
