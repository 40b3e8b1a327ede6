// Protocol violations of each peer process: one that breaks the protocol again and again (garbage
// instead of frames, descriptors no frame names, a request id reused, a frame left unfinished) is
// refused new connections for a while, so that a flood of bad connections costs the listener an
// accept and a close each instead of a peer's setup, a read and a parse.
#include <algorithm>
#include <chrono>
#include <unordered_map>

#include "platform/rpx/Internal.h"

namespace corvane::rpx {

namespace {

using Clock = std::chrono::steady_clock;

constexpr auto kFirstBar = std::chrono::milliseconds(250);
constexpr auto kLongestBar = std::chrono::seconds(8);
// A process that stays well-behaved this long after its bar starts again from the first one.
constexpr auto kForgiven = std::chrono::seconds(10);
constexpr size_t kRememberedProcesses = 1024;

struct Record {
    Clock::time_point windowStart;
    unsigned inWindow = 0;
    Clock::time_point barredUntil;
    unsigned bars = 0;  // in a row, each twice as long as the one before
};

Mutex gViolationsMutex;
std::unordered_map<pid_t, Record>& records() REQUIRES(gViolationsMutex) {
    static auto* table = new std::unordered_map<pid_t, Record>();
    return *table;
}

void forgetQuietProcesses(Clock::time_point now) REQUIRES(gViolationsMutex) {
    auto& table = records();
    if (table.size() <= kRememberedProcesses) return;
    for (auto it = table.begin(); it != table.end();) {
        bool quiet = now - it->second.windowStart > std::chrono::seconds(1) && now - it->second.barredUntil > kForgiven;
        it = quiet ? table.erase(it) : std::next(it);
    }
}

}  // namespace

void internal::recordViolation(pid_t pid) {
    auto now = Clock::now();
    MutexLock lock(gViolationsMutex);
    forgetQuietProcesses(now);
    Record& r = records()[pid];
    if (now - r.windowStart >= std::chrono::seconds(1)) {
        r.windowStart = now;
        r.inWindow = 0;
    }
    if (++r.inWindow <= limits().violationsPerSecond) return;
    if (now - r.barredUntil > kForgiven) r.bars = 0;
    auto bar = std::min<Clock::duration>(kFirstBar * (1u << std::min(r.bars, 5u)), kLongestBar);
    r.barredUntil = now + bar;
    r.bars = std::min(r.bars + 1, 5u);
    r.inWindow = 0;
    r.windowStart = now;
    log::error(rpxLog(), "rpx: refusing new connections of pid %d for %lld ms: more than %u protocol violations in a second",
               pid, static_cast<long long>(std::chrono::duration_cast<std::chrono::milliseconds>(bar).count()),
               static_cast<unsigned>(limits().violationsPerSecond));
}

bool internal::connectionsBarred(pid_t pid) {
    MutexLock lock(gViolationsMutex);
    auto it = records().find(pid);
    return it != records().end() && Clock::now() < it->second.barredUntil;
}

}  // namespace corvane::rpx
