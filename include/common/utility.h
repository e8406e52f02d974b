// Small helpers shared by every subsystem.
#ifndef PLOVO_COMMON_UTILITY_H
#define PLOVO_COMMON_UTILITY_H

#include <json/value.h>

#include <string>
#include <type_traits>

namespace Plovo {

// Decimal text of a number or an enumeration value.
template <typename T>
std::string NumToString(T value) {
  if constexpr (std::is_enum_v<T>) {
    return std::to_string(static_cast<std::underlying_type_t<T>>(value));
  } else {
    return std::to_string(value);
  }
}

// Compact JSON text of a value: no indentation, no line breaks, no final
// newline.
std::string JsonToString(const Json::Value& value);

}  // namespace Plovo

#endif
