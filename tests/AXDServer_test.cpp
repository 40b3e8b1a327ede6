// The server's holds through real connections: every hold of a client that dies is released, also
// while other clients lock and release as fast as they can.
#include <gtest/gtest.h>

#include <fcntl.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <functional>
#include <mutex>
#include <set>
#include <thread>

#include "axd/AXDServer.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using namespace corvane;

namespace {

Value lockRequest(Dictionary extra) {
    extra["request"] = Value("lock");
    extra["version"] = Value(uint64_t{3});
    return Value(std::move(extra));
}

}  // namespace

TEST(AXDServer, TheHoldsOfAThousandDeadClientsAreAllReleased) {
    axtest::PlatformRoot root;
    std::string app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    std::string plugIn = axtest::makeBundle(app + "/PlugIns", "One.appex",
                                            axtest::plugInInfo("com.example.one", dict({{"KSExtensionAttributes", dict({})}})),
                                            "/bin/true");
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    ASSERT_TRUE(registry);
    std::shared_ptr<vantry::Registry> shared = std::move(*registry);
    ASSERT_TRUE(shared->registerBundle(app).ok());
    auto server = annexa::AXDServer::initForService("com.test.holds", nullptr, shared);
    ASSERT_TRUE(server);
    server->service()->resume();
    auto queue = dispatch::Queue::create("test.holds");
    Value hold = lockRequest({{"paths", Value(Array{Value(plugIn)})}, {"flags", uint64_t{2}}});

    // Others lock and release by token meanwhile.
    std::atomic<bool> stop{false};
    std::atomic<int> released{0};
    std::vector<std::thread> flood;
    for (int t = 0; t < 2; ++t) {
        flood.emplace_back([&] {
            auto connection = rpx::Connection::connect("com.test.holds", queue);
            connection->setEventHandler([](const rpx::Event&) {});
            connection->resume();
            while (!stop) {
                rpx::Reply granted = connection->sendWithReplySync(hold);
                const UUID* token = granted.value["uuids"].asUUID();
                if (!token) break;
                connection->sendWithReplySync(lockRequest({{"uuids", Value(Array{Value(*token)})}}));
                ++released;
            }
        });
    }
    for (int i = 0; i < 1000; ++i) {
        auto client = rpx::Connection::connect("com.test.holds", queue);
        client->setEventHandler([](const rpx::Event&) {});
        client->resume();
        ASSERT_TRUE(client->sendWithReplySync(hold).value["uuids"].isUUID()) << i;
        client->cancel();  // dies holding it
    }
    stop = true;
    for (auto& thread : flood) thread.join();
    EXPECT_GT(released.load(), 0);
    EXPECT_TRUE(axtest::eventually([&] { return server->holdCount() == 0; })) << server->holdCount() << " holds left";
    EXPECT_TRUE(axtest::eventually([] { return rpx::outstandingWork() == 0; })) << rpx::outstandingWork();
}

namespace {

// A disk that fails one step of the saves of one directory, the way a full (ENOSPC), failing (EIO)
// or read-only (EROFS) one would; with `afterDoing`, a sync does its work and then reports a
// failure, as an fsync that lost the data does. Everything else goes to the real file system.
class FaultyDisk : public plist::FileSystem {
public:
    enum class Step { None, Open, Write, Sync, Link, Rename, SyncDirectory };
    explicit FaultyDisk(std::string dir) : dir_(std::move(dir)) { plist::setFileSystem(this); }
    ~FaultyDisk() override { plist::setFileSystem(nullptr); }
    void failAt(Step step, int error, bool afterDoing = false) {
        std::lock_guard lock(mutex_);
        step_ = step, error_ = error, afterDoing_ = afterDoing, hits_ = 0;
    }
    int hits() {
        std::lock_guard lock(mutex_);
        return hits_;
    }

    int openFile(const std::string& path, int flags, mode_t mode, int& fd) override {
        bool writing = (flags & (O_WRONLY | O_RDWR)) != 0;
        if (writing && ours(path)) {
            if (int e = fault(Step::Open)) return e;
        }
        int err = FileSystem::openFile(path, flags, mode, fd);
        if (!err && writing && ours(path)) {
            std::lock_guard lock(mutex_);
            fds_.insert(fd);
        }
        return err;
    }
    int writeSome(int fd, const char* data, size_t size, size_t& written) override {
        if (int e = ourFd(fd) ? fault(Step::Write) : 0) return e;
        return FileSystem::writeSome(fd, data, size, written);
    }
    int syncFile(int fd) override {
        if (!ourFd(fd)) return FileSystem::syncFile(fd);
        return afterDoing(Step::Sync, [&] { return FileSystem::syncFile(fd); });
    }
    int closeFile(int fd) override {
        {
            std::lock_guard lock(mutex_);
            fds_.erase(fd);
        }
        return FileSystem::closeFile(fd);
    }
    int linkOpenFile(int fd, const std::string& path) override {
        if (int e = ours(path) ? fault(Step::Link) : 0) return e;
        return FileSystem::linkOpenFile(fd, path);
    }
    int renameFile(const std::string& from, const std::string& to) override {
        if (int e = ours(to) ? fault(Step::Rename) : 0) return e;
        return FileSystem::renameFile(from, to);
    }
    int syncDirectory(const std::string& path) override {
        if (!ours(path)) return FileSystem::syncDirectory(path);
        return afterDoing(Step::SyncDirectory, [&] { return FileSystem::syncDirectory(path); });
    }

private:
    bool ours(const std::string& path) const { return path.rfind(dir_, 0) == 0; }
    bool ourFd(int fd) {
        std::lock_guard lock(mutex_);
        return fds_.count(fd) > 0;
    }
    int fault(Step step) {
        std::lock_guard lock(mutex_);
        if (step != step_) return 0;
        ++hits_;
        return error_;
    }
    int afterDoing(Step step, const std::function<int()>& real) {
        bool first;
        {
            std::lock_guard lock(mutex_);
            first = afterDoing_;
        }
        if (first) {
            if (int e = real()) return e;
            return fault(step);
        }
        if (int e = fault(step)) return e;
        return real();
    }

