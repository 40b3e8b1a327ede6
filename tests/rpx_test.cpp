#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <thread>

#include "platform/log/Log.h"
#include "platform/rpx/Rpx.h"
#include "platform/rpx/Wire.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
using namespace std::chrono_literals;
namespace wire = rpx::wire;

namespace {

// The limits are read once per process: this program runs with small ones, so that tests reach them
// quickly.
const bool kSmallLimits = [] {
    setenv("CORVANE_RPX_LIMITS",
           "queued-reply-mib=16,partial-frame-seconds=1,connections-per-process=8,read-mib-per-second=2", 1);
    return true;
}();

size_t openDescriptors() {
    size_t n = 0;
    for ([[maybe_unused]] const auto& e : std::filesystem::directory_iterator("/proc/self/fd")) ++n;
    return n;
}

// True when the peer closed the connection: reads (and drops) what came before the end.
bool closedByPeer(int fd, std::chrono::milliseconds within = 5s) {
    return axtest::eventually(
        [&] {
            char buf[65536];
            ssize_t n = ::recv(fd, buf, sizeof buf, MSG_DONTWAIT);
            return n == 0 || (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK);
        },
        within);
}

// Writes as much of `bytes` as the peer takes in `attempts` tries 2 ms apart, never reading a
// reply; how much went.
size_t writeWithoutReading(int fd, const std::string& bytes, int attempts) {
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    size_t written = 0;
    for (int i = 0; i < attempts && written < bytes.size(); ++i) {
        ssize_t n = write(fd, bytes.data() + written, bytes.size() - written);
        if (n > 0) written += static_cast<size_t>(n);
        std::this_thread::sleep_for(2ms);
    }
    return written;
}

// A client connection whose events nobody needs, resumed.
rpx::ConnectionPtr connectQuietly(const std::string& name, const dispatch::QueuePtr& queue) {
    auto c = rpx::Connection::connect(name, queue);
    c->setEventHandler([](const rpx::Event&) {});
    c->resume();
    return c;
}

std::string frameBytes(wire::FrameKind kind, uint64_t id, const Value& body) {
    std::vector<int> fds;
    return *wire::encodeFrame(wire::Frame{kind, id, body}, fds, rpx::kMaxDepth);
}

// Collects events and lets a test wait for them.
struct Recorder {
    std::mutex m;
    std::condition_variable cv;
    std::vector<rpx::Event> events;

    void add(const rpx::Event& ev) {
        std::lock_guard lock(m);
        events.push_back(ev);
        cv.notify_all();
    }
    bool waitFor(std::function<bool(const std::vector<rpx::Event>&)> pred,
                 std::chrono::milliseconds timeout = 5s) {
        std::unique_lock lock(m);
        return cv.wait_for(lock, timeout, [&] { return pred(events); });
    }
    size_t count(std::optional<rpx::ErrorKind> kind) {
        std::lock_guard lock(m);
        size_t n = 0;
        for (auto& e : events)
            if (e.error == kind) ++n;
        return n;
    }
};

// An in-process echo server: replies {"echo": request}; counts requests. Accepted connections
// outlive the listener, so their handlers hold the server's state, not the fixture.
struct EchoServer {
    struct State {
        std::atomic<int> requests{0};
        std::atomic<size_t> replyPadding{0};
        std::mutex mutex;
        Value attachment;  // sent with every reply when set
        Recorder recorder;
    };
    dispatch::QueuePtr queue = dispatch::Queue::create("test.listener");
    std::shared_ptr<rpx::Listener> listener;
    std::shared_ptr<State> state = std::make_shared<State>();
    std::atomic<int>& requests = state->requests;
    std::atomic<size_t>& replyPadding = state->replyPadding;
    Recorder& recorder = state->recorder;

    explicit EchoServer(const std::string& name) {
        auto l = rpx::Listener::create(name, queue);
        EXPECT_TRUE(l) << l.error().description();
        listener = *l;
        listener->setConnectionHandler([state = state](rpx::ConnectionPtr c) {
            std::weak_ptr<rpx::Connection> weak = c;
            c->setEventHandler([state, weak](const rpx::Event& ev) {
                state->recorder.add(ev);
                auto conn = weak.lock();
                if (ev.isError() || !ev.wantsReply || !conn) return;
                ++state->requests;
                Dictionary reply{{"echo", ev.message}};
                if (size_t pad = state->replyPadding) reply.emplace("pad", Value(std::string(pad, 'x')));
                {
                    std::lock_guard lock(state->mutex);
                    if (!state->attachment.isNull()) reply.emplace("attachment", state->attachment);
                }
                conn->sendReply(ev.messageId, Value(std::move(reply)));
            });
            c->resume();
        });
        listener->resume();
    }
};

// The one frame in `bytes`, read as a connection reads it.
wire::Frame readFrame(const std::string& bytes) {
    wire::FrameReader reader(4 << 20, rpx::kMaxDepth);
    reader.append(bytes.data(), bytes.size());
    wire::Frame f;
    std::string error;
    EXPECT_EQ(reader.next(f, error), wire::FrameReader::Status::Frame) << error;
    return f;
}

int rawConnect(const std::string& name) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    std::string path = rpx::endpointPath(name);
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return -1;
    return fd;
}

}  // namespace

