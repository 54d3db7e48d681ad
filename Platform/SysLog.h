// The rotating-log library: one handle per log, a level, and an optional
// disk file rotated by size. Lines written with no handle, or before disk
// logging is enabled, go to the platform log instead, so that nothing is lost.
//
// Thread-safe: any thread may write through a handle at any time.
#pragma once

#include <cstdint>
#include <string>

#include "Platform/Format.h"

namespace tarn {

struct LogHandle;

// Opens a log named `identifier` at `level` (3 error, 5 notice, 7 debug).
// Returns nullptr only if the handle cannot be allocated.
LogHandle* LogOpen(const char* identifier, int level);
// Starts writing to `path`, keeping `rotationCount` rotated files "path.N";
// a file is rotated once it would exceed `sizeLimit` bytes. Returns 0 or an errno.
int LogEnableDiskLogging(LogHandle* handle, const std::string& path, uint32_t rotationCount,
                         uint64_t sizeLimit);
int LogGetLevel(const LogHandle* handle);
void LogSetLevel(LogHandle* handle, int level);
// Writes one line, unconditionally (level gating is the caller's).
void LogWriteString(LogHandle* handle, int level, const char* tag, const std::string& message);

template <class... Args>
void LogWrite(LogHandle* handle, int level, const char* tag, std::string_view fmt,
              const Args&... args) {
    LogWriteString(handle, level, tag, Format(fmt, args...));
}

}  // namespace tarn
