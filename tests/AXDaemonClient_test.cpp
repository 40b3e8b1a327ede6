// The client library against a stand-in endpoint that records what arrives and answers with a
// canned reply: the messages it builds, key for key, and how it reads replies.
#include "Annexa/AXDaemonClient.h"

#include <gtest/gtest.h>

#include <pthread.h>

#include <mutex>
#include <thread>
#include <stdexcept>

#include "Annexa/AXMessage.h"
#include "platform/log/Log.h"
#include "tests/support/TestSupport.h"

using namespace annexa;
using namespace corvane;
using rpx::ErrorKind;
using rpx::Reply;

namespace {

// Listens on a name, keeps every request and answers each with `answer`.
class StandIn {
public:
    explicit StandIn(const std::string& name, Value answer = Value(Dictionary{})) : answer_(std::move(answer)) {
        auto l = rpx::Listener::create(name, queue_);
        EXPECT_TRUE(l) << l.error().description();
        listener_ = *l;
        listener_->setConnectionHandler([this](rpx::ConnectionPtr c) {
            std::weak_ptr<rpx::Connection> weak = c;
            c->setEventHandler([this, weak](const rpx::Event& ev) {
                auto conn = weak.lock();
                if (ev.isError() || !conn) return;
                std::lock_guard lock(mutex_);
                received_.push_back(ev.message);
                conn->sendReply(ev.messageId, answer_);
            });
            c->resume();
            std::lock_guard lock(mutex_);
            connections_.push_back(c);
        });
        listener_->resume();
    }
    ~StandIn() {
        listener_->cancel();
        std::lock_guard lock(mutex_);
        for (auto& c : connections_) c->cancel();
    }
    Value last() {
        std::lock_guard lock(mutex_);
        return received_.empty() ? Value() : received_.back();
    }

private:
    dispatch::QueuePtr queue_ = dispatch::Queue::create("test.standin");
    std::shared_ptr<rpx::Listener> listener_;
    Value answer_;
    std::mutex mutex_;
    std::vector<Value> received_;
    std::vector<rpx::ConnectionPtr> connections_;
};

// Every queue runs on a thread named after it.
std::string threadName() {
    char name[16] = {};
    pthread_getname_np(pthread_self(), name, sizeof name);
    return name;
}

Reply replyWith(Dictionary d) { return Reply{std::nullopt, Value(std::move(d))}; }

}  // namespace

TEST(AXDaemonClient, EveryOperationSendsItsRequestKeyForKey) {
    axtest::PlatformRoot root;
    StandIn axd(kDefaultServiceName);
    AXDaemonClient client;  // no name: the daemon's own endpoint
    UUID a = UUID::random(), b = UUID::random();
    Value rules = dict({{"KSExtensionPointName", "com.example.point"}});
    Value annotations = dict({{"election", 1}});
    const Value version = Value(uint64_t{3});
    const Value paths = Value(Array{Value("/a.app"), Value("/b.appex")});
    const Value uuids = Value(Array{Value(a), Value(b)});

    struct Case {
        const char* name;
        std::function<void(AXDaemonClient::Completion)> operation;
        Value expected;
    };
    const Case cases[] = {
        {"add", [&](auto done) { client.addPlugIns({"/a.app", "/b.appex"}, done); },
         dict({{"request", "add"}, {"version", version}, {"paths", paths}})},
        {"remove", [&](auto done) { client.removePlugIns({"/a.app", "/b.appex"}, done); },
         dict({{"request", "remove"}, {"version", version}, {"paths", paths}})},
        {"bulk", [&](auto done) { client.bulkPlugIns(7, done); },
         dict({{"request", "bulk"}, {"version", version}, {"flags", uint64_t{7}}})},
        {"ready", [&](auto done) { client.readyPlugIns({a, b}, 1, done); },
         dict({{"request", "ready"}, {"version", version}, {"flags", uint64_t{1}}, {"uuids", uuids}})},
        {"access", [&](auto done) { client.accessPlugIns({a, b}, 2, done); },
         dict({{"request", "access"}, {"version", version}, {"flags", uint64_t{2}}, {"uuids", uuids}})},
        {"match", [&](auto done) { client.matchPlugIns(rules, 3, done); },
         dict({{"request", "match"}, {"version", version}, {"rules", *AXDaemonClient::convertToRPX(rules, 3)},
               {"flags", uint64_t{3}}})},
        {"annotate", [&](auto done) { client.setPlugInAnnotations({a, b}, annotations, done); },
         dict({{"request", "annotate"}, {"version", version}, {"uuids", uuids},
               {"annotations", *AXDaemonClient::convertToRPX(annotations, 3)}})},
        {"bulk-annotate", [&](auto done) { client.bulkSetPlugInAnnotations(annotations, done); },
         dict({{"request", "bulk-annotate"}, {"version", version},
               {"annotations", *AXDaemonClient::convertToRPX(annotations, 3)}})},
        {"hold", [&](auto done) { client.holdPlugIns({"/a.app", "/b.appex"}, 0, done); },
         dict({{"request", "lock"}, {"version", version}, {"paths", paths}, {"flags", uint64_t{0}}})},
        {"release", [&](auto done) { client.releaseHold(a, done); },
         dict({{"request", "lock"}, {"version", version}, {"uuids", Value(Array{Value(a)})}})},
        {"receipt", [&](auto done) { client.copyReceipt(done); }, dict({{"request", "receipt"}, {"version", version}})},
    };
    for (const auto& c : cases) {
        Reply r = client.wait(c.operation);
        EXPECT_TRUE(r.ok()) << c.name;
        EXPECT_EQ(axd.last(), c.expected) << c.name;
    }
}

