// Property-list files the daemon writes for itself and reads back, and the
// path-string helpers that go with them.
//
// Writing produces a binary property list. With kTarnWriteAtomic the bytes go
// to a temporary file beside the target, are fsynced and renamed into place
// (TarnFileManager::writeData), so that a crash leaves the old or the new
// file, never an empty one. Reading accepts any property-list format and is
// capped at kMaxPlistBytes.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"

namespace tarn {

// The platform's general error domain and its "property list has the wrong
// format" code, given when a file's top level is not a dictionary.
inline constexpr const char* kPlatformErrorDomain = "PlatformErrorDomain";
inline constexpr uint64_t kPlatformErrorPropertyListReadCorrupt = 2048;

// Serialises `dictionary` (binary) and writes it to `url`. `withOptions` are
// TarnFileManager write options (kTarnWriteAtomic, kTarnWriteNoFileProtection).
TarnStatus Tarn_writeToURL(const PlistValue& dictionary, const FileURL& url, uint64_t withOptions);

// Reads `url` (uncached) and parses it. A top level that is not a dictionary
// fails with kPlatformErrorPropertyListReadCorrupt; a missing or unreadable file
// with the POSIX error; a malformed one with kPlatformErrorPropertyListReadCorrupt.
// `options` is reserved for the platform's read options (mutability); 0.
TarnResult<PlistValue> Tarn_dictionaryWithContentsOfURL(const FileURL& url, uint64_t options);

// True when any component of `path` is exactly "..".
bool containsDotDotPathComponents(std::string_view path);

// A string from C path bytes (the file-system encoding is UTF-8 here).
std::string stringWithFileSystemRepresentation(const char* bytes);
std::string stringWithFileSystemRepresentation(const char* bytes, size_t length);

}  // namespace tarn
