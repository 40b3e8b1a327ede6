// Arbitrary requests (text notation) against a daemon server running in this process on a private
// platform root: every request is answered, every error reply carries a nonzero code with its text,
// and the server still answers a plain request afterwards.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string_view>

#include "axd/AXDServer.h"
#include "platform/rpx/Rpx.h"

namespace {

constexpr const char* kService = "com.corvane.annexa.axd.fuzz";

struct World {
    std::string root;
    std::shared_ptr<annexa::AXDServer> server;
    corvane::dispatch::QueuePtr queue = corvane::dispatch::Queue::create("fuzz.client");
    corvane::rpx::ConnectionPtr connection;

    World() {
        char dir[] = "/tmp/axd-fuzz.XXXXXX";
        if (!mkdtemp(dir)) std::abort();
        root = dir;
        setenv("CORVANE_ROOT", dir, 1);
        setenv("CORVANE_LOG", "error", 0);
        server = annexa::AXDServer::initForService(kService, nullptr);
        if (!server) std::abort();
        server->service()->resume();
        reconnect();
    }
    ~World() {
        std::error_code ignored;
        std::filesystem::remove_all(root, ignored);
    }
    void reconnect() {
        connection = corvane::rpx::Connection::connect(kService, queue);
        connection->setEventHandler([](const corvane::rpx::Event&) {});
        connection->resume();
    }
};

World& world() {
    static World w;
    return w;
}

void checkReply(const corvane::Value& reply) {
    if (!reply.isDictionary()) std::abort();
    const corvane::Value& code = reply["errorcode"];
    const corvane::Value& text = reply["error"];
    if (code.isNull() != text.isNull()) std::abort();
    if (!code.isNull() && (code.uint64Value().value_or(0) == 0 || !text.isString())) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto message = corvane::Value::parse(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!message) return 0;
    World& w = world();
    auto reply = w.connection->sendWithReplySync(*message);
    if (reply.ok()) {
        checkReply(reply.value);
    } else {
        // A message that cannot travel (a descriptor number that is not open) ends only this
        // connection.
        w.reconnect();
    }
    corvane::Value ping(corvane::Dictionary{{"request", "bulk"}, {"version", uint64_t{3}}});
    auto pong = w.connection->sendWithReplySync(ping);
    if (!pong.ok() || pong.value != corvane::Value(corvane::Dictionary{})) std::abort();
    return 0;
}
