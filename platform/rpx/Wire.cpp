#include "platform/rpx/Wire.h"

#include <cstring>

namespace corvane::rpx::wire {

namespace {

enum Tag : uint8_t {
    kNull = 0,
    kFalse = 1,
    kTrue = 2,
    kInt64 = 3,
    kUInt64 = 4,
    kDouble = 5,
    kString = 6,
    kData = 7,
    kDate = 8,
    kUUID = 9,
    kArray = 10,
    kDictionary = 11,
    kFd = 12,
};

void put32(std::string& out, uint32_t v) {
    for (int i = 0; i < 4; ++i) out.push_back(static_cast<char>(v >> (8 * i)));
}
void put64(std::string& out, uint64_t v) {
    for (int i = 0; i < 8; ++i) out.push_back(static_cast<char>(v >> (8 * i)));
}
uint64_t get(std::string_view s, size_t at, int bytes) {
    uint64_t v = 0;
    for (int i = 0; i < bytes; ++i) v |= uint64_t{static_cast<uint8_t>(s[at + i])} << (8 * i);
    return v;
}

bool encode(std::string& out, const Value& v, std::vector<int>& fds, size_t depth, size_t maxDepth) {
    if (depth > maxDepth) return false;
    using K = Value::Kind;
    switch (v.kind()) {
        case K::Null: out.push_back(kNull); break;
        case K::Bool: out.push_back(*v.boolValue() ? kTrue : kFalse); break;
        case K::Int64:
            out.push_back(kInt64);
            put64(out, static_cast<uint64_t>(*v.int64Value()));
            break;
        case K::UInt64:
            out.push_back(kUInt64);
            put64(out, *v.uint64Value());
            break;
        case K::Double: {
            out.push_back(kDouble);
            double d = *v.doubleValue();
            uint64_t bits;
            std::memcpy(&bits, &d, 8);
            put64(out, bits);
            break;
        }
        case K::String:
            out.push_back(kString);
            put32(out, static_cast<uint32_t>(v.asString()->size()));
            out += *v.asString();
            break;
        case K::Data:
            out.push_back(kData);
            put32(out, static_cast<uint32_t>(v.asData()->size()));
            out.append(reinterpret_cast<const char*>(v.asData()->data()), v.asData()->size());
            break;
        case K::Date:
            out.push_back(kDate);
            put64(out, static_cast<uint64_t>(v.asDate()->micros));
            break;
        case K::UUID:
            out.push_back(kUUID);
            out.append(reinterpret_cast<const char*>(v.asUUID()->bytes.data()), 16);
            break;
        case K::Array:
            out.push_back(kArray);
            put32(out, static_cast<uint32_t>(v.asArray()->size()));
            for (const Value& e : *v.asArray())
                if (!encode(out, e, fds, depth + 1, maxDepth)) return false;
            break;
        case K::Dictionary:
            out.push_back(kDictionary);
            put32(out, static_cast<uint32_t>(v.asDictionary()->size()));
            for (const auto& [key, e] : *v.asDictionary()) {
                put32(out, static_cast<uint32_t>(key.size()));
                out += key;
                if (!encode(out, e, fds, depth + 1, maxDepth)) return false;
            }
            break;
        case K::Fd:
            out.push_back(kFd);
            put32(out, static_cast<uint32_t>(fds.size()));
            fds.push_back((*v.asFd())->get());
            break;
    }
    return true;
}

class Decoder {
public:
    Decoder(std::string_view s, const std::vector<std::shared_ptr<FileDescriptor>>& fds,
            size_t maxDepth)
        : s_(s), fds_(fds), maxDepth_(maxDepth) {}

    std::optional<Value> all() {
        auto v = value(0);
        if (!v || pos_ != s_.size()) return std::nullopt;
        return v;
    }

private:
    std::string_view s_;
    const std::vector<std::shared_ptr<FileDescriptor>>& fds_;
    size_t maxDepth_;
    size_t pos_ = 0;

    bool has(size_t n) const { return n <= s_.size() - pos_; }
    std::optional<uint64_t> take(int bytes) {
        if (!has(static_cast<size_t>(bytes))) return std::nullopt;
        uint64_t v = get(s_, pos_, bytes);
        pos_ += static_cast<size_t>(bytes);
        return v;
    }
    std::optional<std::string> text() {
        auto n = take(4);
        if (!n || !has(*n)) return std::nullopt;
        std::string s(s_.substr(pos_, *n));
        pos_ += *n;
        if (!isValidUtf8(s)) return std::nullopt;
        return s;
    }

