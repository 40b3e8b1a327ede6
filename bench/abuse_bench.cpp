// axbench abuse: eight good clients keep sending requests to a real axd (half of them a discovery
// of one plug-in, half a request that does nothing) while one abusive client does one thing at a
// time; prints per abuse the good clients' p99 beside the same run without abuse, axd's resident
// memory during the abuse and after it, its open descriptors, and whether any good request went
// unanswered.
//
// The abusive client is this program again ("axbench abuse-agent KIND"), started per abuse, so
// that the measuring process forks nothing once its threads run.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "bench/Bench.h"
#include "platform/dispatch/Dispatch.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"
#include "platform/vantry/Vantry.h"

extern char** environ;

using namespace corvane;
namespace wire = rpx::wire;

namespace {

constexpr const char* kEndpoint = "com.corvane.annexa.axd";
const char* const kKinds[] = {"reconnect-flood", "no-reply-flood", "never-read", "unclaimed-fds", "huge-annotate",
                              "fifo-add", "hold-flood", "ready-flood", "access-flood", "rule-bomb", "watcher-flood"};
// The plug-ins of the bench's application: "ready-flood" readies them all at once.
constexpr int kPlugIns = 1000;

Value request(const char* name, Dictionary extra = {}) {
    extra["request"] = Value(name);
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

std::string frame(wire::FrameKind kind, uint64_t id, const Value& body) {
    std::vector<int> fds;
    return *wire::encodeFrame({kind, id, body}, fds, rpx::kMaxDepth);
}

int rawConnect() {
    std::string path = rpx::endpointPath(kEndpoint);
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

void writeAll(int fd, const std::string& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
        if (n <= 0) return;
        done += static_cast<size_t>(n);
    }
}

// ---- the abusive client: runs until killed

int runAgent(int argc, char** argv) {
    if (argc < 2) return 64;
    std::string kind = argv[1];
    signal(SIGPIPE, SIG_IGN);
    if (kind == "reconnect-flood") {
        std::string garbage(64 * 1024, '\x7f');
        for (;;) {
            int fd = rawConnect();
            if (fd >= 0) {
                writeAll(fd, garbage);
                close(fd);
            }
        }
    }
    if (kind == "no-reply-flood") {
        std::string burst;
        for (int i = 0; i < 1000; ++i) burst += frame(wire::FrameKind::Message, 1, request("bulk"));
        for (;;) {
            int fd = rawConnect();
            while (fd >= 0 && write(fd, burst.data(), burst.size()) > 0) {
            }
            if (fd >= 0) close(fd);
        }
    }
    if (kind == "never-read") {
        // Twenty connections that send requests and never read a reply.
        std::vector<int> fds;
        for (int i = 0; i < 20; ++i) fds.push_back(rawConnect());
        uint64_t id = 1;
        for (;;) {
            for (int fd : fds) {
                if (fd < 0) continue;
                std::string r = frame(wire::FrameKind::Request, id++, request("bulk"));
                (void)!send(fd, r.data(), r.size(), MSG_DONTWAIT);
            }
            std::this_thread::sleep_for(std::chrono::microseconds(100));
        }
    }
    if (kind == "unclaimed-fds") {
        std::string message = frame(wire::FrameKind::Message, 1, request("bulk"));
        std::vector<int> passed;
        for (int i = 0; i < 200; ++i) passed.push_back(open("/dev/null", O_RDONLY | O_CLOEXEC));
        std::vector<char> control(CMSG_SPACE(sizeof(int) * passed.size()));
        for (;;) {
            int fd = rawConnect();
            if (fd < 0) continue;
            struct iovec iov {message.data(), message.size()};
            struct msghdr msg {};
            msg.msg_iov = &iov;
            msg.msg_iovlen = 1;
            msg.msg_control = control.data();
            msg.msg_controllen = control.size();
            struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
            c->cmsg_level = SOL_SOCKET;
            c->cmsg_type = SCM_RIGHTS;
            c->cmsg_len = CMSG_LEN(sizeof(int) * passed.size());
            std::memcpy(CMSG_DATA(c), passed.data(), sizeof(int) * passed.size());
            for (int k = 0; k < 5 && sendmsg(fd, &msg, MSG_NOSIGNAL) > 0; ++k) {
            }
            close(fd);
        }
    }
    if (kind == "huge-annotate") {
        if (argc < 3) return 64;
        auto uuid = UUID::parse(argv[2]);
        if (!uuid) return 64;
        // Encoded once and sent again and again, as an attacker would: the daemon gets as many
        // requests as it takes, and the abuser spends no processor time of its own on each.
        Array many(20000, Value(*uuid));
        Value body = request("annotate", {{"annotations", dict({{"election", 1}})}, {"uuids", Value(many)}});
        std::string bytes = frame(wire::FrameKind::Request, 1, body);
        int fd = rawConnect();
        wire::FrameReader replies(1 << 20, rpx::kMaxDepth);
        char buf[4096];
        for (;;) {
            writeAll(fd, bytes);
            wire::Frame reply;
            std::string error;
            while (replies.next(reply, error) == wire::FrameReader::Status::NeedMore) {
                ssize_t n = read(fd, buf, sizeof buf);
                if (n <= 0) return 0;
                replies.append(buf, static_cast<size_t>(n));
            }
        }
    }
    // The abusers below each send one kind of request as fast as axd answers, on one connection or
    // many, and read every reply (so that they are not the slow readers the abusers above are).
    auto hammer = [](int connections, const std::function<std::string(uint64_t)>& next) {
        std::vector<std::thread> threads;
        for (int c = 0; c < connections; ++c) {
            threads.emplace_back([&next] {
                int fd = rawConnect();
                if (fd < 0) return;
                wire::FrameReader replies(64 << 20, rpx::kMaxDepth);
                char buf[65536];
                for (uint64_t id = 1;; ++id) {
                    writeAll(fd, next(id));
                    wire::Frame reply;
                    std::string error;
                    while (replies.next(reply, error) == wire::FrameReader::Status::NeedMore) {
                        ssize_t n = read(fd, buf, sizeof buf);
                        if (n <= 0) return;
                        replies.append(buf, static_cast<size_t>(n));
                    }
                }
            });
        }
        for (auto& t : threads) t.join();
        return 0;
    };
    if (kind == "fifo-add") {
        // "add" of a bundle whose Info.plist is a FIFO that nobody writes.
        if (argc < 4) return 64;
        std::string bytes = frame(wire::FrameKind::Request, 1, request("add", {{"paths", Value(Array{Value(argv[3])})}}));
        return hammer(4, [&](uint64_t) { return bytes; });
    }
    if (kind == "hold-flood") {
        // Holds of one plug-in, never released, on as many connections as axd takes from a process.
        if (argc < 5) return 64;
        std::string bytes = frame(wire::FrameKind::Request, 1,
                                  request("lock", {{"paths", Value(Array{Value(argv[4])})}, {"flags", uint64_t{2}}}));
        return hammer(64, [&](uint64_t) { return bytes; });
    }
    if (kind == "ready-flood" || kind == "access-flood") {
        // Twenty hosts, each getting every plug-in ready (or read tokens for them) again and again.
        if (argc < 6) return 64;
        std::vector<UUID> all;
        std::ifstream list(argv[5]);
        std::string line;
        while (std::getline(list, line))
            if (auto u = UUID::parse(line)) all.push_back(*u);
        Array uuids;
        for (const UUID& u : all) uuids.emplace_back(u);
        std::string bytes = frame(wire::FrameKind::Request, 1, request(kind == "ready-flood" ? "ready" : "access", {{"uuids", Value(uuids)}}));
        return hammer(20, [&](uint64_t) { return bytes; });
    }
    if (kind == "rule-bomb") {
        // A match offering 200,000 items, then the most that is served, again and again.
        auto offer = [](size_t n) {
            return request("match", {{"rules", dict({{"KSExtensionActivationRule", dict({{"items", Value(Array(n, Value("public.data")))}})}})}});
        };
        std::string refused = frame(wire::FrameKind::Request, 1, offer(200000));
        std::string served = frame(wire::FrameKind::Request, 1, offer(1024));
        return hammer(2, [&](uint64_t id) { return id % 2 ? refused : served; });
    }
    if (kind == "watcher-flood") {
        // Watchers that never read, as many as axd takes, while another connection changes an
        // annotation as fast as it can: every change goes to every watcher.
        if (argc < 3) return 64;
        auto uuid = UUID::parse(argv[2]);
        if (!uuid) return 64;
        std::vector<int> watchers;
        for (int i = 0; i < 64; ++i) {
            int fd = rawConnect();
            std::string w = frame(wire::FrameKind::Request, 1, request("watch"));
            writeAll(fd, w);
            watchers.push_back(fd);
        }
        std::string bytes = frame(wire::FrameKind::Request, 1,
                                  request("annotate", {{"uuids", Value(Array{Value(*uuid)})},
                                                       {"annotations", dict({{"extension", dict({{"padding", std::string(4096, 'x')}})}})}}));
        uint64_t n = 0;
        std::string other = frame(wire::FrameKind::Request, 1,
                                  request("annotate", {{"uuids", Value(Array{Value(*uuid)})},
                                                       {"annotations", dict({{"extension", dict({{"padding", std::string(4096, 'y')}})}})}}));
        return hammer(1, [&](uint64_t) { return ++n % 2 ? bytes : other; });
    }
    return 64;
}

// ---- the measuring side

struct Sampled {
    std::atomic<bool> stop{false};
    std::atomic<long> maxRssKiB{0};
    std::atomic<long> maxFds{0};
};

long openFds(pid_t pid) {
    std::error_code ec;
    long n = 0;
    for (auto it = std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/fd", ec);
         !ec && it != std::filesystem::directory_iterator(); ++it)
        ++n;
    return n;
}

struct Phase {
    double p50Ms = 0;
    double p99Ms = 0;
    long unanswered = 0;
    long rssMiB = 0;
    long fds = 0;
};

// One "ready" of every plug-in in the list file, on a connection of its own, waiting for the reply.
void readyEvery(const std::string& uuidList) {
    Array uuids;
    std::ifstream list(uuidList);
    for (std::string line; std::getline(list, line);)
        if (auto u = UUID::parse(line)) uuids.emplace_back(*u);
    int fd = rawConnect();
    if (fd < 0) return;
    writeAll(fd, frame(wire::FrameKind::Request, 1, request("ready", {{"uuids", Value(std::move(uuids))}})));
    wire::FrameReader replies(64 << 20, rpx::kMaxDepth);
    wire::Frame reply;
    std::string error;
    char buf[65536];
    while (replies.next(reply, error) == wire::FrameReader::Status::NeedMore) {
        ssize_t n = read(fd, buf, sizeof buf);
        if (n <= 0) break;
        replies.append(buf, static_cast<size_t>(n));
    }
    close(fd);
}

// One good client for `seconds`, on a connection of its own: its latencies, in milliseconds.
std::vector<double> goodClient(int which, double seconds) {
    std::vector<double> samples;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    auto queue = dispatch::Queue::create("good");
    auto connect = [&] {
        auto c = rpx::Connection::connect(kEndpoint, queue);
        c->setEventHandler([](const rpx::Event&) {});
        c->resume();
        return c;
    };
    auto c = connect();
    // Half the good clients ask what any request costs, half a discovery of one plug-in.
    Value body = which % 2 ? request("bulk")
                           : request("match", {{"rules", dict({{"KSExtensionIdentifier", "com.bench.plugin0"}})}});
    while (std::chrono::steady_clock::now() < deadline) {
        auto start = std::chrono::steady_clock::now();
        if (!c->sendWithReplySync(body).ok()) {
            samples.push_back(-1);  // unanswered
            c = connect();
            continue;
        }
        samples.push_back(axbench::microsSince(start) / 1000.0);
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return samples;
}

// Eight good clients for `seconds`, each a process of its own (as hosts are: axd serves processes
// in turns), reporting their latencies through a pipe; axd sampled meanwhile.
Phase measure(pid_t axd, double seconds) {
    constexpr int kGood = 8;
    std::vector<std::pair<pid_t, int>> children;
    for (int i = 0; i < kGood; ++i) {
        int fds[2];
        if (pipe2(fds, O_CLOEXEC) != 0) continue;
        pid_t child = fork();
        if (child == 0) {
            close(fds[0]);
            prctl(PR_SET_NAME, "good-client");
            std::vector<double> samples = goodClient(i, seconds);
            size_t bytes = samples.size() * sizeof(double);
            const char* data = reinterpret_cast<const char*>(samples.data());
            for (size_t done = 0; done < bytes;) {
                ssize_t n = write(fds[1], data + done, bytes - done);
                if (n <= 0) break;
                done += static_cast<size_t>(n);
            }
            _exit(0);
        }
        close(fds[1]);
        if (child > 0) children.emplace_back(child, fds[0]);
        else close(fds[0]);
    }
    Sampled sampled;
    std::thread sampler([&] {
        while (!sampled.stop) {
            sampled.maxRssKiB = std::max(sampled.maxRssKiB.load(), axbench::residentKiB(axd));
            sampled.maxFds = std::max(sampled.maxFds.load(), openFds(axd));
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    });
    std::vector<double> all;
    Phase p;
    for (auto [child, fd] : children) {
        std::string bytes;
        char buf[65536];
        for (ssize_t n; (n = read(fd, buf, sizeof buf)) > 0;) bytes.append(buf, static_cast<size_t>(n));
        close(fd);
        waitpid(child, nullptr, 0);
        for (size_t k = 0; k + sizeof(double) <= bytes.size(); k += sizeof(double)) {
            double ms;
            std::memcpy(&ms, bytes.data() + k, sizeof ms);
            if (ms < 0) ++p.unanswered;
            else all.push_back(ms);
        }
    }
    sampled.stop = true;
    sampler.join();
    p.p50Ms = axbench::percentile(all, 50);
    p.p99Ms = axbench::percentile(all, 99);
    p.rssMiB = sampled.maxRssKiB / 1024;
    p.fds = sampled.maxFds;
    return p;
}

pid_t spawn(const std::vector<std::string>& args) {
    std::vector<char*> argv;
    for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    pid_t pid = -1;
    if (posix_spawn(&pid, argv[0], nullptr, nullptr, argv.data(), environ) != 0) return -1;
    return pid;
}

void end(pid_t pid, int sig) {
    if (pid <= 0) return;
    kill(pid, sig);
    waitpid(pid, nullptr, 0);
}

int runAbuse(int argc, char** argv) {
    double seconds = 2;
    std::string only;  // one kind of abuse, when profiling it
    for (int i = 1; i + 1 < argc; i += 2) {
        if (std::strcmp(argv[i], "--seconds") == 0) seconds = std::atof(argv[i + 1]);
        if (std::strcmp(argv[i], "--only") == 0) only = argv[i + 1];
    }
    char tmpl[] = "/tmp/axbench-abuse.XXXXXX";
    std::string root = mkdtemp(tmpl);
    setenv("CORVANE_ROOT", root.c_str(), 1);
    setenv("CORVANE_LOG", "error", 1);
    setenv("CORVANE_LOG_SINK", "stderr", 1);
    std::string self = std::filesystem::read_symlink("/proc/self/exe");
    std::string bin = self.substr(0, self.rfind('/'));

    // One application with many plug-ins: the first is annotated, held and discovered, all of them
    // readied. A bundle whose Info.plist is a FIFO, for "fifo-add".
    std::string app = root + "/Apps/Bench.app";
    (void)std::filesystem::create_directories(app + "/PlugIns");
    (void)plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.app"}}));
    for (int i = 0; i < kPlugIns; ++i) {
        std::string dir = app + "/PlugIns/P" + std::to_string(i) + ".appex";
        std::filesystem::create_directories(dir);
        (void)plist::writeXMLFile(dir + "/Info.plist",
                                  dict({{"KFBundleIdentifier", "com.bench.plugin" + std::to_string(i)},
                                        {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                              {"KSExtensionAttributes", dict({})}})}}));
    }
    std::string fifoBundle = root + "/Fifo.app";
    std::filesystem::create_directories(fifoBundle);
    mkfifo((fifoBundle + "/Info.plist").c_str(), 0644);
    std::string uuid, firstPlugIn = app + "/PlugIns/P0.appex", uuidList = root + "/uuids";
    {
        auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
        if (!registry || !(*registry)->registerBundle(app).ok()) {
            std::fprintf(stderr, "axbench abuse: cannot register the sample\n");
            return 1;
        }
        std::ofstream list(uuidList);
        for (const auto& r : (*registry)->installedPlugIns()) {
            list << r->uuid().string() << "\n";
            if (r->bundlePath() == firstPlugIn) uuid = r->uuid().string();
        }
    }
    std::string axdLog = root + "/axd.log";
    int logFd = open(axdLog.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    pid_t axd = -1;
    {
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, logFd, STDERR_FILENO);
        std::string path = bin + "/axd";
        char* args[] = {path.data(), nullptr};
        posix_spawn(&axd, path.c_str(), &actions, nullptr, args, environ);
        posix_spawn_file_actions_destroy(&actions);
    }
    close(logFd);
    std::string endpoint = rpx::endpointPath(kEndpoint);
    for (int i = 0; i < 500 && !std::filesystem::exists(endpoint); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));

    // A host readies every plug-in once, as hosts do: the baseline's memory holds them all, like
    // the memory after each kind of abuse.
    readyEvery(uuidList);
    Phase baseline = measure(axd, seconds);
    std::printf("baseline: good p50 %.2f ms, p99 %.2f ms, axd %ld MiB, %ld descriptors\n", baseline.p50Ms, baseline.p99Ms,
                baseline.rssMiB, baseline.fds);
    double worst = 0;
    long maxRss = baseline.rssMiB;
    long maxAfter = 0;
    long unanswered = baseline.unanswered;
    for (const char* kind : kKinds) {
        if (!only.empty() && only != kind) continue;
        pid_t agent = spawn({self, "abuse-agent", kind, uuid, fifoBundle, firstPlugIn, uuidList});
        std::this_thread::sleep_for(std::chrono::milliseconds(300));  // the abuse is under way
        Phase p = measure(axd, seconds);
        end(agent, SIGKILL);
        // What the abuse took is given back once it ends.
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
        long afterMiB = axbench::residentKiB(axd) / 1024;
        maxAfter = std::max(maxAfter, afterMiB);
        double ratio = baseline.p99Ms > 0 ? p.p99Ms / baseline.p99Ms : 0;
        worst = std::max(worst, ratio);
        maxRss = std::max(maxRss, p.rssMiB);
        unanswered += p.unanswered;
        std::printf("RESULT abuse kind=%s good_p50_ms=%.2f good_p99_ms=%.2f baseline_p99_ms=%.2f rss_mb=%ld rss_after_mb=%ld fds=%ld unanswered=%ld\n",
                    kind, p.p50Ms, p.p99Ms, baseline.p99Ms, p.rssMiB, afterMiB, p.fds, p.unanswered);
        std::fflush(stdout);
    }
    end(axd, SIGTERM);
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
    std::printf("RESULT abuse worst_ratio=%.2f max_rss_mb=%ld max_rss_after_mb=%ld unanswered=%ld\n", worst, maxRss, maxAfter,
                unanswered);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("abuse", "good clients' latency and axd's memory under eleven kinds of abuse", runAbuse);
AX_BENCH_SUBCOMMAND("abuse-agent", "(internal) one abusive client for `abuse`", runAgent);