TEST(RpxWire, EveryKindSurvivesAStreamSplitIntoSingleBytes) {
    Value body = dict({{"null", Value()}, {"t", true}, {"f", false}, {"i", int64_t{-1}},
                       {"u", std::numeric_limits<uint64_t>::max()}, {"d", -0.25},
                       {"s", "ünïcode"}, {"data", Value::data("\x00\xff", 2)},
                       {"date", Value(Date{-5})}, {"uuid", Value(UUID::random())},
                       {"a", Value(Array{Value(Array{Value(Array{})})})}, {"empty", dict({})}});
    std::string bytes = frameBytes(wire::FrameKind::Request, 42, body) +
                        frameBytes(wire::FrameKind::Reply, 43, Value("second"));
    wire::FrameReader reader(1 << 20, rpx::kMaxDepth);
    std::vector<wire::Frame> frames;
    for (char c : bytes) {
        reader.append(&c, 1);
        wire::Frame f;
        std::string error;
        while (reader.next(f, error) == wire::FrameReader::Status::Frame) frames.push_back(f);
        ASSERT_TRUE(error.empty()) << error;
    }
    ASSERT_EQ(frames.size(), 2u);
    EXPECT_EQ(frames[0].kind, wire::FrameKind::Request);
    EXPECT_EQ(frames[0].id, 42u);
    EXPECT_EQ(frames[0].body, body);
    EXPECT_EQ(frames[0].body["u"].kind(), Value::Kind::UInt64);
    EXPECT_EQ(frames[0].body["i"].kind(), Value::Kind::Int64);
    EXPECT_EQ(frames[1].body, Value("second"));
    EXPECT_EQ(reader.buffered(), 0u);
}

TEST(RpxWire, MalformedFramesAreErrorsAndTruncatedOnesWait) {
    auto header = [](uint32_t length, uint8_t kind, uint16_t fds) {
        std::string h;
        for (int i = 0; i < 4; ++i) h.push_back(static_cast<char>(length >> (8 * i)));
        h.push_back(static_cast<char>(kind));
        h.push_back(0);
        h.push_back(static_cast<char>(fds & 0xff));
        h.push_back(static_cast<char>(fds >> 8));
        h += std::string(8, '\0');
        return h;
    };
    auto withBody = [&](const std::string& body, uint8_t kind = 1, uint16_t fds = 0) {
        return header(static_cast<uint32_t>(body.size()), kind, fds) + body;
    };
    std::string deep;
    for (int i = 0; i < 200; ++i) deep += std::string("\x0a\x01\x00\x00\x00", 5);
    deep.push_back(0);
    struct Case {
        const char* name;
        std::string bytes;
        wire::FrameReader::Status expected;
    };
    const Case cases[] = {
        {"truncated header", header(10, 1, 0).substr(0, 7), wire::FrameReader::Status::NeedMore},
        {"truncated body", header(10, 1, 0) + "abc", wire::FrameReader::Status::NeedMore},
        {"length past the limit", header(2u << 20, 1, 0), wire::FrameReader::Status::Error},
        {"unknown frame kind", withBody(std::string(1, '\0'), 9), wire::FrameReader::Status::Error},
        {"array count that lies", withBody(std::string("\x0a\xff\xff\xff\x0f", 5)),
         wire::FrameReader::Status::Error},
        {"string length that lies", withBody(std::string("\x06\x10\x00\x00\x00" "ab", 7)),
         wire::FrameReader::Status::Error},
        {"depth bomb", withBody(deep), wire::FrameReader::Status::Error},
        {"invalid UTF-8 key",
         withBody(std::string("\x0b\x01\x00\x00\x00\x02\x00\x00\x00\xc3\x28\x00", 12)),
         wire::FrameReader::Status::Error},
        {"descriptor that did not arrive", withBody(std::string("\x0c\x00\x00\x00\x00", 5), 1, 1),
         wire::FrameReader::Status::Error},
        {"trailing bytes after the value", withBody(std::string("\x00\x00", 2)),
         wire::FrameReader::Status::Error},
        {"unknown tag", withBody(std::string("\x63", 1)), wire::FrameReader::Status::Error},
    };
    for (const auto& c : cases) {
        wire::FrameReader reader(1 << 20, rpx::kMaxDepth);
        reader.append(c.bytes.data(), c.bytes.size());
        wire::Frame f;
        std::string error;
        EXPECT_EQ(reader.next(f, error), c.expected) << c.name;
    }
}

