// Internal: the frame and value encoding of rpx (docs/rpx-wire.md). Kept apart from the sockets so
// that the decoder can be tested and fuzzed on bytes alone.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Value.h"

namespace corvane::rpx::wire {

enum class FrameKind : uint8_t { Message = 1, Request = 2, Reply = 3 };

inline constexpr size_t kHeaderSize = 16;
// The most descriptors one frame may carry (the kernel's limit for one message).
inline constexpr size_t kMaxFrameDescriptors = 253;

struct Frame {
    FrameKind kind = FrameKind::Message;
    uint64_t id = 0;
    Value body;
};

// Encodes a frame. The descriptors inside `body` are appended to `fds`, in the order the payload
// refers to them; they travel with the frame's bytes. Fails (nullopt) for values nested deeper than
// `maxDepth`.
std::optional<std::string> encodeFrame(const Frame& frame, std::vector<int>& fds, size_t maxDepth);

// Decodes one value; `fds` are the frame's descriptors. nullopt when malformed.
std::optional<Value> decodeValue(std::string_view payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth);

// Reassembles frames from a byte stream that arrives in pieces of any size, with the descriptors
// that arrived alongside.
class FrameReader {
public:
    FrameReader(size_t maxFrame, size_t maxDepth) : maxFrame_(maxFrame), maxDepth_(maxDepth) {}

    void append(const char* bytes, size_t size) { buffer_.append(bytes, size); }
    void appendFd(std::shared_ptr<FileDescriptor> fd) { fds_.push_back(std::move(fd)); }
    void setMaxFrame(size_t bytes) { maxFrame_ = bytes; }

    enum class Status { Frame, NeedMore, Error };
    // The next complete frame, NeedMore, or Error with `error` set (the stream cannot go on).
    Status next(Frame& frame, std::string& error);

    size_t buffered() const { return buffer_.size() - offset_; }
    // True when descriptors arrived that the frame being read does not name (or, before its
    // header is complete, more than any frame may carry).
    bool holdsUnclaimedDescriptors() const;
    // Drops what is buffered, bytes and descriptors, giving the memory back.
    void clear();

private:
    size_t maxFrame_;
    size_t maxDepth_;
    std::string buffer_;
    size_t offset_ = 0;
    std::deque<std::shared_ptr<FileDescriptor>> fds_;
};

}  // namespace corvane::rpx::wire
