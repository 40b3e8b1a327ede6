// Messages and in-memory values.
//
// Messages are Values too, but they may carry what an in-memory value cannot: file descriptors and
// nulls. Converting is a check, kind for kind: a message with a descriptor or a null anywhere
// inside converts to null, and so does an in-memory value holding one on the way out.
#pragma once

#include "Annexa/AXUtilities.h"

namespace annexa {

// The value under `key` of a message dictionary when it is an array (or a dictionary), else null
// (also when the message is no dictionary or the key is absent).
const Value* rpx_dictionary_get_array(const Value& message, const char* key);
const Value* rpx_dictionary_get_dictionary(const Value& message, const char* key);

// Message -> in-memory value: null when something inside cannot be carried.
Value convertMessageToValue(const Value& message);
// In-memory value -> message: null when something inside cannot be carried.
Value convertValueToMessage(const Value& value);

}  // namespace annexa