// A large frame is decoded lazily: its large array elements stay encoded until looked at. What a
// reader sees must not change, and a fault anywhere inside such an element still refuses the frame.
TEST(RpxWire, LargeFramesDecodeTheirElementsOnFirstLookWithTheSameResult) {
    Array forms;
    for (int i = 0; i < 200; ++i) {
        forms.push_back(dict({{"identifier", "com.example.plugin" + std::to_string(i)},
                              {"path", std::string(600, 'p')},
                              {"info", dict({{"text", std::string(200, 'i')}})},
                              {"nested", dict({{"list", Value(Array{Value(1), Value("two"), Value(3.5)})}})}}));
    }
    forms.push_back(dict({{"small", true}}));
    Value body = dict({{"matches", Value(forms)}});
    std::string bytes = frameBytes(wire::FrameKind::Reply, 7, body);
    ASSERT_GT(bytes.size(), 64u * 1024);

    wire::FrameReader reader(4 << 20, rpx::kMaxDepth);
    reader.append(bytes.data(), bytes.size());
    wire::Frame f;
    std::string error;
    ASSERT_EQ(reader.next(f, error), wire::FrameReader::Status::Frame) << error;
    EXPECT_TRUE(f.body["matches"].encoding()) << "a large value of the body stays encoded";
    const Array* got = f.body["matches"].asArray();
    ASSERT_TRUE(got);
    EXPECT_TRUE((*got)[0].encoding()) << "a large element of it stays encoded in turn";
    EXPECT_FALSE(got->back().encoding()) << "a small one is decoded at once";
    const Value& form = (*got)[0];
    EXPECT_TRUE(form["info"].encoding()) << "an entry of a kept element from 128 bytes on stays encoded too";
    EXPECT_FALSE(form["nested"].encoding()) << "a smaller entry is decoded with its element";
    EXPECT_EQ((*got)[0].kind(), Value::Kind::Dictionary);
    EXPECT_EQ((*got)[0].kindsInside() & (1u << static_cast<unsigned>(Value::Kind::Null)), 0u);
    EXPECT_EQ(f.body, body);
    // Sent on, the encoded elements are copied as they came: the same bytes.
    EXPECT_EQ(frameBytes(wire::FrameKind::Reply, 7, f.body), bytes);

    // The same frame with one byte of the last large element's nested list broken, in turn: an
    // invalid UTF-8 byte in a string, an unknown tag, and a count that runs past the end.
    size_t lastLarge = bytes.rfind("two");
    ASSERT_NE(lastLarge, std::string::npos);
    struct Case {
        const char* name;
        size_t at;
        char byte;
    };
    const Case cases[] = {
        {"invalid UTF-8 in a string", lastLarge, '\xc3'},
        {"unknown tag", lastLarge - 5, '\x63'},
        {"string length that lies", lastLarge - 4, '\x7f'},
    };
    for (const auto& c : cases) {
        std::string broken = bytes;
        broken[c.at] = c.byte;
        wire::FrameReader r(4 << 20, rpx::kMaxDepth);
        r.append(broken.data(), broken.size());
        wire::Frame bad;
        EXPECT_EQ(r.next(bad, error), wire::FrameReader::Status::Error) << c.name;
    }

    // A text at the deepest level allowed is taken inside a kept element; one level deeper, the
    // frame is refused, as when decoded at once.
    for (size_t leafDepth : {rpx::kMaxDepth, rpx::kMaxDepth + 1}) {
        Value nested(std::string(600, 'l'));
        for (size_t i = 1; i < leafDepth; ++i) nested = Value(Array{nested});
        std::vector<int> fds;
        auto deep = wire::encodeFrame(
            wire::Frame{wire::FrameKind::Reply, 8, dict({{"m", nested}, {"pad", std::string(5000, 'p')}})}, fds,
            rpx::kMaxDepth + 1);
        ASSERT_TRUE(deep);
        wire::FrameReader r(4 << 20, rpx::kMaxDepth);
        r.append(deep->data(), deep->size());
        wire::Frame deepFrame;
        EXPECT_EQ(r.next(deepFrame, error), leafDepth <= rpx::kMaxDepth ? wire::FrameReader::Status::Frame
                                                                  : wire::FrameReader::Status::Error)
            << leafDepth;
    }
}

// Encodings put together from parts (as the daemon sends its plug-in forms) decode to the value
// the parts make, whatever the order of a dictionary's entries.
// The UUIDs of a request's array are read from its encoding, as the decoded array would give them.
TEST(RpxWire, LeadingUuidsReadEncodedAndDecodedArraysAlike) {
    UUID a = *UUID::parse("A9A0A1B6-6E1B-4C4C-9F57-3A3E1D0C0001");
    UUID b = *UUID::parse("A9A0A1B6-6E1B-4C4C-9F57-3A3E1D0C0002");
    Array many(100, Value(a));  // large enough to arrive encoded
    many.push_back(Value(b));
    Array thenText = many;
    thenText.push_back(Value("not a uuid"));
    thenText.push_back(Value(a));
    struct Case {
        const char* name;
        Value array;
        size_t uuids;
        bool all;
    };
    const Case cases[] = {
        {"all UUIDs", Value(many), 101, true},
        {"a text among them", Value(thenText), 101, false},
        {"a text first", Value(Array{Value("x"), Value(a)}), 0, false},
        {"empty", Value(Array{}), 0, true},
        {"no array", Value("x"), 0, true},
    };
    for (const Case& c : cases) {
        // Once as sent in a large frame (kept encoded), once as a plain value.
        Value body = dict({{"uuids", c.array}, {"padding", std::string(8192, 'p')}});
        wire::Frame f = readFrame(frameBytes(wire::FrameKind::Request, 1, body));
        for (const Value* array : {&f.body["uuids"], &c.array}) {
            bool all = !c.all;
            std::vector<UUID> got = rpx::leadingUuids(*array, all);
            EXPECT_EQ(got.size(), c.uuids) << c.name;
            EXPECT_EQ(all, c.all) << c.name;
            if (got.size() == 101) {
                EXPECT_EQ(got.front(), a) << c.name;
                EXPECT_EQ(got.back(), b) << c.name;
            }
        }
    }
}

TEST(RpxWire, EncodingsPutTogetherFromPartsDecodeToTheirValue) {
    std::string entries;
    ASSERT_TRUE(wire::appendEntry(entries, "b", dict({{"x", Value(Array{Value(1)})}})));
    ASSERT_TRUE(wire::appendEntry(entries, "a", "text"));
    std::string whole;
    wire::appendArrayHeader(whole, 2);
    wire::appendDictionaryHeader(whole, 3);
    ASSERT_TRUE(wire::appendEntry(whole, "c", Value(false)));
    whole += entries;
    EXPECT_FALSE(wire::appendEntry(whole, "fd", Value(std::make_shared<FileDescriptor>(dup(0)))));
    ASSERT_TRUE(wire::appendElement(whole, "tail"));
    EXPECT_FALSE(wire::appendElement(whole, Value(std::make_shared<FileDescriptor>(dup(0)))));
    Value expected = Value(Array{dict({{"a", "text"}, {"b", dict({{"x", Value(Array{Value(1)})}})}, {"c", false}}), "tail"});
    EXPECT_EQ(wire::nestingOf(expected), 4u);
    Value made = wire::encodedContainer(std::make_shared<std::string>(whole), wire::nestingOf(expected),
                                        expected.kindsInside());
    EXPECT_EQ(made, expected);
    // Counted from the encoding, and from a decoded array alike.
    EXPECT_EQ(rpx::arrayCount(made), 2u);
    EXPECT_EQ(rpx::arrayCount(expected), 2u);
    EXPECT_EQ(rpx::arrayCount(Value("not an array")), 0u);
    Value body = dict({{"matches", made}});
    wire::Frame f = readFrame(frameBytes(wire::FrameKind::Reply, 1, body));
    EXPECT_EQ(f.body, dict({{"matches", expected}}));
    // Too deep for the encoder's limit, an encoded part is refused like any other value.
    std::vector<int> fds;
    EXPECT_FALSE(wire::encodeFrame(wire::Frame{wire::FrameKind::Reply, 1, body}, fds, 3));

    // The same bytes in pieces that others own: decoded alike, and copied into a small frame.
    auto owner = std::make_shared<std::string>(whole);
    Value::Encoding::Pieces pieces;
    for (size_t at = 0; at < owner->size(); at += 7)
        pieces.bytes.push_back(std::string_view(*owner).substr(at, 7));
    pieces.owners.push_back(owner);
    pieces.size = owner->size();
    Value inPieces = wire::encodedPieces(pieces, wire::nestingOf(expected), expected.kindsInside());
    EXPECT_EQ(inPieces, expected);
    auto small = wire::encodeFramePieces(wire::Frame{wire::FrameKind::Reply, 1, dict({{"matches", inPieces}})}, fds, 16);
    ASSERT_TRUE(small);
    EXPECT_EQ(small->pieces.size(), 1u);
    EXPECT_EQ(readFrame(small->joined()).body, dict({{"matches", expected}}));
}