TEST(AXDaemonClient, CompletionsRunOnTheReplyQueueInOrder) {
    axtest::PlatformRoot root;
    StandIn axd("com.test.named", dict({{"fine", true}}));
    AXDaemonClient client(std::string("com.test.named"));
    std::mutex m;
    std::vector<int> order;
    std::vector<std::string> queues;
    for (int i = 0; i < 20; ++i) {
        client.bulkPlugIns(0, [&, i](const Reply& r) {
            EXPECT_EQ(r.value, dict({{"fine", true}}));
            std::lock_guard lock(m);
            order.push_back(i);
            queues.push_back(threadName());
        });
    }
    client.wait([&](auto done) { client.copyReceipt(done); });  // after the twenty
    std::lock_guard lock(m);
    ASSERT_EQ(order.size(), 20u);
    for (int i = 0; i < 20; ++i) {
        EXPECT_EQ(order[i], i);
        EXPECT_EQ(queues[i], "axd_client");
    }
}

TEST(AXDaemonClient, ErrorInReply) {
    struct Case {
        const char* name;
        Reply reply;
        std::optional<int64_t> code;
        std::string text;
    };
    const Case cases[] = {
        {"empty reply", replyWith({}), std::nullopt, ""},
        {"other keys only", replyWith({{"plugins", Value(Array{})}}), std::nullopt, ""},
        {"code and text", replyWith({{"errorcode", uint64_t{9}}, {"error", "invalid plugin path: /x"}}), 9,
         "invalid plugin path: /x"},
        {"code without text", replyWith({{"errorcode", uint64_t{14}}}), 14, "unknown error returned by Annexa subsystem"},
        {"connection gone", Reply{ErrorKind::ConnectionInvalid, Value()}, 4, "Connection invalid"},
        {"daemon ending", Reply{ErrorKind::TerminationImminent, Value()}, 4, "Termination imminent"},
        // A text without a code breaks the protocol; the host gets an error, not an exception.
        {"text without code", replyWith({{"error", "half an error"}}), 4,
         "axd reported error without a code: half an error"},
    };
    for (const auto& c : cases) {
        corvane::Status s = AXDaemonClient::errorInReply(c.reply);
        ASSERT_EQ(!s.ok(), c.code.has_value()) << c.name;
        if (s.ok()) continue;
        EXPECT_EQ(s.error().domain, "Annexa") << c.name;
        EXPECT_EQ(s.error().code, *c.code) << c.name;
        EXPECT_EQ(s.error().description(), c.text) << c.name;
    }
}

TEST(AXDaemonClient, NoDaemonMeansAnErrorReplyAndALogLine) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    AXDaemonClient client;
    Reply r = client.wait([&](auto done) { client.addPlugIns({"/a.app"}, done); });
    ASSERT_FALSE(r.ok());
    corvane::Status s = AXDaemonClient::errorInReply(r);
    ASSERT_FALSE(s.ok());
    EXPECT_EQ(s.error().code, 4);
    EXPECT_EQ(s.error().description(), "Connection invalid");
    EXPECT_TRUE(axtest::eventually([&] { return capture.contains("Communications error: Connection invalid"); }));
}

TEST(AXDaemonClient, ConvertersWorkOnlyAtVersionThree) {
    axtest::PlatformRoot root;
    AXDaemonClient client(std::string("com.test.absent"));
    Value value = dict({{"list", Value(Array{Value(1), Value("two")})}, {"id", Value(UUID::random())}});
    auto message = AXDaemonClient::convertToRPX(value, 3);
    ASSERT_TRUE(message);
    EXPECT_EQ(client.convertFromRPX(*message), value);
    EXPECT_FALSE(AXDaemonClient::convertToRPX(value, 2));
    client.setProtocolVersion(2);
    EXPECT_FALSE(client.convertFromRPX(*message));
    EXPECT_EQ(client.request("bulk"), (Dictionary{{"request", "bulk"}, {"version", Value(uint64_t{2})}}));
}
