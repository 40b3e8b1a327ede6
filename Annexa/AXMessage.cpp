#include "Annexa/AXMessage.h"

namespace annexa {

namespace {

// Whether every value inside is one an in-memory value can hold. An encoded container knows what
// it holds without being decoded.
bool carriable(const Value& v) {
    constexpr uint32_t kNotCarried = 1u << static_cast<unsigned>(Value::Kind::Null) |
                                     1u << static_cast<unsigned>(Value::Kind::Fd);
    return (v.kindsInside() & kNotCarried) == 0;
}

}  // namespace

const Value* rpx_dictionary_get_array(const Value& message, const char* key) {
    const Value* v = message.find(key);
    return v && v->isArray() ? v : nullptr;
}

const Value* rpx_dictionary_get_dictionary(const Value& message, const char* key) {
    const Value* v = message.find(key);
    return v && v->isDictionary() ? v : nullptr;
}

Value convertMessageToValue(const Value& message) { return carriable(message) ? message : Value(); }

Value convertValueToMessage(const Value& value) { return carriable(value) ? value : Value(); }

}  // namespace annexa