    std::optional<Value> value(size_t depth) {
        if (depth > maxDepth_ || !has(1)) return std::nullopt;
        auto tag = static_cast<uint8_t>(s_[pos_++]);
        switch (tag) {
            case kNull: return Value();
            case kFalse: return Value(false);
            case kTrue: return Value(true);
            case kInt64: {
                auto v = take(8);
                if (!v) return std::nullopt;
                return Value(static_cast<int64_t>(*v));
            }
            case kUInt64: {
                auto v = take(8);
                if (!v) return std::nullopt;
                return Value(*v);
            }
            case kDouble: {
                auto v = take(8);
                if (!v) return std::nullopt;
                double d;
                std::memcpy(&d, &*v, 8);
                return Value(d);
            }
            case kString: {
                auto s = text();
                if (!s) return std::nullopt;
                return Value(std::move(*s));
            }
            case kData: {
                auto n = take(4);
                if (!n || !has(*n)) return std::nullopt;
                Value v = Value::data(s_.data() + pos_, *n);
                pos_ += *n;
                return v;
            }
            case kDate: {
                auto v = take(8);
                if (!v) return std::nullopt;
                return Value(Date{static_cast<int64_t>(*v)});
            }
            case kUUID: {
                if (!has(16)) return std::nullopt;
                UUID u;
                std::memcpy(u.bytes.data(), s_.data() + pos_, 16);
                pos_ += 16;
                return Value(u);
            }
            case kArray: {
                auto n = take(4);
                // Every element takes at least one byte: a count past the rest is a lie.
                if (!n || !has(*n)) return std::nullopt;
                Array a;
                a.reserve(*n);
                for (uint64_t i = 0; i < *n; ++i) {
                    auto e = value(depth + 1);
                    if (!e) return std::nullopt;
                    a.push_back(std::move(*e));
                }
                return Value(std::move(a));
            }
            case kDictionary: {
                auto n = take(4);
                if (!n || !has(*n * 5)) return std::nullopt;
                Dictionary d;
                for (uint64_t i = 0; i < *n; ++i) {
                    auto key = text();
                    if (!key) return std::nullopt;
                    auto e = value(depth + 1);
                    if (!e) return std::nullopt;
                    d.insert_or_assign(std::move(*key), std::move(*e));
                }
                return Value(std::move(d));
            }
            case kFd: {
                auto index = take(4);
                if (!index || *index >= fds_.size()) return std::nullopt;
                return Value(fds_[*index]);
            }
            default: return std::nullopt;
        }
    }
};

}  // namespace

std::optional<std::string> encodeFrame(const Frame& frame, std::vector<int>& fds, size_t maxDepth) {
    std::string out(kHeaderSize, '\0');
    size_t firstFd = fds.size();
    if (!encode(out, frame.body, fds, 0, maxDepth)) return std::nullopt;
    size_t payload = out.size() - kHeaderSize;
    if (payload > UINT32_MAX || fds.size() - firstFd > UINT16_MAX) return std::nullopt;
    std::string header;
    put32(header, static_cast<uint32_t>(payload));
    header.push_back(static_cast<char>(frame.kind));
    header.push_back(0);
    auto count = static_cast<uint16_t>(fds.size() - firstFd);
    header.push_back(static_cast<char>(count & 0xff));
    header.push_back(static_cast<char>(count >> 8));
    put64(header, frame.id);
    out.replace(0, kHeaderSize, header);
    return out;
}

std::optional<Value> decodeValue(std::string_view payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth) {
    return Decoder(payload, fds, maxDepth).all();
}

FrameReader::Status FrameReader::next(Frame& frame, std::string& error) {
    std::string_view rest = std::string_view(buffer_).substr(offset_);
    if (rest.size() < kHeaderSize) return Status::NeedMore;
    uint64_t length = get(rest, 0, 4);
    auto kind = static_cast<uint8_t>(rest[4]);
    uint64_t fdCount = get(rest, 6, 2);
    if (kind < 1 || kind > 3 || rest[5] != 0) {
        error = "malformed frame header";
        return Status::Error;
    }
    if (length + kHeaderSize > maxFrame_) {
        error = "frame of " + std::to_string(length) + " bytes exceeds the limit of " +
                std::to_string(maxFrame_);
        return Status::Error;
    }
    if (rest.size() < kHeaderSize + length) return Status::NeedMore;
    // The descriptors of a frame arrive with its first bytes, so they are here by now.
    if (fdCount > fds_.size()) {
        error = "frame names descriptors that did not arrive";
        return Status::Error;
    }
    std::vector<std::shared_ptr<FileDescriptor>> fds(fds_.begin(),
                                                     fds_.begin() + static_cast<long>(fdCount));
    fds_.erase(fds_.begin(), fds_.begin() + static_cast<long>(fdCount));
    auto body = decodeValue(rest.substr(kHeaderSize, length), fds, maxDepth_);
    if (!body) {
        error = "frame does not decode";
        return Status::Error;
    }
    frame.kind = static_cast<FrameKind>(kind);
    frame.id = get(rest, 8, 8);
    frame.body = std::move(*body);
    offset_ += kHeaderSize + length;
    // Drop consumed bytes now and then, not on every frame.
    if (offset_ > 65536 && offset_ * 2 > buffer_.size()) {
        buffer_.erase(0, offset_);
        offset_ = 0;
    }
    return Status::Frame;
}

bool FrameReader::holdsUnclaimedDescriptors() const {
    if (fds_.empty()) return false;
    std::string_view rest = std::string_view(buffer_).substr(offset_);
    if (rest.size() < kHeaderSize) return rest.empty() || fds_.size() > kMaxFrameDescriptors;
    return get(rest, 6, 2) < fds_.size();
}

void FrameReader::clear() {
    std::string().swap(buffer_);
    offset_ = 0;
    fds_.clear();
}

}  // namespace corvane::rpx::wire
