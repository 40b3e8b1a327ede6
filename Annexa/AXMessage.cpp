#include "Annexa/AXMessage.h"

namespace annexa {

namespace {

// Whether every value inside is one an in-memory value can hold.
bool carriable(const Value& v) {
    switch (v.kind()) {
        case Value::Kind::Null:
        case Value::Kind::Fd: return false;
        case Value::Kind::Array:
            for (const Value& e : *v.asArray())
                if (!carriable(e)) return false;
            return true;
        case Value::Kind::Dictionary:
            for (const auto& [k, e] : *v.asDictionary())
                if (!carriable(e)) return false;
            return true;
        default: return true;
    }
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
