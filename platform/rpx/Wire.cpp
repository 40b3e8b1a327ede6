#include "platform/rpx/Wire.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

#include <endian.h>

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

// Encoded values of at least this many bytes go to the socket from where they are kept, not
// copied into the frame.
constexpr size_t kReferBytes = 16 * 1024;

// Collects a frame as pieces: what the encoder writes is owned by the frame; large encoded values
// are referred to where they are kept.
class Splicer {
public:
    explicit Splicer(FrameBytes& frame) : frame_(frame) {}

    // Ends the bytes written so far as one piece of the frame; the encoder goes on in `out` anew.
    void seal(std::string& out) {
        if (out.empty()) return;
        auto owned = std::make_shared<std::string>(std::move(out));
        out.clear();
        frame_.pieces.emplace_back(*owned);
        frame_.size += owned->size();
        if (!first_) first_ = owned;
        frame_.owners.push_back(std::move(owned));
    }
    void refer(std::string& out, const Value::Encoding& e) {
        seal(out);
        if (e.pieces) {
            frame_.pieces.insert(frame_.pieces.end(), e.pieces->bytes.begin(), e.pieces->bytes.end());
            frame_.size += e.pieces->size;
            frame_.owners.push_back(e.pieces);
        } else {
            frame_.pieces.push_back(e.bytes);
            frame_.size += e.bytes.size();
            frame_.owners.push_back(e.buffer);
        }
    }
    // The first piece the encoder wrote, where the header goes.
    std::string* first() const { return first_.get(); }

private:
    FrameBytes& frame_;
    std::shared_ptr<std::string> first_;
};

size_t encodedSize(const Value::Encoding& e) { return e.pieces ? e.pieces->size : e.bytes.size(); }

// Appends pieces of `size` bytes in all, in one allocation.
void appendPieces(std::string& out, const std::vector<std::string_view>& pieces, size_t size) {
    out.reserve(out.size() + size);
    for (std::string_view piece : pieces) out.append(piece);
}

