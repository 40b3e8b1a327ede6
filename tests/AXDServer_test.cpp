// The server's holds through real connections: every hold of a client that dies is released, also
// while other clients lock and release as fast as they can.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "axd/AXDServer.h"
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
