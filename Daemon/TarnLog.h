// The daemon's rotating log and its level gating. Every Part of the daemon
// writes through TarnLog(): a line of level 7 is written only when the log
// handle exists and its level is at least 7; lines of levels 3 and 5 are
// written when no handle exists or its level is at least theirs.
#pragma once

#include "Platform/PlatformLog.h"
#include "Platform/SysLog.h"

namespace tarn {

enum : int { kLogError = 3, kLogNotice = 5, kLogDebug = 7 };

// Set once by start-up; may stay null (then lines go to the platform log only).
LogHandle* TarnLogHandle();
void TarnSetLogHandle(LogHandle* handle);
bool TarnLogShouldWrite(int level);

template <class... Args>
void TarnLog(int level, const char* tag, std::string_view fmt, const Args&... args) {
    if (!TarnLogShouldWrite(level)) return;
    LogWriteString(TarnLogHandle(), level, tag, Format(fmt, args...));
}

}  // namespace tarn