bool encode(std::string& out, const Value& v, std::vector<int>& fds, size_t depth, size_t maxDepth,
            Splicer* splicer = nullptr) {
    if (depth > maxDepth) return false;
    if (const Value::Encoding* e = v.encoding()) {
        // Never holds a descriptor: the decoder and encodedContainer leave those out.
        if (depth + e->nesting > maxDepth) return false;
        if (splicer && encodedSize(*e) >= kReferBytes) {
            splicer->refer(out, *e);
        } else if (e->pieces) {
            appendPieces(out, e->pieces->bytes, e->pieces->size);
        } else {
            out.append(e->bytes);
        }
        return true;
    }
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
                if (!encode(out, e, fds, depth + 1, maxDepth, splicer)) return false;
            break;
        case K::Dictionary:
            out.push_back(kDictionary);
            put32(out, static_cast<uint32_t>(v.asDictionary()->size()));
            for (const auto& [key, e] : *v.asDictionary()) {
                put32(out, static_cast<uint32_t>(key.size()));
                out += key;
                if (!encode(out, e, fds, depth + 1, maxDepth, splicer)) return false;
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

constexpr uint32_t bit(Value::Kind k) { return 1u << static_cast<unsigned>(k); }

// Most texts of a message (keys above all) are short and ASCII: checked here, eight bytes at a
// time, without a call.
inline bool isAscii(std::string_view s) {
    uint64_t high = 0;
    size_t i = 0;
    for (; i + 8 <= s.size(); i += 8) {
        uint64_t word;
        std::memcpy(&word, s.data() + i, 8);
        high |= word;
    }
    for (; i < s.size(); ++i) high |= static_cast<uint8_t>(s[i]);
    return (high & 0x8080808080808080ull) == 0;
}

// Array elements and dictionary values of at least this many bytes in a large frame are decoded
// when first looked at; at the deepest level kept so (the entries of each form of a "match"
// reply: its Info.plist, its plug-in dictionary, its read tokens), from a smaller size, so that
// a host that reads a form's identifier and name does not build the rest.
constexpr size_t kLazyElementBytes = 512;
constexpr size_t kLazyInnerElementBytes = 128;
// Frames from this size on are decoded lazily (their payload is kept for the elements). A frame of
// a few large elements already gains: a host that asks for ten plug-ins and looks at one of them
// decodes one.
constexpr size_t kLazyFrameBytes = 4 * 1024;

Value decodeValidated(const Value::Encoding& encoding);
template <size_t Levels>
Value decodeKeepingElements(const Value::Encoding& encoding);

// How deep below a frame's body values may be kept encoded: the body's own values (a reply's
// "matches"), their elements (each form) and theirs (a form's entries). Every level of keeping
// walks the kept bytes once more to check them, so the levels are few: what a peer sends costs a
// bounded number of walks.
constexpr size_t kLazyLevels = 3;

class Decoder {
public:
    // With `buffer` (which `s` lies inside), values down to `lazyLevels` levels below the root may
    // be kept encoded.
    Decoder(std::string_view s, const std::vector<std::shared_ptr<FileDescriptor>>& fds,
            size_t maxDepth, std::shared_ptr<const std::string> buffer = nullptr, size_t lazyLevels = 0)
        : s_(s), fds_(fds), maxDepth_(maxDepth), buffer_(std::move(buffer)), lazyLevels_(lazyLevels) {}

    std::optional<Value> all() {
        auto v = value(0);
        if (!v || pos_ != s_.size()) return std::nullopt;
        return v;
    }

private:
    std::string_view s_;
    const std::vector<std::shared_ptr<FileDescriptor>>& fds_;
    size_t maxDepth_;
    // When set, `s_` lies inside it and large values down to `lazyLevels_` are decoded lazily.
    std::shared_ptr<const std::string> buffer_;
    size_t lazyLevels_;
    size_t pos_ = 0;

    struct Shape {
        size_t nesting = 0;
        uint32_t kinds = 0;
    };

    bool has(size_t n) const { return n <= s_.size() - pos_; }
    std::optional<uint64_t> take(int bytes) {
        if (!has(static_cast<size_t>(bytes))) return std::nullopt;
        uint64_t v = get(s_, pos_, bytes);
        pos_ += static_cast<size_t>(bytes);
        return v;
    }
    std::optional<std::string_view> textView() {
        const char* start = s_.data() + pos_;
        const char* p = start;
        if (!skipText(p, s_.data() + s_.size())) return std::nullopt;
        pos_ += static_cast<size_t>(p - start);
        return std::string_view(start + 4, static_cast<size_t>(p - start) - 4);
    }
    std::optional<std::string> text() {
        auto s = textView();
        if (!s) return std::nullopt;
        return std::string(*s);
    }

    // Walks one value as value() would decode it, checking the same things, without building it.
    std::optional<Shape> skip(size_t depth) {
        const char* p = s_.data() + pos_;
        Shape shape;
        bool ok = skipAt(p, s_.data() + s_.size(), depth, shape.nesting, shape.kinds);
        pos_ = static_cast<size_t>(p - s_.data());
        if (!ok) return std::nullopt;
        return shape;
    }

    static uint32_t load32(const char* p) {
        uint32_t v;
        std::memcpy(&v, p, 4);
        return le32toh(v);
    }

    static bool skipText(const char*& p, const char* end) {
        if (end - p < 4) return false;
        uint32_t n = load32(p);
        p += 4;
        if (static_cast<size_t>(end - p) < n) return false;
        std::string_view s(p, n);
        p += n;
        return isAscii(s) || isValidUtf8(s);
    }

    // The walk itself, on a cursor: `nesting` is the value's, `kinds` gathers the kinds in it.
    // Every walked byte of a large reply passes here, so it is kept to a few instructions per
    // element.
    bool skipAt(const char*& p, const char* end, size_t depth, size_t& nesting, uint32_t& kinds) const {
        using K = Value::Kind;
        if (depth > maxDepth_ || p == end) return false;
        auto tag = static_cast<uint8_t>(*p++);
        auto fixed = [&](K kind, size_t bytes) {
            if (static_cast<size_t>(end - p) < bytes) return false;
            p += bytes;
            kinds |= bit(kind);
            return true;
        };
        nesting = 0;
        switch (tag) {
            case kNull: kinds |= bit(K::Null); return true;
            case kFalse:
            case kTrue: kinds |= bit(K::Bool); return true;
            case kInt64: return fixed(K::Int64, 8);
            case kUInt64: return fixed(K::UInt64, 8);
            case kDouble: return fixed(K::Double, 8);
            case kDate: return fixed(K::Date, 8);
            case kUUID: return fixed(K::UUID, 16);
            case kString:
                kinds |= bit(K::String);
                return skipText(p, end);
            case kData:
                if (end - p < 4) return false;
                p += 4;
                return fixed(K::Data, load32(p - 4));
            case kArray:
            case kDictionary: {
                bool isArray = tag == kArray;
                if (end - p < 4) return false;
                uint64_t n = load32(p);
                p += 4;
                if (static_cast<uint64_t>(end - p) < n * (isArray ? 1 : 5)) return false;
                kinds |= bit(isArray ? K::Array : K::Dictionary);
                for (uint64_t i = 0; i < n; ++i) {
                    if (!isArray && !skipText(p, end)) return false;
                    // Texts, the most common elements, without a call of their own.
                    if (depth < maxDepth_ && p != end && static_cast<uint8_t>(*p) == kString) {
                        ++p;
                        if (!skipText(p, end)) return false;
                        kinds |= bit(K::String);
                        nesting = std::max<size_t>(nesting, 1);
                        continue;
                    }
                    size_t inner = 0;
                    if (!skipAt(p, end, depth + 1, inner, kinds)) return false;
                    nesting = std::max(nesting, inner + 1);
                }
                return true;
            }
            case kFd: {
                if (end - p < 4) return false;
                uint32_t index = load32(p);
                p += 4;
                kinds |= bit(K::Fd);
                return index < fds_.size();
            }
            default: return false;
        }
    }

    // One array element or dictionary value: a large container without descriptors is kept
    // encoded, to be decoded when it is first looked at (by the thread that looks, not the I/O
    // thread that reads every connection); anything else is decoded now.
    std::optional<Value> element(size_t depth) {
        if (!buffer_ || depth > lazyLevels_ || !has(1) || (s_[pos_] != kArray && s_[pos_] != kDictionary))
            return value(depth);
        size_t start = pos_;
        auto shape = skip(depth);
        if (!shape) return std::nullopt;
        size_t least = depth < lazyLevels_ ? kLazyElementBytes : kLazyInnerElementBytes;
        if (pos_ - start < least || (shape->kinds & bit(Value::Kind::Fd))) {
            pos_ = start;
            return value(depth);
        }
        return Value::encoded({.kind = s_[start] == kArray ? Value::Kind::Array : Value::Kind::Dictionary,
                               .buffer = buffer_,
                               .bytes = s_.substr(start, pos_ - start),
                               .nesting = shape->nesting,
                               .kindsInside = shape->kinds,
                               .decode = decoderKeeping(lazyLevels_ - depth),
                               .pieces = nullptr});
    }

    // The decoder of an element kept encoded, which keeps its own elements encoded down to
    // `levels` more levels.
    static Value (*decoderKeeping(size_t levels))(const Value::Encoding&) {
        switch (levels) {
            case 0: return decodeValidated;
            case 1: return decodeKeepingElements<1>;
            default: return decodeKeepingElements<2>;
        }
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
                    auto e = element(depth + 1);
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
                    auto e = element(depth + 1);
                    if (!e) return std::nullopt;
                    // Keys come sorted from an encoder of maps: each goes at the end.
                    d.insert_or_assign(d.end(), std::move(*key), std::move(*e));
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

// The bytes were checked when the element was skipped; the depth was checked there too.
const std::vector<std::shared_ptr<FileDescriptor>> kNoFds;

Value decodeValidated(const Value::Encoding& encoding) {
    auto v = Decoder(encoding.bytes, kNoFds, SIZE_MAX).all();
    return v ? std::move(*v) : Value();
}

// An encoding in pieces is decoded from its pieces joined.
Value decodeJoined(const Value::Encoding& encoding) {
    std::string joined;
    appendPieces(joined, encoding.pieces->bytes, encoding.pieces->size);
    auto v = Decoder(joined, kNoFds, SIZE_MAX).all();
    return v ? std::move(*v) : Value();
}

// Decodes a value kept encoded, keeping its own large elements encoded in turn, down to `Levels`.
template <size_t Levels>
Value decodeKeepingElements(const Value::Encoding& encoding) {
    auto v = Decoder(encoding.bytes, kNoFds, SIZE_MAX, encoding.buffer, Levels).all();
    return v ? std::move(*v) : Value();
}

}  // namespace

void appendArrayHeader(std::string& out, uint32_t count) {
    out.push_back(static_cast<char>(kArray));
    put32(out, count);
}

void appendDictionaryHeader(std::string& out, uint32_t count) {
    out.push_back(static_cast<char>(kDictionary));
    put32(out, count);
}

bool appendEntry(std::string& out, std::string_view key, const Value& value) {
    if (value.kindsInside() & bit(Value::Kind::Fd)) return false;
    size_t before = out.size();
    put32(out, static_cast<uint32_t>(key.size()));
    out += key;
    std::vector<int> fds;
    if (!encode(out, value, fds, 0, SIZE_MAX)) {
        out.resize(before);
        return false;
    }
    return true;
}

bool appendElement(std::string& out, const Value& value) {
    if (value.kindsInside() & bit(Value::Kind::Fd)) return false;
    size_t before = out.size();
    std::vector<int> fds;
    if (!encode(out, value, fds, 0, SIZE_MAX)) {
        out.resize(before);
        return false;
    }
    return true;
}

size_t nestingOf(const Value& value) {
    if (const Value::Encoding* e = value.encoding()) return e->nesting;
    size_t deepest = 0;
    if (const Array* a = value.asArray()) {
        for (const Value& e : *a) deepest = std::max(deepest, nestingOf(e) + 1);
    } else if (const Dictionary* d = value.asDictionary()) {
        for (const auto& [k, e] : *d) deepest = std::max(deepest, nestingOf(e) + 1);
    }
    return deepest;
}

Value encodedContainer(std::shared_ptr<const std::string> bytes, size_t nesting, uint32_t kindsInside) {
    Value::Kind kind = !bytes->empty() && (*bytes)[0] == kArray ? Value::Kind::Array : Value::Kind::Dictionary;
    std::string_view view = *bytes;
    return Value::encoded({.kind = kind,
                           .buffer = std::move(bytes),
                           .bytes = view,
                           .nesting = nesting,
                           .kindsInside = kindsInside | bit(kind),
                           .decode = decodeValidated,
                           .pieces = nullptr});
}

Value encodedPieces(Value::Encoding::Pieces pieces, size_t nesting, uint32_t kindsInside) {
    Value::Kind kind = !pieces.bytes.empty() && !pieces.bytes.front().empty() && pieces.bytes.front()[0] == kArray
                           ? Value::Kind::Array
                           : Value::Kind::Dictionary;
    return Value::encoded({.kind = kind,
                           .buffer = nullptr,
                           .bytes = {},
                           .nesting = nesting,
                           .kindsInside = kindsInside | bit(kind),
                           .decode = decodeJoined,
                           .pieces = std::make_shared<const Value::Encoding::Pieces>(std::move(pieces))});
}

std::optional<FrameBytes> encodeFramePieces(const Frame& frame, std::vector<int>& fds, size_t maxDepth) {
    FrameBytes bytes;
    Splicer splicer(bytes);
    std::string out(kHeaderSize, '\0');
    size_t firstFd = fds.size();
    if (!encode(out, frame.body, fds, 0, maxDepth, &splicer)) return std::nullopt;
    splicer.seal(out);
    size_t payload = bytes.size - kHeaderSize;
    if (payload > UINT32_MAX || fds.size() - firstFd > UINT16_MAX) return std::nullopt;
    std::string header;
    put32(header, static_cast<uint32_t>(payload));
    header.push_back(static_cast<char>(frame.kind));
    header.push_back(0);
    auto count = static_cast<uint16_t>(fds.size() - firstFd);
    header.push_back(static_cast<char>(count & 0xff));
    header.push_back(static_cast<char>(count >> 8));
    put64(header, frame.id);
    // The first piece is the encoder's own and begins with the room for the header.
    splicer.first()->replace(0, kHeaderSize, header);
    return bytes;
}

std::string FrameBytes::joined() const {
    std::string out;
    appendPieces(out, pieces, size);
    return out;
}

std::optional<std::string> encodeFrame(const Frame& frame, std::vector<int>& fds, size_t maxDepth) {
    auto bytes = encodeFramePieces(frame, fds, maxDepth);
    if (!bytes) return std::nullopt;
    return bytes->joined();
}

std::optional<Value> decodeValue(std::string_view payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth) {
    return Decoder(payload, fds, maxDepth).all();
}

std::optional<Value> decodeValue(std::shared_ptr<const std::string> payload,
                                 const std::vector<std::shared_ptr<FileDescriptor>>& fds,
                                 size_t maxDepth) {
    std::string_view view = *payload;
    return Decoder(view, fds, maxDepth, std::move(payload), kLazyLevels).all();
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
    if (rest.size() < kHeaderSize + length) {
        // Room for the whole frame at once, rather than growing (and copying) it read by read;
        // only once a good part has come, so that a header alone reserves nothing.
        if (rest.size() >= 65536) buffer_.reserve(offset_ + kHeaderSize + length);
        return Status::NeedMore;
    }
    // The descriptors of a frame arrive with its first bytes, so they are here by now.
    if (fdCount > fds_.size()) {
        error = "frame names descriptors that did not arrive";
        return Status::Error;
    }
    std::vector<std::shared_ptr<FileDescriptor>> fds(fds_.begin(),
                                                     fds_.begin() + static_cast<long>(fdCount));
    fds_.erase(fds_.begin(), fds_.begin() + static_cast<long>(fdCount));
    uint64_t id = get(rest, 8, 8);
    std::string_view payload = rest.substr(kHeaderSize, length);
    std::optional<Value> body;
    if (payload.size() < kLazyFrameBytes) {
        body = decodeValue(payload, fds, maxDepth_);
        offset_ += kHeaderSize + length;
    } else if (offset_ == 0 && buffer_.size() == kHeaderSize + length) {
        // The buffer holds this frame alone: the decoded value keeps the buffer itself.
        auto kept = std::make_shared<const std::string>(std::move(buffer_));
        buffer_.clear();
        body = Decoder(std::string_view(*kept).substr(kHeaderSize), fds, maxDepth_, kept, kLazyLevels).all();
    } else {
        body = decodeValue(std::make_shared<const std::string>(payload), fds, maxDepth_);
        offset_ += kHeaderSize + length;
    }
    if (!body) {
        error = "frame does not decode";
        return Status::Error;
    }
    frame.kind = static_cast<FrameKind>(kind);
    frame.id = id;
    frame.body = std::move(*body);
    frame.bytes = kHeaderSize + length;
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

namespace corvane::rpx {

size_t arrayCount(const Value& array) {
    const Value::Encoding* encoding = array.encoding();
    if (encoding && encoding->kind == Value::Kind::Array && !encoding->pieces)
        return static_cast<size_t>(wire::get(encoding->bytes, 1, 4));
    const Array* elements = array.asArray();
    return elements ? elements->size() : 0;
}

std::vector<UUID> leadingUuids(const Value& array, bool& all) {
    std::vector<UUID> uuids;
    const Value::Encoding* encoding = array.encoding();
    if (!encoding || encoding->kind != Value::Kind::Array || encoding->pieces) {
        const Array* elements = array.asArray();
        all = true;
        if (!elements) return uuids;
        uuids.reserve(elements->size());
        for (const Value& element : *elements) {
            const UUID* uuid = element.asUUID();
            if (!uuid) {
                all = false;
                break;
            }
            uuids.push_back(*uuid);
        }
        return uuids;
    }
    // The bytes were checked when the frame was read: a tag, a count, then the elements.
    std::string_view bytes = encoding->bytes;
    uint64_t count = wire::get(bytes, 1, 4);
    size_t at = 5;
    uuids.reserve(count);
    for (uint64_t i = 0; i < count; ++i, at += 17) {
        if (static_cast<uint8_t>(bytes[at]) != wire::kUUID) break;
        UUID uuid;
        std::memcpy(uuid.bytes.data(), bytes.data() + at + 1, 16);
        uuids.push_back(uuid);
    }
    all = uuids.size() == count;
    return uuids;
}

}  // namespace corvane::rpx
