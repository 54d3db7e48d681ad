// JSON text to and from property-list values, with the mapping tarnctl
// documents in its help:
//
//   string <-> string            true/false <-> bool
//   non-negative integer <-> uint64, negative integer <-> int64
//   array <-> array              object <-> dictionary
//   {"$uuid": "8-4-4-4-12"} <-> uuid
//   {"$int64": n} <-> int64 (printed this way when the value is not negative)
//   {"$data": "base64"} <-> data
//
// An object is one of the special forms only when "$uuid", "$int64" or
// "$data" is its single key. Fractions, exponents and null are refused on
// input: the daemon's messages have no such values.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "Platform/PropertyList.h"

namespace tarnctl {

std::optional<tarn::PlistValue> JsonToPlist(std::string_view text, std::string* why);
// One line, keys in byte order, no insignificant whitespace except ", " and ": ".
std::string PlistToJson(const tarn::PlistValue& value);

}  // namespace tarnctl