// Many elements of 1 KiB in pieces: the array a match reply sends.
static Value largeArrayInPieces(size_t count, Value& expected) {
    auto header = std::make_shared<std::string>();
    wire::appendArrayHeader(*header, static_cast<uint32_t>(count));
    Value::Encoding::Pieces pieces;
    pieces.bytes.push_back(*header);
    pieces.owners.push_back(header);
    Array elements;
    for (size_t i = 0; i < count; ++i) {
        auto element = std::make_shared<std::string>();
        Value one = dict({{"n", Value(static_cast<int64_t>(i))}, {"pad", std::string(1000, 'a' + i % 26)}});
        wire::appendDictionaryHeader(*element, 2);
        wire::appendEntry(*element, "n", one["n"]);
        wire::appendEntry(*element, "pad", one["pad"]);
        pieces.bytes.push_back(*element);
        pieces.owners.push_back(element);
        elements.push_back(one);
    }
    pieces.size = header->size() + count * pieces.bytes.back().size();
    expected = Value(std::move(elements));
    return wire::encodedPieces(std::move(pieces), 2, expected.kindsInside());
}

TEST(RpxWire, LargeEncodingsInPiecesAreReferredToNotCopied) {
    Value expected;
    Value large = largeArrayInPieces(100, expected);
    std::vector<int> fds;
    auto frame = wire::encodeFramePieces(wire::Frame{wire::FrameKind::Reply, 9, dict({{"matches", large}})}, fds, 16);
    ASSERT_TRUE(frame);
    // The frame's own bytes before, the 101 pieces as they are kept, nothing after.
    ASSERT_EQ(frame->pieces.size(), 102u);
    EXPECT_EQ(frame->pieces[1].data(), large.encoding()->pieces->bytes[0].data());
    EXPECT_EQ(frame->pieces[101].data(), large.encoding()->pieces->bytes[100].data());
    wire::Frame f = readFrame(frame->joined());
    EXPECT_EQ(f.id, 9u);
    EXPECT_EQ(f.body, dict({{"matches", expected}}));
}

TEST(Rpx, TwoProcessesExchangeEveryKindIncludingDescriptors) {
    axtest::PlatformRoot root;
    axtest::Process server({axtest::binary("rpx_peer"), "server", "com.test.echo"});
    ASSERT_TRUE(server.waitForOut("ready")) << server.err();
    std::string file = root / "payload.txt";
    axtest::writeFile(file, "through the descriptor");
    auto client = axtest::run({axtest::binary("rpx_peer"), "client", "com.test.echo", file});
    EXPECT_EQ(client.status, 0) << client.err;
    EXPECT_EQ(client.out, "through the descriptor");
}

TEST(Rpx, RepliesAreBoundToTheirRequestsAndArriveOnTheChosenQueue) {
    axtest::PlatformRoot root;
    EchoServer server("com.test.bound");
    auto events = dispatch::Queue::create("test.events");
    auto replies = dispatch::Queue::create("test.replies");
    auto c = connectQuietly("com.test.bound", events);
    EXPECT_GT(c->pid(), 0);
    EXPECT_EQ(c->peer().pid, getpid());  // the server is this process
    constexpr int kCount = 200;
    std::atomic<int> good{0};
    std::atomic<int> calls{0};
    for (int i = 0; i < kCount; ++i) {
        c->sendWithReply(dict({{"n", i}}), replies, [&, i](const rpx::Reply& r) {
            ++calls;
            if (r.ok() && r.value["echo"]["n"] == Value(i) && replies->isCurrent()) ++good;
        });
    }
    EXPECT_TRUE(axtest::eventually([&] { return calls >= kCount; }));
    EXPECT_EQ(calls.load(), kCount);
    EXPECT_EQ(good.load(), kCount);
    // A large reply fits what a client accepts.
    server.replyPadding = 256 * 1024;
    auto big = c->sendWithReplySync(dict({{"big", true}}));
    ASSERT_TRUE(big.ok()) << big.description();
    EXPECT_EQ(big.value["pad"].asString()->size(), 256u * 1024);
    // So does one that the socket is given in thousands of pieces, many times its buffer.
    Value expected;
    {
        std::lock_guard lock(server.state->mutex);
        server.state->attachment = largeArrayInPieces(3000, expected);
    }
    auto pieces = c->sendWithReplySync(dict({{"pieces", true}}));
    ASSERT_TRUE(pieces.ok()) << pieces.description();
    EXPECT_EQ(pieces.value["attachment"], expected);
}

