// Arbitrary requests (text notation) against a daemon server running in this process on a private
// platform root with a small registry: every request is answered, every error reply carries a
// nonzero code with its text, and the server still answers a plain request afterwards.
//
// So that inputs can name what is registered, the UUID 00000000-0000-0000-0000-0000000000NN stands
// (as a value or as the text of a dictionary key) for the NNth registered plug-in, modulo their
// number, and "$APP" inside a string for the sample application's path.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string_view>

#include <sys/stat.h>
#include <unistd.h>

#include "axd/AXDServer.h"
#include "platform/plist/Plist.h"
#include "platform/rpx/Rpx.h"
#include "platform/vantry/Vantry.h"

namespace {

constexpr const char* kService = "com.corvane.annexa.axd.fuzz";

struct World {
    std::string root;
    std::shared_ptr<corvane::vantry::Registry> registry;
    std::shared_ptr<annexa::AXDServer> server;
    corvane::dispatch::QueuePtr queue = corvane::dispatch::Queue::create("fuzz.client");
    corvane::rpx::ConnectionPtr connection;
    std::string app;
    std::vector<corvane::UUID> plugIns;

    World() {
        char dir[] = "/tmp/axd-fuzz.XXXXXX";
        if (!mkdtemp(dir)) std::abort();
        root = dir;
        setenv("CORVANE_ROOT", dir, 1);
        setenv("CORVANE_LOG", "error", 0);
        auto opened = corvane::vantry::Registry::open(corvane::vantry::Registry::defaultPath());
        if (!opened) std::abort();
        registry = std::move(*opened);
        registerSample();
        server = annexa::AXDServer::initForService(kService, nullptr, registry);
        if (!server) std::abort();
        server->service()->resume();
        reconnect();
    }
    static void makeBundle(const std::string& path, const std::string& identifier, const char* type,
                           const corvane::Value& plugin) {
        std::filesystem::create_directories(path);
        corvane::Dictionary info{{"KFBundleIdentifier", identifier}, {"KFBundleExecutable", "exe"},
                                 {"KFBundleVersion", "1"}, {"KFBundlePackageType", type}};
        if (!plugin.isNull()) info.emplace("KSExtension", plugin);
        if (!corvane::plist::writeXMLFile(path + "/Info.plist", corvane::Value(info)).ok()) std::abort();
        std::filesystem::copy_file("/bin/true", path + "/exe");
        chmod((path + "/exe").c_str(), 0755);
    }
    void registerSample() {
        app = root + "/Fuzz.app";
        makeBundle(app, "com.example.fuzz", "APP!", corvane::Value());
        for (const char* name : {"One", "Two", "Three"}) {
            makeBundle(app + "/PlugIns/" + name + ".appex", std::string("com.example.fuzz.") + name, "RPX!",
                       corvane::dict({{"KSExtensionPointIdentifier", "com.example.point"},
                                      {"KSExtensionAttributes", corvane::dict({{"KSExtensionVersion", "1"}})}}));
        }
        if (!registry->registerBundle(app).ok()) std::abort();
        for (const auto& record : registry->installedPlugIns()) plugIns.push_back(record->uuid());
        if (plugIns.empty()) std::abort();
    }
    corvane::UUID bindUuid(const corvane::UUID& uuid) const {
        for (size_t i = 0; i + 1 < uuid.bytes.size(); ++i)
            if (uuid.bytes[i] != 0) return uuid;
        return plugIns[uuid.bytes[15] % plugIns.size()];
    }
    // Replaces the placeholders described above.
    corvane::Value bind(const corvane::Value& v) const {
        if (const auto* uuid = v.asUUID()) return corvane::Value(bindUuid(*uuid));
        if (const auto* text = v.asString()) {
            size_t at = text->find("$APP");
            if (at == std::string::npos) return v;
            std::string bound = *text;
            bound.replace(at, 4, app);
            return corvane::Value(bound);
        }
        if (const auto* array = v.asArray()) {
            corvane::Array out;
            for (const auto& e : *array) out.push_back(bind(e));
            return corvane::Value(std::move(out));
        }
        if (const auto* dictionary = v.asDictionary()) {
            corvane::Dictionary out;
            for (const auto& [k, e] : *dictionary) {
                // Keys of "bulk-annotate" are UUID texts.
                auto uuid = corvane::UUID::parse(k);
                out.emplace(uuid ? bindUuid(*uuid).string() : k, bind(e));
            }
            return corvane::Value(std::move(out));
        }
        return v;
    }
    void reconnect() {
        connection = corvane::rpx::Connection::connect(kService, queue);
        connection->setEventHandler([](const corvane::rpx::Event&) {});
        connection->resume();
    }
};

// The server runs for the life of the process, as in the daemon, so nothing of it may be destroyed
// while its threads still serve: at exit the private root is removed and the process ends at once,
// before static destructors, as axd itself ends.
World& world() {
    static World* w = [] {
        auto* made = new World;
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(world().root, ignored);
            std::fflush(nullptr);
            _exit(0);
        });
        return made;
    }();
    return *w;
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
    auto reply = w.connection->sendWithReplySync(w.bind(*message));
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
