// axbench rpx: round trips through rpx against a plain Unix-socket ping-pong of the same bytes,
// measured in the same run, on a private platform root.
//
// Every process is forked before the measuring process starts any thread, so that no child
// inherits a half-copied runtime.

#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "bench/Bench.h"
#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"

using namespace corvane;

namespace {

// The echo server's listener runs handlers inline (as axd's does); the second one delivers them on
// a queue, for comparison.
constexpr const char* kEndpoint = "com.corvane.bench.echo";
constexpr const char* kQueuedEndpoint = "com.corvane.bench.echo.queued";

Value requestBody() {
    return dict({{"request", "match"}, {"version", uint64_t{3}}, {"flags", uint64_t{0}},
                 {"rules", dict({{"KSExtensionPointIdentifier", "com.corvane.share"}})}});
}
Value replyBody() { return dict({{"matches", Value(Array{})}}); }

[[noreturn]] void serveRpx(const char* endpoint, bool inlineDelivery) {
    auto queue = dispatch::Queue::create("bench.listener");
    auto listener = rpx::Listener::create(endpoint, queue);
    if (!listener) _exit(1);
    (*listener)->setInlineDelivery(inlineDelivery);
    static const Value small = replyBody();
    static const Value big = dict({{"data", Value::data(std::string(256 * 1024, 'x').data(), 256 * 1024)}});
    (*listener)->setConnectionHandler([](rpx::ConnectionPtr c) {
        std::weak_ptr<rpx::Connection> weak = c;
        c->setEventHandler([weak](const rpx::Event& ev) {
            auto conn = weak.lock();
            if (!conn || ev.isError() || !ev.wantsReply) return;
            conn->sendReply(ev.messageId, ev.message.has("big") ? big : small);
        });
        c->resume();
    });
    (*listener)->resume();
    for (;;) pause();
}

bool readAll(int fd, char* buf, size_t n) {
    size_t got = 0;
    while (got < n) {
        ssize_t r = read(fd, buf + got, n - got);
        if (r <= 0) return false;
        got += static_cast<size_t>(r);
    }
    return true;
}

bool writeAll(int fd, const char* buf, size_t n) {
    size_t done = 0;
    while (done < n) {
        ssize_t w = write(fd, buf + done, n - done);
        if (w <= 0) return false;
        done += static_cast<size_t>(w);
    }
    return true;
}

// The baseline: read one request's bytes, write one reply's bytes, nothing else.
[[noreturn]] void servePlain(const std::string& path, size_t requestSize, const std::string& reply) {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || listen(fd, 8) != 0) _exit(1);
    for (;;) {
        int c = accept(fd, nullptr, nullptr);
        if (c < 0) continue;
        std::vector<char> buf(requestSize);
        while (readAll(c, buf.data(), requestSize) && writeAll(c, reply.data(), reply.size())) {
        }
        close(c);
    }
}

int connectPlain(const std::string& path) {
    for (int i = 0; i < 500; ++i) {
        int fd = socket(AF_UNIX, SOCK_STREAM, 0);
        struct sockaddr_un addr {};
        addr.sun_family = AF_UNIX;
        std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
        if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) return fd;
        close(fd);
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return -1;
}

