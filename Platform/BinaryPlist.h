// A direct reader for binary property lists ("bplist00"), the format the
// daemon writes its own files in. It builds PlistValue trees straight from the
// bytes, without an intermediate node tree, and keeps the rules of
// PlistValue::fromBytes: no NUL in strings, valid UTF-8 (and UTF-16) only,
// nesting at most 256 deep, dates clamped to 32-bit seconds.
//
// Every offset, length and reference is checked against the buffer before it
// is used; a reference to an object that is already open on the current path
// (a cycle) is refused, and so is a file whose shared references would expand
// into more values than the bytes can account for. Never throws, never aborts.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tarn {

class PlistValue;

// Parses a whole binary property list. Empty on malformed input, with a short
// reason in *why when given.
std::optional<PlistValue> ParseBinaryPlist(const uint8_t* bytes, size_t length,
                                           std::string* why = nullptr);

// True when `s` is well-formed UTF-8: no overlong forms, no surrogates, nothing
// past U+10FFFF.
bool PlistIsValidUtf8(std::string_view s);

}  // namespace tarn
