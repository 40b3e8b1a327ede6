// axbench abuse: eight good clients keep sending requests to a real axd while one abusive client
// does one thing at a time; prints per abuse the good clients' p99 beside the same run without
// abuse, axd's resident memory and open descriptors, and whether any good request went unanswered.
//
// The abusive client is this program again ("axbench abuse-agent KIND"), started per abuse, so
// that the measuring process forks nothing once its threads run.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
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
const char* const kKinds[] = {"reconnect-flood", "no-reply-flood", "never-read", "unclaimed-fds", "huge-annotate"};

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
    double p99Ms = 0;
    long unanswered = 0;
    long rssMiB = 0;
    long fds = 0;
};

// Eight good clients for `seconds`, each on its own connection; axd sampled meanwhile.
Phase measure(pid_t axd, double seconds) {
    constexpr int kGood = 8;
    std::vector<std::vector<double>> samples(kGood);
    std::atomic<long> unanswered{0};
    Sampled sampled;
    std::thread sampler([&] {
        while (!sampled.stop) {
            sampled.maxRssKiB = std::max(sampled.maxRssKiB.load(), axbench::residentKiB(axd));
            sampled.maxFds = std::max(sampled.maxFds.load(), openFds(axd));
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    });
    std::vector<std::thread> clients;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    for (int i = 0; i < kGood; ++i) {
        clients.emplace_back([&, i] {
            auto queue = dispatch::Queue::create("good");
            auto c = rpx::Connection::connect(kEndpoint, queue);
            c->setEventHandler([](const rpx::Event&) {});
            c->resume();
            Value body = request("bulk");
            while (std::chrono::steady_clock::now() < deadline) {
                auto start = std::chrono::steady_clock::now();
                if (!c->sendWithReplySync(body).ok()) {
                    ++unanswered;
                    c = rpx::Connection::connect(kEndpoint, queue);
                    c->setEventHandler([](const rpx::Event&) {});
                    c->resume();
                    continue;
                }
                samples[static_cast<size_t>(i)].push_back(axbench::microsSince(start) / 1000.0);
                std::this_thread::sleep_for(std::chrono::milliseconds(2));
            }
        });
    }
    for (auto& t : clients) t.join();
    sampled.stop = true;
    sampler.join();
    std::vector<double> all;
    for (auto& s : samples) all.insert(all.end(), s.begin(), s.end());
    Phase p;
    p.p99Ms = axbench::percentile(all, 99);
    p.unanswered = unanswered;
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

    // One application with one plug-in, for the annotate abuse.
    std::string app = root + "/Apps/Bench.app";
    std::filesystem::create_directories(app + "/PlugIns/P.appex");
    (void)plist::writeXMLFile(app + "/Info.plist", dict({{"KFBundleIdentifier", "com.bench.app"}}));
    (void)plist::writeXMLFile(app + "/PlugIns/P.appex/Info.plist",
                              dict({{"KFBundleIdentifier", "com.bench.plugin"},
                                    {"KSExtension", dict({{"KSExtensionPointIdentifier", "com.bench.point"},
                                                          {"KSExtensionAttributes", dict({})}})}}));
    std::string uuid;
    {
        auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
        if (!registry || !(*registry)->registerBundle(app).ok()) {
            std::fprintf(stderr, "axbench abuse: cannot register the sample\n");
            return 1;
        }
        uuid = (*registry)->installedPlugIns().front()->uuid().string();
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

    Phase baseline = measure(axd, seconds);
    std::printf("baseline: good p99 %.2f ms, axd %ld MiB, %ld descriptors\n", baseline.p99Ms, baseline.rssMiB, baseline.fds);
    double worst = 0;
    long maxRss = baseline.rssMiB;
    long unanswered = baseline.unanswered;
    for (const char* kind : kKinds) {
        if (!only.empty() && only != kind) continue;
        pid_t agent = spawn({self, "abuse-agent", kind, uuid});
        std::this_thread::sleep_for(std::chrono::milliseconds(300));  // the abuse is under way
        Phase p = measure(axd, seconds);
        end(agent, SIGKILL);
        double ratio = baseline.p99Ms > 0 ? p.p99Ms / baseline.p99Ms : 0;
        worst = std::max(worst, ratio);
        maxRss = std::max(maxRss, p.rssMiB);
        unanswered += p.unanswered;
        std::printf("RESULT abuse kind=%s good_p99_ms=%.2f baseline_p99_ms=%.2f rss_mb=%ld fds=%ld unanswered=%ld\n",
                    kind, p.p99Ms, baseline.p99Ms, p.rssMiB, p.fds, p.unanswered);
        std::fflush(stdout);
    }
    end(axd, SIGTERM);
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
    std::printf("RESULT abuse worst_ratio=%.2f max_rss_mb=%ld unanswered=%ld\n", worst, maxRss, unanswered);
    return 0;
}

}  // namespace

AX_BENCH_SUBCOMMAND("abuse", "good clients' latency and axd's memory under five kinds of abuse", runAbuse);
AX_BENCH_SUBCOMMAND("abuse-agent", "(internal) one abusive client for `abuse`", runAgent);