TEST(Rpx, AnUnreachableEndpointIsAnInvalidConnection) {
    axtest::PlatformRoot root;
    auto q = dispatch::Queue::create("test");
    Recorder rec;
    auto c = rpx::Connection::connect("com.test.nobody", q);
    c->setEventHandler([&](const rpx::Event& e) { rec.add(e); });
    c->resume();
    EXPECT_TRUE(rec.waitFor([](auto& ev) { return !ev.empty(); }));
    EXPECT_EQ(rec.count(rpx::ErrorKind::ConnectionInvalid), 1u);
    auto r = c->sendWithReplySync(dict({{"request", "add"}}));
    EXPECT_FALSE(r.ok());
    EXPECT_EQ(r.description(), "Connection invalid");
}

TEST(Rpx, ListenerReplacesAStaleSocketAndRefusesALiveOne) {
    axtest::PlatformRoot root;
    auto q = dispatch::Queue::create("test");
    {
        auto first = rpx::Listener::create("com.test.name", q);
        ASSERT_TRUE(first);
        auto second = rpx::Listener::create("com.test.name", q);
        ASSERT_FALSE(second);
        EXPECT_NE(second.error().description().find("already served by another process"), std::string::npos);
    }
    // A socket file nobody listens on (its owner died without cleaning up).
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    std::string path = rpx::endpointPath("com.test.stale");
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    close(fd);
    EXPECT_TRUE(axtest::exists(path));
    EXPECT_TRUE(rpx::Listener::create("com.test.stale", q));
    struct stat st {};
    stat((root.path() + "/run/user/" + std::to_string(getuid()) + "/rpx").c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
    EXPECT_FALSE(rpx::Listener::create("../escape", q));
}

TEST(Rpx, PeerDeathReachesTheListenerAsConnectionInvalid) {
    axtest::PlatformRoot root;
    EchoServer server("com.test.death");
    axtest::Process peer({axtest::binary("rpx_peer"), "hang", "com.test.death"});
    ASSERT_TRUE(server.recorder.waitFor([](auto& ev) { return !ev.empty(); }));
    auto killed = std::chrono::steady_clock::now();
    peer.signal(SIGKILL);
    ASSERT_TRUE(server.recorder.waitFor([](auto& ev) {
        return !ev.empty() && ev.back().error == rpx::ErrorKind::ConnectionInvalid;
    }));
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - killed);
    RecordProperty("invalid_after_ms", static_cast<int>(ms.count()));
    EXPECT_EQ(server.recorder.count(rpx::ErrorKind::ConnectionInvalid), 1u);
    // The peer's identity was taken from the kernel.
}

TEST(Rpx, SigtermDeliversTerminationImminentThenTheProcessExits) {
    axtest::PlatformRoot root;
    axtest::Process server({axtest::binary("rpx_peer"), "server", "com.test.term"});
    ASSERT_TRUE(server.waitForOut("ready"));
    auto q = dispatch::Queue::create("test");
    Recorder rec;
    auto c = rpx::Connection::connect("com.test.term", q);
    c->setEventHandler([&](const rpx::Event& e) { rec.add(e); });
    c->resume();
    ASSERT_TRUE(c->sendWithReplySync(dict({{"hi", 1}})).ok());
    server.signal(SIGTERM);
    EXPECT_EQ(server.wait(5s), 0);
    EXPECT_NE(server.out().find("termination imminent"), std::string::npos);
    EXPECT_TRUE(rec.waitFor([](auto& ev) { return !ev.empty(); }));
    EXPECT_EQ(rec.count(rpx::ErrorKind::ConnectionInvalid), 1u);
}

TEST(Rpx, BadPeersEndOnlyTheirOwnConnection) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    EchoServer server("com.test.bad");
    auto q = dispatch::Queue::create("test");
    auto good = connectQuietly("com.test.bad", q);

    std::string request = frameBytes(wire::FrameKind::Request, 1, dict({{"x", 1}}));
    struct Case {
        const char* name;
        std::string bytes;
    };
    const Case cases[] = {
        {"garbage", std::string(64, '\x7f')},
        {"half a frame, then gone", request.substr(0, request.size() / 2)},
        {"a frame past the listener's limit", frameBytes(wire::FrameKind::Request, 2,
                                                         Value(std::string(5u << 20, 'x')))},
    };
    for (const auto& c : cases) {
        int fd = rawConnect("com.test.bad");
        ASSERT_GE(fd, 0);
        (void)!write(fd, c.bytes.data(), c.bytes.size());
        close(fd);
        auto r = good->sendWithReplySync(dict({{"still", c.name}}));
        ASSERT_TRUE(r.ok()) << c.name;
        EXPECT_EQ(r.value["echo"]["still"], Value(c.name));
    }
    EXPECT_TRUE(server.recorder.waitFor([](auto& ev) {
        size_t n = 0;
        for (auto& e : ev)
            if (e.error == rpx::ErrorKind::ConnectionInvalid) ++n;
        return n == 3;
    }));
    EXPECT_GE(capture.count("rpx: closing connection to pid"), 2u);

    // A request written one byte at a time is still one request.
    int fd = rawConnect("com.test.bad");
    for (char b : request) {
        (void)!write(fd, &b, 1);
        std::this_thread::sleep_for(200us);
    }
    char header[wire::kHeaderSize];
    EXPECT_EQ(read(fd, header, sizeof header), static_cast<ssize_t>(sizeof header));
    EXPECT_EQ(header[4], static_cast<char>(wire::FrameKind::Reply));
    close(fd);
}

