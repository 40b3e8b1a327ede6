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
    size_t bytes = 0;  // of the frame on the wire, header included; set by FrameReader
};

// Encodes a frame. The descriptors inside `body` are appended to `fds`, in the order the payload
// refers to them; they travel with the frame's bytes. Fails (nullopt) for values nested deeper than
// `maxDepth`.
std::optional<std::string> encodeFrame(const Frame& frame, std::vector<int>& fds, size_t maxDepth);

// A frame as the socket is given it: the pieces one after the other. Encoded values of 16 KiB and
// more are not copied into it but referred to where they are kept, and kept alive by `owners`.
struct FrameBytes {
    std::vector<std::string_view> pieces;
    std::vector<std::shared_ptr<const void>> owners;
    size_t size = 0;  // of all pieces together
    std::string joined() const;
};
std::optional<FrameBytes> encodeFramePieces(const Frame& frame, std::vector<int>& fds, size_t maxDepth);

// Decodes one value; `fds` are the frame's descriptors. nullopt when malformed.
std::optional<Value> decodeValue(std::string_view payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth);

// The same for a payload that the decoded value may keep: large values of the body and large
// elements of those (dictionaries and arrays of 512 bytes and more, without descriptors) are
// checked now and decoded when first looked at. Frames of 4 KiB and more are decoded so.
std::optional<Value> decodeValue(std::shared_ptr<const std::string> payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth);

// ---- encodings put together from parts
// For a sender that keeps parts of its messages encoded once and sends them many times. The
// entries of a dictionary may come in any order; a key that comes twice keeps its last value.

void appendArrayHeader(std::string& out, uint32_t count);
void appendDictionaryHeader(std::string& out, uint32_t count);
// Appends one dictionary entry, its key and value; false (and nothing appended) for a value that
// holds a descriptor.
bool appendEntry(std::string& out, std::string_view key, const Value& value);
// Appends one array element; false (and nothing appended) for a value that holds a descriptor.
bool appendElement(std::string& out, const Value& value);
// How deep values nest inside `value`: 0 for a scalar or an empty container, 1 for a container of
// scalars, and so on.
size_t nestingOf(const Value& value);
// A dictionary or array given by `bytes`, one whole encoding without descriptors: an encoder copies
// it, and it is decoded when first looked at. `nesting` and `kindsInside` describe its contents
// (Value::Encoding).
Value encodedContainer(std::shared_ptr<const std::string> bytes, size_t nesting, uint32_t kindsInside);
// The same for an encoding put together from pieces that others keep (Value::Encoding::Pieces):
// a frame refers to them where they are, without copying.
Value encodedPieces(Value::Encoding::Pieces pieces, size_t nesting, uint32_t kindsInside);

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