    const std::string dir_;
    std::mutex mutex_;
    Step step_ = Step::None;
    int error_ = 0;
    bool afterDoing_ = false;
    int hits_ = 0;
    std::set<int> fds_;
};

}  // namespace

// Each step of a save failing in each way a disk fails: the reply is an error, the file holds the
// last acknowledged annotations and so does the daemon's memory, nothing is left beside the file,
// and the next save after the fault succeeds.
TEST(AXDServer, AChangeThatCannotBeSavedIsAnErrorAndUndone) {
    axtest::PlatformRoot root;
    std::string app = axtest::makeBundle(root.path(), "Example.app", axtest::appInfo("com.example.app"), "/bin/true");
    std::string plugIn = axtest::makeBundle(app + "/PlugIns", "One.appex",
                                            axtest::plugInInfo("com.example.one", dict({{"KSExtensionAttributes", dict({})}})),
                                            "/bin/true");
    auto registry = vantry::Registry::open(vantry::Registry::defaultPath());
    ASSERT_TRUE(registry);
    std::shared_ptr<vantry::Registry> shared = std::move(*registry);
    ASSERT_TRUE(shared->registerBundle(app).ok());
    UUID one = shared->plugInForPath(plugIn)->uuid();
    std::string dir = root / "annotations";
    std::filesystem::create_directories(dir);
    std::string file = dir + "/Annotations";
    FaultyDisk disk(dir);
    auto server = annexa::AXDServer::initForService("com.test.faults", file.c_str(), shared);
    ASSERT_TRUE(server);
    server->service()->resume();
    auto queue = dispatch::Queue::create("test.faults");
    auto connection = rpx::Connection::connect("com.test.faults", queue);
    connection->setEventHandler([](const rpx::Event&) {});
    connection->resume();
    auto elect = [&](int election) {
        return connection
            ->sendWithReplySync(dict({{"request", "annotate"}, {"version", uint64_t{3}},
                                      {"uuids", Value(Array{Value(one)})}, {"annotations", dict({{"election", election}})}}))
            .value;
    };
    auto electionInMemory = [&] {
        Value reply = connection->sendWithReplySync(dict({{"request", "match"}, {"version", uint64_t{3}}})).value;
        const Array* forms = reply["matches"].asArray();
        return forms && forms->size() == 1 ? (*forms)[0]["annotations"]["election"] : Value();
    };
    auto electionOnDisk = [&] { return (*plist::readFile(file))["data"]["com.example.one"]["election"]; };
    auto leftBeside = [&] {
        std::vector<std::string> names;
        for (const auto& e : std::filesystem::directory_iterator(dir)) names.push_back(e.path().filename());
        return names;
    };
    ASSERT_TRUE(elect(1)["errorcode"].isNull());
    int acknowledged = 1;

    using Step = FaultyDisk::Step;
    struct Fault {
        const char* name;
        Step step;
        bool afterDoing;
    };
    const Fault faults[] = {
        {"open", Step::Open, false},           {"write", Step::Write, false},
        {"fsync", Step::Sync, false},          {"fsync that lost the data", Step::Sync, true},
        {"link", Step::Link, false},           {"rename", Step::Rename, false},
        {"directory fsync", Step::SyncDirectory, false},
        {"directory fsync that lost the entry", Step::SyncDirectory, true},
    };
    for (const auto& f : faults) {
        for (int error : {ENOSPC, EIO, EROFS}) {
            std::string context = std::string(f.name) + " " + std::strerror(error);
            disk.failAt(f.step, error, f.afterDoing);
            Value reply = elect(acknowledged + 1);
            EXPECT_GT(disk.hits(), 0) << context << ": the step was never reached";
            EXPECT_EQ(reply["errorcode"], Value(uint64_t{4})) << context << ": " << reply.description();
            const std::string* text = reply["error"].asString();
            EXPECT_TRUE(text && text->find("unable to save annotations: ") == 0 &&
                        text->find(std::strerror(error)) != std::string::npos)
                << context << ": " << reply.description();
            EXPECT_EQ(electionOnDisk(), Value(acknowledged)) << context;
            EXPECT_EQ(electionInMemory(), Value(acknowledged)) << context;
            EXPECT_EQ(leftBeside(), std::vector<std::string>{"Annotations"}) << context;

            disk.failAt(Step::None, 0);
            reply = elect(acknowledged + 2);
            EXPECT_TRUE(reply["errorcode"].isNull()) << context << ": " << reply.description();
            acknowledged += 2;
            EXPECT_EQ(electionOnDisk(), Value(acknowledged)) << context;
            EXPECT_EQ(electionInMemory(), Value(acknowledged)) << context;
        }
    }
    connection->cancel();
}