TEST(Rpx, APeerThatNeverReadsIsNotServedFurther) {
    axtest::PlatformRoot root;
    EchoServer server("com.test.slow");
    // Large replies stop it by their bytes (a few megabytes), small ones by their number: either
    // way a few hundred requests are served, not the whole burst.
    struct Case {
        const char* name;
        size_t padding;
        int requests;
        int mostServed;
    };
    const Case cases[] = {{"64 KiB replies", 64 * 1024, 2000, 400}, {"small replies", 0, 20000, 2000}};
    std::string request = frameBytes(wire::FrameKind::Request, 1, dict({{"x", 1}}));
    for (const auto& c : cases) {
        server.replyPadding = c.padding;
        int servedBefore = server.requests.load();
        int fd = rawConnect("com.test.slow");
        ASSERT_GE(fd, 0);
        std::string burst;
        for (int i = 0; i < c.requests; ++i) {
            burst += frameBytes(wire::FrameKind::Request, static_cast<uint64_t>(i + 1), dict({{"x", 1}}));
        }
        // The socket fills up and writes would block.
        (void)writeWithoutReading(fd, burst, 200);
        std::this_thread::sleep_for(200ms);
        int served = server.requests.load() - servedBefore;
        EXPECT_LT(served, c.mostServed) << c.name;
        // Another client is served meanwhile.
        auto q = dispatch::Queue::create("test");
        auto other = connectQuietly("com.test.slow", q);
        EXPECT_TRUE(other->sendWithReplySync(dict({{"y", 2}})).ok()) << c.name;
        close(fd);
    }
}

TEST(Rpx, OutstandingWorkIsCounted) {
    uint64_t before = rpx::outstandingWork();
    rpx::beginWork();
    rpx::beginWork();
    EXPECT_EQ(rpx::outstandingWork(), before + 2);
    rpx::endWork();
    rpx::endWork();
    EXPECT_EQ(rpx::outstandingWork(), before);
}

TEST(Rpx, ContextFinalizerRunsWhenTheConnectionGoes) {
    axtest::PlatformRoot root;
    EchoServer server("com.test.ctx");
    auto q = dispatch::Queue::create("test");
    std::atomic<int> finalized{0};
    {
        auto c = rpx::Connection::connect("com.test.ctx", q);
        c->setContext(std::make_shared<int>(5), [&](std::shared_ptr<void> ctx) {
            if (ctx && *static_cast<int*>(ctx.get()) == 5) ++finalized;
        });
        c->resume();
    }
    EXPECT_EQ(finalized.load(), 1);
}

// Handlers that run without a delivery queue still see one connection's events one at a time and
// in order, whichever thread makes them ready: here replies come from another queue, and a client
// that floods the server makes reading pause and resume from that queue's replies.
TEST(Rpx, InlineDeliveryKeepsEventsInOrderAndNeverOverlaps) {
    axtest::PlatformRoot root;
    auto listenerQueue = dispatch::Queue::create("test.listener");
    auto replies = dispatch::Queue::create("test.replies");
    auto listener = rpx::Listener::create("com.test.inline", listenerQueue);
    ASSERT_TRUE(listener);
    (*listener)->setInlineDelivery(true);
    struct Seen {
        std::atomic<int> inside{0};
        std::atomic<bool> overlapped{false};
        std::mutex m;
        std::vector<int64_t> order;
        Recorder ends;
    };
    auto seen = std::make_shared<Seen>();
    (*listener)->setConnectionHandler([seen, replies](rpx::ConnectionPtr c) {
        std::weak_ptr<rpx::Connection> weak = c;
        c->setEventHandler([seen, replies, weak](const rpx::Event& ev) {
            if (seen->inside.fetch_add(1) != 0) seen->overlapped = true;
            if (ev.isError()) {
                seen->ends.add(ev);
            } else {
                std::lock_guard lock(seen->m);
                seen->order.push_back(*ev.message["n"].int64Value());
            }
            if (ev.wantsReply) {
                replies->async([weak, ev] {
                    if (auto conn = weak.lock()) conn->sendReply(ev.messageId, ev.message);
                });
            }
            std::this_thread::yield();
            seen->inside.fetch_sub(1);
        });
        c->resume();
    });
    (*listener)->resume();

    auto q = dispatch::Queue::create("test.client");
    auto c = connectQuietly("com.test.inline", q);
    constexpr int kCount = 3000;
    std::atomic<int> answered{0};
    for (int i = 0; i < kCount; ++i) {
        if (i % 2) {
            c->send(dict({{"n", i}}));
        } else {
            c->sendWithReply(dict({{"n", i}}), q, [&](const rpx::Reply& r) {
                if (r.ok()) ++answered;
            });
        }
    }
    auto last = c->sendWithReplySync(dict({{"n", kCount}}));
    ASSERT_TRUE(last.ok());
    EXPECT_EQ(last.value, dict({{"n", kCount}}));
    EXPECT_TRUE(axtest::eventually([&] { return answered >= kCount / 2; }));
    EXPECT_EQ(answered.load(), kCount / 2);
    c->cancel();
    EXPECT_TRUE(seen->ends.waitFor([](const auto& events) { return !events.empty(); }));
    EXPECT_FALSE(seen->overlapped.load());
    std::lock_guard lock(seen->m);
    ASSERT_EQ(seen->order.size(), static_cast<size_t>(kCount + 1));
    for (int i = 0; i <= kCount; ++i) EXPECT_EQ(seen->order[static_cast<size_t>(i)], i);
    EXPECT_EQ(seen->ends.count(rpx::ErrorKind::ConnectionInvalid), 1u);
}

