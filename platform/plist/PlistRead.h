// Internal: the two property-list readers behind corvane::plist::parse.
#pragma once

#include <optional>
#include <string_view>

#include "platform/value/Value.h"

namespace corvane::plist::detail {

std::optional<Value> readXml(std::string_view text);
std::optional<Value> readBinary(std::string_view bytes);

}  // namespace corvane::plist::detail
