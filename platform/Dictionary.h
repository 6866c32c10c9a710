// A plain collection of values by key, as a program on this platform would hand one over.
#pragma once

#include <map>
#include <string>
#include <variant>

namespace platform {

// A number, a truth value, a UTF-8 text, or nothing at all.
using Value = std::variant<std::monostate, bool, long long, double, std::string>;
using Dictionary = std::map<Value, Value>;

}  // namespace platform