// A synchronous wait reads its reply on the waiting thread. Whoever reads, every waiter gets its
// own reply: several threads waiting at once on one connection, a reply followed at once by the
// peer's exit, and a cancel while nothing will ever answer.
TEST(Rpx, SynchronousWaitsGetTheirOwnRepliesWhoeverReads) {
    axtest::PlatformRoot root;
    EchoServer server("com.test.sync");
    auto q = dispatch::Queue::create("test.client");
    auto c = connectQuietly("com.test.sync", q);
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 300; ++i) {
                Value body = dict({{"t", t}, {"i", i}});
                auto r = c->sendWithReplySync(body);
                if (!r.ok() || r.value["echo"] != body) ++wrong;
            }
        });
    }
    for (auto& th : threads) th.join();
    EXPECT_EQ(wrong.load(), 0);

    // A peer that answers and hangs up at once: the reply is still read.
    std::string reply = frameBytes(wire::FrameKind::Reply, 1, dict({{"last", true}}));
    for (int round = 0; round < 20; ++round) {
        std::string name = "com.test.hangup" + std::to_string(round);
        std::string path = rpx::endpointPath(name);
        int listenFd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr {};
        addr.sun_family = AF_UNIX;
        std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
        ASSERT_EQ(bind(listenFd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        ASSERT_EQ(listen(listenFd, 1), 0);
        std::thread peer([&] {
            int s = accept(listenFd, nullptr, nullptr);
            char buf[256];
            (void)!read(s, buf, sizeof buf);  // the request, in one piece
            (void)!write(s, reply.data(), reply.size());
            close(s);
        });
        auto once = connectQuietly(name, q);
        auto r = once->sendWithReplySync(dict({{"x", 1}}));
        EXPECT_TRUE(r.ok()) << "round " << round << ": " << r.description();
        peer.join();
        close(listenFd);
    }

    // Nobody answers; a cancel from another thread ends the wait.
    int silent = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    std::string path = rpx::endpointPath("com.test.silent");
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(bind(silent, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ASSERT_EQ(listen(silent, 1), 0);
    auto waiting = connectQuietly("com.test.silent", q);
    std::thread canceller([&] {
        std::this_thread::sleep_for(50ms);
        waiting->cancel();
    });
    auto start = std::chrono::steady_clock::now();
    auto r = waiting->sendWithReplySync(dict({{"x", 1}}));
    EXPECT_EQ(r.error, rpx::ErrorKind::ConnectionInvalid);
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
    canceller.join();
    close(silent);
}

// Each way of abusing a connection ends that connection, frees what it held, and leaves the
// listener serving the others.
TEST(Rpx, AbusivePeersAreCutOffAndWhatTheyHeldIsFreed) {
    ASSERT_TRUE(kSmallLimits);
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    EchoServer server("com.test.abuse");
    auto q = dispatch::Queue::create("test");
    auto good = connectQuietly("com.test.abuse", q);
    auto stillServed = [&](const char* after) {
        auto r = good->sendWithReplySync(dict({{"after", after}}));
        EXPECT_TRUE(r.ok()) << after;
    };

    // Descriptors sent with a frame that names none are closed at once, with the connection.
    stillServed("the start");  // whatever a first exchange opens is open before the count
    size_t before = openDescriptors();
    int fd = rawConnect("com.test.abuse");
    std::string message = frameBytes(wire::FrameKind::Message, 1, dict({{"x", 1}}));
    int passed[3] = {::open("/dev/null", O_RDONLY), ::open("/dev/null", O_RDONLY), ::open("/dev/null", O_RDONLY)};
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof passed)];
    struct iovec iov {message.data(), message.size()};
    struct msghdr msg {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof passed);
    std::memcpy(CMSG_DATA(c), passed, sizeof passed);
    ASSERT_GT(sendmsg(fd, &msg, 0), 0);
    for (int f : passed) ::close(f);
    EXPECT_TRUE(closedByPeer(fd));
    ::close(fd);
    EXPECT_TRUE(axtest::eventually([&] { return openDescriptors() <= before; })) << openDescriptors() << " > " << before;
    EXPECT_TRUE(capture.contains("descriptors that no frame names"));
    stillServed("unclaimed descriptors");

    // A second request under the id of one still waiting for its reply.
    auto holding = rpx::Listener::create("com.test.holding", dispatch::Queue::create("test.holding"));
    ASSERT_TRUE(holding);
    (*holding)->setConnectionHandler([](rpx::ConnectionPtr conn) {
        conn->setEventHandler([conn](const rpx::Event&) {});  // never replies
        conn->resume();
    });
    (*holding)->resume();
    fd = rawConnect("com.test.holding");
    std::string twice = frameBytes(wire::FrameKind::Request, 7, dict({})) + frameBytes(wire::FrameKind::Request, 7, dict({}));
    ASSERT_EQ(write(fd, twice.data(), twice.size()), static_cast<ssize_t>(twice.size()));
    EXPECT_TRUE(closedByPeer(fd));
    ::close(fd);
    EXPECT_TRUE(capture.contains("request id 7 is already waiting for its reply"));

    // Half a frame and then silence: ended after the limit (1 s here).
    fd = rawConnect("com.test.abuse");
    std::string request = frameBytes(wire::FrameKind::Request, 1, dict({{"x", 1}}));
    ASSERT_EQ(write(fd, request.data(), 10), 10);
    EXPECT_TRUE(closedByPeer(fd, 5s));
    ::close(fd);
    EXPECT_TRUE(capture.contains("was not finished"));
    stillServed("a partial frame");

    // More connections from one process than the limit (8 here): the extra ones are closed.
    std::vector<int> many;
    for (int i = 0; i < 12; ++i) many.push_back(rawConnect("com.test.abuse"));
    size_t closed = 0;
    for (int f : many) closed += closedByPeer(f, 300ms) ? 1 : 0;
    for (int f : many) ::close(f);
    EXPECT_GE(closed, 4u);  // the good client holds one of the eight
    EXPECT_TRUE(capture.contains("reached its limit of connections"));
    EXPECT_TRUE(axtest::eventually([&] {
        auto r = good->sendWithReplySync(dict({{"after", "too many connections"}}));
        return r.ok();
    }));
}

// A process that keeps breaking the protocol is refused new connections for a while: they are
// closed unread, while its connections already set up are served, and the bar ends by itself.
TEST(Rpx, AProcessThatKeepsBreakingTheProtocolIsBarredForAWhile) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    EchoServer server("com.test.barred");
    auto q = dispatch::Queue::create("test");
    auto good = connectQuietly("com.test.barred", q);
    ASSERT_TRUE(good->sendWithReplySync(dict({{"before", true}})).ok());

    std::string barred = "refusing new connections of pid " + std::to_string(getpid());
    std::string garbage(64, '\x7f');
    for (int i = 0; i < 9 && !capture.contains(barred); ++i) {
        int fd = rawConnect("com.test.barred");
        ASSERT_GE(fd, 0);
        (void)!send(fd, garbage.data(), garbage.size(), MSG_NOSIGNAL);  // it may be closed already
        EXPECT_TRUE(closedByPeer(fd));
        ::close(fd);
    }
    ASSERT_TRUE(capture.contains(barred));
    int served = server.requests.load();
    int fd = rawConnect("com.test.barred");
    std::string request = frameBytes(wire::FrameKind::Request, 1, dict({{"x", 1}}));
    (void)!send(fd, request.data(), request.size(), MSG_NOSIGNAL);
    EXPECT_TRUE(closedByPeer(fd));
    ::close(fd);
    EXPECT_EQ(server.requests.load(), served);

    auto r = good->sendWithReplySync(dict({{"during", true}}));
    EXPECT_TRUE(r.ok());
    EXPECT_TRUE(axtest::eventually(
        [&] {
            auto later = connectQuietly("com.test.barred", q);
            return later->sendWithReplySync(dict({{"after", true}})).ok();
        },
        3s));
}

