// The executable of the sample application and of its plug-ins. Run by hand it says who it is.
// Launched by spawnd it is a plug-in: it answers every message with a greeting, and a message with
// "do" makes it try something and report the outcome, which is how the tests and the demo look at
// its sandbox from the inside:
//   {"do": "write", "path": P}      create and write P: {"errno": 0 or the error}
//   {"do": "tcp", "port": N}        connect to 127.0.0.1:N over TCP: {"errno": ...}
//   {"do": "inet"}                  make an IPv4 socket: {"errno": ...}
//   {"do": "busy", "reason": R}     take a busy assertion: {"assertion": id}
//   {"do": "unbusy", "assertion": id}
//   {"do": "fork"}                  start a child that sleeps: {"child": pid}
//   {"do": "confined"}              try what every sandbox forbids: {"unshare": errno, "clone": errno,
//                                   "ptrace": errno, "setsid": errno}
//   {"do": "environment"}           {"environment": {...}, "directory": working directory}
//   {"do": "receipt"}               ask axd for its application's receipt: the daemon's reply
//   {"do": "axd", "request": R}     send the request R to axd: the daemon's reply
//   {"do": "exit", "status": N}     exit at once, without a reply
// SAMPLE_AT_START in its environment ("crash", "hang" or "exit") makes it fail before serving.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Annexa/AXDaemonClient.h"
#include "Annexa/AXPlugInRuntime.h"
#include "platform/rpx/Rpx.h"
#include "platform/sandbox/Sandbox.h"

extern char** environ;

namespace {

using corvane::Value;
using corvane::dict;

Value errnoOf(int result) { return dict({{"errno", int64_t{result < 0 ? errno : 0}}}); }

Value tryWrite(const std::string& path) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return errnoOf(-1);
    ssize_t n = ::write(fd, "sample\n", 7);
    ::close(fd);
    return errnoOf(n == 7 ? 0 : -1);
}

Value tryTcp(int64_t port) {
    int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return errnoOf(-1);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    int rc = ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
    Value outcome = errnoOf(rc);
    ::close(fd);
    return outcome;
}

Value environment() {
    corvane::Dictionary variables;
    for (char** entry = environ; *entry; ++entry) {
        std::string text = *entry;
        auto equals = text.find('=');
        if (equals != std::string::npos) variables[text.substr(0, equals)] = Value(text.substr(equals + 1));
    }
    char directory[4096] = "";
    if (!::getcwd(directory, sizeof directory)) directory[0] = '\0';
    return dict({{"environment", Value(std::move(variables))}, {"directory", std::string(directory)}});
}

// What no sandbox profile allows; each outcome an errno value (0 when it was allowed).
Value confined() {
    auto outcome = [](long rc) { return Value(int64_t{rc < 0 ? errno : 0}); };
    Value unshared = outcome(::unshare(CLONE_NEWUSER));
    long child = ::syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, nullptr, nullptr, nullptr, 0);
    if (child == 0) ::_exit(0);
    if (child > 0) ::waitpid(static_cast<pid_t>(child), nullptr, 0);
    Value cloned = outcome(child);
    Value traced = outcome(::ptrace(PTRACE_ATTACH, ::getppid(), nullptr, nullptr));
    Value session = outcome(::setsid());
    return dict({{"unshare", unshared}, {"clone", cloned}, {"ptrace", traced}, {"setsid", session}});
}

Value answer(const Value& message) {
    const std::string* action = message["do"].asString();
    if (!action) {
        return dict({{"greeting", "hello from a sample plug-in"},
                     {"pid", int64_t{::getpid()}},
                     {"sandboxed", corvane::sandbox::isSandboxed(::getpid())}});
    }
    if (*action == "write") {
        const std::string* path = message["path"].asString();
        return path ? tryWrite(*path) : dict({{"errno", int64_t{EINVAL}}});
    }
    if (*action == "tcp") return tryTcp(message["port"].int64Value().value_or(9));
    if (*action == "inet") {
        int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        Value outcome = errnoOf(fd);
        if (fd >= 0) ::close(fd);
        return outcome;
    }
    if (*action == "busy") {
        const std::string* reason = message["reason"].asString();
        return dict({{"assertion", annexa::AXPlugInRuntime::beginBusy(reason ? *reason : "busy")}});
    }
    if (*action == "unbusy") {
        annexa::AXPlugInRuntime::endBusy(message["assertion"].uint64Value().value_or(0));
        return Value(corvane::Dictionary{});
    }
    if (*action == "fork") {
        pid_t child = ::fork();
        if (child == 0) {
            ::sleep(1000);
            ::_exit(0);
        }
        return dict({{"child", int64_t{child}}});
    }
    if (*action == "environment") return environment();
    if (*action == "confined") return confined();
    if (*action == "receipt") {
        annexa::AXDaemonClient client;
        auto reply = client.wait([&](auto done) { client.copyReceipt(done); });
        return reply.ok() ? reply.value : dict({{"error", reply.description()}});
    }
    if (*action == "axd") {
        auto queue = corvane::dispatch::Queue::create("sample.axd");
        auto connection = corvane::rpx::Connection::connect("com.corvane.annexa.axd", queue);
        connection->setEventHandler([](const corvane::rpx::Event&) {});
        connection->resume();
        auto reply = connection->sendWithReplySync(message["request"]);
        connection->cancel();
        return reply.ok() ? reply.value : dict({{"error", reply.description()}});
    }
    if (*action == "exit") ::_exit(static_cast<int>(message["status"].int64Value().value_or(0)));
    return dict({{"error", "unknown action " + *action}});
}

void failAtStart(const char* how) {
    if (std::strcmp(how, "crash") == 0) {
        // A crash as the kernel reports it, whatever handler a sanitizer put in place.
        ::signal(SIGSEGV, SIG_DFL);
        ::raise(SIGSEGV);
    }
    if (std::strcmp(how, "exit") == 0) ::_exit(3);
    if (std::strcmp(how, "hang") == 0) {
        for (;;) ::pause();
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (const char* how = std::getenv("SAMPLE_AT_START")) failAtStart(how);
    int served = annexa::AXPlugInRuntime::run([](const corvane::rpx::ConnectionPtr& host, const corvane::rpx::Event& ev) {
        Value reply = answer(ev.message);
        if (ev.wantsReply) host->sendReply(ev.messageId, reply);
    });
    if (served == EINVAL) {
        std::printf("%s: a sample of the Annexa demo\n", argc > 0 ? argv[0] : "sample");
        return 0;
    }
    return served;
}
