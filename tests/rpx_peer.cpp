// A second process for the rpx tests.
//   rpx_peer server NAME        serves NAME, answering each request with {"echo": request};
//                               prints "ready" once listening and "termination imminent" when
//                               that event reaches a connection
//   rpx_peer client NAME FILE   sends one message of every kind (FILE passed as a descriptor),
//                               checks the echo and reads FILE through the returned descriptor
//   rpx_peer hang NAME          connects, sends one request and waits to be killed
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "platform/rpx/Rpx.h"

using namespace corvane;

static int server(const std::string& name) {
    rpx::handleTermination();
    auto queue = dispatch::Queue::create("peer");
    auto listener = rpx::Listener::create(name, queue);
    if (!listener) {
        std::fprintf(stderr, "%s\n", listener.error().description().c_str());
        return 1;
    }
    (*listener)->setConnectionHandler([](rpx::ConnectionPtr c) {
        std::weak_ptr<rpx::Connection> weak = c;
        c->setEventHandler([weak](const rpx::Event& ev) {
            auto conn = weak.lock();
            if (ev.error == rpx::ErrorKind::TerminationImminent) {
                std::printf("termination imminent\n");
                std::fflush(stdout);
            } else if (!ev.isError() && ev.wantsReply && conn) {
                conn->sendReply(ev.messageId, dict({{"echo", ev.message}}));
            }
        });
        c->resume();
    });
    (*listener)->resume();
    std::printf("ready\n");
    std::fflush(stdout);
    for (;;) pause();
}

static int client(const std::string& name, const std::string& file) {
    auto queue = dispatch::Queue::create("client");
    auto c = rpx::Connection::connect(name, queue);
    c->setEventHandler([](const rpx::Event&) {});
    c->resume();
    int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 2;
    Value message = dict({
        {"null", Value()}, {"bool", true}, {"int", int64_t{-7}}, {"uint", uint64_t{7}},
        {"double", 0.5}, {"string", "héllo"}, {"data", Value::data("\0\1\2", 3)},
        {"date", Value(Date{1795341600123456})}, {"uuid", Value(UUID::random())},
        {"array", Value(Array{Value(1), Value(Array{}), dict({})})},
        {"fd", Value(std::make_shared<FileDescriptor>(fd))},
    });
    rpx::Reply reply = c->sendWithReplySync(message);
    if (!reply.ok()) {
        std::fprintf(stderr, "no reply: %s\n", reply.description().c_str());
        return 3;
    }
    const Value& echo = reply.value["echo"];
    if (!(echo == message)) {
        std::fprintf(stderr, "echo differs: %s\n", echo.description().c_str());
        return 4;
    }
    for (const char* k : {"int", "uint", "double", "bool"}) {
        if (echo[k].kind() != message[k].kind()) return 5;
    }
    char buf[64] = {};
    int returned = (*echo["fd"].asFd())->get();
    if (pread(returned, buf, sizeof buf - 1, 0) < 0) return 6;
    std::printf("%s", buf);
    return 0;
}

static int hang(const std::string& name) {
    auto queue = dispatch::Queue::create("client");
    auto c = rpx::Connection::connect(name, queue);
    c->resume();
    c->send(dict({{"hello", 1}}));
    std::printf("sent\n");
    std::fflush(stdout);
    for (;;) pause();
}

int main(int argc, char** argv) {
    if (argc >= 3 && std::strcmp(argv[1], "server") == 0) return server(argv[2]);
    if (argc >= 4 && std::strcmp(argv[1], "client") == 0) return client(argv[2], argv[3]);
    if (argc >= 3 && std::strcmp(argv[1], "hang") == 0) return hang(argv[2]);
    std::fprintf(stderr, "usage: rpx_peer server NAME | client NAME FILE | hang NAME\n");
    return 64;
}