// Messages that expect no reply count as work until their handler's copies of them are gone: a
// flood of them stops being read while the work waits.
TEST(Rpx, MessagesWithoutRepliesAreBackPressuredToo) {
    axtest::PlatformRoot root;
    auto listener = rpx::Listener::create("com.test.noreply", dispatch::Queue::create("test.listener"));
    ASSERT_TRUE(listener);
    struct Pending {
        std::mutex m;
        std::vector<rpx::Event> events;
    };
    auto pending = std::make_shared<Pending>();
    (*listener)->setConnectionHandler([pending](rpx::ConnectionPtr conn) {
        conn->setEventHandler([pending](const rpx::Event& ev) {
            if (ev.isError()) return;
            std::lock_guard lock(pending->m);
            pending->events.push_back(ev);  // the work waits here, holding the event
        });
        conn->resume();
    });
    (*listener)->resume();
    int fd = rawConnect("com.test.noreply");
    std::string message = frameBytes(wire::FrameKind::Message, 1, dict({{"x", 1}}));
    std::string burst;
    for (int i = 0; i < 5000; ++i) burst += message;
    size_t written = writeWithoutReading(fd, burst, 100);
    std::this_thread::sleep_for(200ms);
    size_t taken;
    {
        std::lock_guard lock(pending->m);
        taken = pending->events.size();
    }
    EXPECT_LE(taken, 300u) << "of 5000";
    // Finishing the work lets the rest in.
    {
        std::lock_guard lock(pending->m);
        pending->events.clear();
    }
    size_t sent = written / message.size();
    EXPECT_TRUE(axtest::eventually([&] {
        std::lock_guard lock(pending->m);
        taken += pending->events.size();
        pending->events.clear();
        return taken >= sent;
    })) << taken << " of " << sent;
    ::close(fd);
}

// A peer sending large frames one after another is read at its allowance (2 MiB a second here,
// after a burst of as much), and nothing it sent is lost.
TEST(Rpx, LargeFramesAreReadAtTheirConnectionsAllowance) {
    axtest::PlatformRoot root;
    auto listener = rpx::Listener::create("com.test.allowance", dispatch::Queue::create("test.listener"));
    ASSERT_TRUE(listener);
    std::atomic<int> taken{0};
    (*listener)->setConnectionHandler([&taken](rpx::ConnectionPtr conn) {
        conn->setEventHandler([&taken](const rpx::Event& ev) {
            if (!ev.isError()) ++taken;
        });
        conn->resume();
    });
    (*listener)->resume();
    int fd = rawConnect("com.test.allowance");
    std::string frame = frameBytes(wire::FrameKind::Message, 1, dict({{"x", Value::data(std::string(1 << 20, 'x').data(), 1 << 20)}}));
    std::string all;
    for (int i = 0; i < 6; ++i) all += frame;
    std::thread writer([&] {
        for (size_t done = 0; done < all.size();) {
            ssize_t n = write(fd, all.data() + done, all.size() - done);
            if (n <= 0) return;
            done += static_cast<size_t>(n);
        }
    });
    std::this_thread::sleep_for(500ms);
    EXPECT_LE(taken.load(), 4) << "2 MiB at once, then 2 MiB a second";
    EXPECT_TRUE(axtest::eventually([&] { return taken.load() == 6; })) << taken.load() << " of 6";
    writer.join();
    ::close(fd);
}

// Peers that never read are bounded one by one (reading stops) and all together: past the limit for
// all queued replies (16 MiB here), those holding the most are dropped.
TEST(Rpx, NonReadingPeersAreBoundedTogether) {
    axtest::PlatformRoot root;
    log::CaptureSink capture;
    EchoServer server("com.test.hoarders");
    server.replyPadding = 512 * 1024;
    std::string request = frameBytes(wire::FrameKind::Request, 1, dict({{"x", 1}}));
    std::vector<int> hoarders;
    for (int p = 0; p < 6; ++p) {
        int fd = rawConnect("com.test.hoarders");
        fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
        for (uint64_t id = 1; id <= 40; ++id) {
            std::string r = frameBytes(wire::FrameKind::Request, id, dict({{"x", 1}}));
            (void)!write(fd, r.data(), r.size());
        }
        hoarders.push_back(fd);
    }
    EXPECT_TRUE(axtest::eventually([&] { return capture.contains("bytes of replies it does not read"); }));
    auto q = dispatch::Queue::create("test");
    auto good = connectQuietly("com.test.hoarders", q);
    EXPECT_TRUE(good->sendWithReplySync(dict({{"y", 2}})).ok());
    for (int fd : hoarders) ::close(fd);
}