std::shared_ptr<rpx::Connection> connectRpx(const dispatch::QueuePtr& queue, const char* endpoint = kEndpoint) {
    for (int i = 0; i < 500; ++i) {
        auto c = rpx::Connection::connect(endpoint, queue);
        c->setEventHandler([](const rpx::Event&) {});
        c->resume();
        if (c->isValid() && c->sendWithReplySync(requestBody()).ok()) return c;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return nullptr;
}

// A client process of the eight: waits for the start byte, runs `count` requests, reports the
// microseconds they took.
[[noreturn]] void clientProcess(int startFd, int resultFd, int count) {
    char go;
    if (read(startFd, &go, 1) != 1) _exit(1);
    auto queue = dispatch::Queue::create("bench.client");
    auto c = connectRpx(queue);
    if (!c) _exit(1);
    Value body = requestBody();
    auto start = std::chrono::steady_clock::now();
    for (int i = 0; i < count; ++i)
        if (!c->sendWithReplySync(body).ok()) _exit(1);
    double us = axbench::microsSince(start);
    (void)!write(resultFd, &us, sizeof us);
    _exit(0);
}

int runRpx(int argc, char** argv) {
    int requests = 20000;
    int perClient = 5000;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (std::strcmp(argv[i], "--requests") == 0) requests = std::atoi(argv[i + 1]);
        if (std::strcmp(argv[i], "--client-requests") == 0) perClient = std::atoi(argv[i + 1]);
    }
    char tmpl[] = "/tmp/axbench-rpx.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    std::string plainPath = root + "/plain.sock";

    std::vector<int> fds;
    std::string request = *rpx::wire::encodeFrame({rpx::wire::FrameKind::Request, 1, requestBody()}, fds, 16);
    std::string reply = *rpx::wire::encodeFrame({rpx::wire::FrameKind::Reply, 1, replyBody()}, fds, 16);

    std::vector<pid_t> children;
    pid_t pid = fork();
    if (pid == 0) serveRpx(kEndpoint, true);
    children.push_back(pid);
    pid = fork();
    if (pid == 0) serveRpx(kQueuedEndpoint, false);
    children.push_back(pid);
    pid = fork();
    if (pid == 0) servePlain(plainPath, request.size(), reply);
    children.push_back(pid);
    constexpr int kClients = 8;
    int resultPipe[2];
    if (pipe(resultPipe) != 0) return 1;
    std::vector<int> starts;
    for (int i = 0; i < kClients; ++i) {
        int p[2];
        if (pipe(p) != 0) return 1;
        pid = fork();
        if (pid == 0) clientProcess(p[0], resultPipe[1], perClient);
        close(p[0]);
        starts.push_back(p[1]);
        children.push_back(pid);
    }

    // One client, rpx.
    auto queue = dispatch::Queue::create("bench.client");
    auto c = connectRpx(queue);
    if (!c) {
        std::fprintf(stderr, "axbench rpx: no server\n");
        return 1;
    }
    Value body = requestBody();
    auto roundTrips = [&](rpx::Connection& connection) {
        for (int i = 0; i < 1000; ++i) connection.sendWithReplySync(body);
        std::vector<double> samples;
        samples.reserve(static_cast<size_t>(requests));
        for (int i = 0; i < requests; ++i) {
            auto start = std::chrono::steady_clock::now();
            connection.sendWithReplySync(body);
            samples.push_back(axbench::microsSince(start));
        }
        return samples;
    };
    std::vector<double> rpxSamples = roundTrips(*c);
    auto queued = connectRpx(queue, kQueuedEndpoint);
    if (!queued) {
        std::fprintf(stderr, "axbench rpx: no server\n");
        return 1;
    }
    std::vector<double> queuedSamples = roundTrips(*queued);

    // One client, the same bytes over a plain socket.
    int plain = connectPlain(plainPath);
    std::vector<char> buf(reply.size());
    std::vector<double> plainSamples;
    for (int i = 0; i < requests + 1000; ++i) {
        auto start = std::chrono::steady_clock::now();
        if (!writeAll(plain, request.data(), request.size()) || !readAll(plain, buf.data(), buf.size())) {
            std::fprintf(stderr, "axbench rpx: plain server failed\n");
            return 1;
        }
        if (i >= 1000) plainSamples.push_back(axbench::microsSince(start));
    }

    // A 256 KiB reply.
    std::vector<double> bigSamples;
    Value bigRequest = dict({{"big", true}});
    for (int i = 0; i < 200; ++i) {
        auto start = std::chrono::steady_clock::now();
        auto r = c->sendWithReplySync(bigRequest);
        if (!r.ok()) return 1;
        bigSamples.push_back(axbench::microsSince(start));
    }

    // Eight client processes at once.
    for (int fd : starts) (void)!write(fd, "g", 1);
    double slowest = 0;
    for (int i = 0; i < kClients; ++i) {
        double us = 0;
        if (!readAll(resultPipe[0], reinterpret_cast<char*>(&us), sizeof us)) {
            std::fprintf(stderr, "axbench rpx: a client failed\n");
            return 1;
        }
        slowest = std::max(slowest, us);
    }
    double rps = kClients * perClient / (slowest / 1e6);

    for (pid_t child : children) kill(child, SIGKILL);
    for (pid_t child : children) waitpid(child, nullptr, 0);
    std::filesystem::remove_all(root);

    double p50 = axbench::percentile(rpxSamples, 50);
    double p99 = axbench::percentile(rpxSamples, 99);
    double plainP50 = axbench::percentile(plainSamples, 50);
    double plainP99 = axbench::percentile(plainSamples, 99);
    double bigP50 = axbench::percentile(bigSamples, 50);
    std::printf("rpx round trip, 1 client, %d requests: p50 %.1f us, p99 %.1f us\n", requests, p50, p99);
    std::printf("the same with the server's handlers on a delivery queue: p50 %.1f us, p99 %.1f us\n",
                axbench::percentile(queuedSamples, 50), axbench::percentile(queuedSamples, 99));
    std::printf("plain socket ping-pong of the same %zu/%zu bytes: p50 %.1f us, p99 %.1f us\n",
                request.size(), reply.size(), plainP50, plainP99);
    std::printf("256 KiB reply: p50 %.1f us\n", bigP50);
    std::printf("8 client processes x %d requests: %.0f requests/s\n", perClient, rps);
    std::printf("RESULT rpx p50_us=%.1f p99_us=%.1f plain_p50_us=%.1f ratio=%.2f clients8_rps=%.0f\n", p50,
                p99, plainP50, p50 / plainP50, rps);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("rpx", "rpx round trips against a plain Unix-socket ping-pong", runRpx);
