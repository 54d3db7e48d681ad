// The platform log: structured lines by subsystem and category, and signpost
// intervals with their durations. Goes to journald when the host runs it,
// otherwise to stderr, and additionally to a file set with
// PlatformLogSetFile() (the daemon's --platform-log option).
//
// Category "daemon" logs under subsystem "com.ostrea.tarnkeeperd", every other
// category under "com.ostrea.keeper". Thread-safe.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "Platform/Format.h"

namespace tarn {

enum class PlatformLogType { Debug, Info, Default, Error, Fault };

void PlatformLogSetFile(const std::string& path);
// Debug and info lines and signposts are recorded only when someone reads
// them: a platform-log file is set, or TARN_PLATFORM_LOG_VERBOSE is in the
// environment. Otherwise they cost one atomic load.
bool PlatformLogVerbose();
// Silences stderr/journald output (tests and tools); the file, if any, still gets lines.
void PlatformLogSetQuiet(bool quiet);
// Whether a line of `type` would reach any sink; when not, PlatformLog does
// not even format it.
bool PlatformLogWanted(PlatformLogType type);
// The file gets every line before this returns. Error and Fault lines reach
// stderr or journald at once too; lower ones are batched and follow within a
// few tens of milliseconds (and at exit), always in order.
void PlatformLogWrite(const char* category, PlatformLogType type, std::string message);
// Writes out batched lines now (before a deliberate abort, for example).
void PlatformLogFlush();

template <class... Args>
void PlatformLog(const char* category, PlatformLogType type, std::string_view fmt,
                 const Args&... args) {
    if (!PlatformLogWanted(type)) return;
    PlatformLogWrite(category, type, Format(fmt, args...));
}

// A single point in time: logs "signpost event NAME" with its attributes
// when signposts are recorded. Private values are passed as "<private>".
void SignpostEvent(const char* category, std::string_view name,
                   const std::vector<std::pair<std::string, std::string>>& attributes);

// A named interval. Logs "begin NAME" when made and "end NAME (duration_us=N)"
// with its attributes when ended (or destroyed without being ended).
class SignpostInterval {
public:
    // `name` is copied only when signposts are recorded.
    SignpostInterval(const char* category, std::string_view name,
                     std::vector<std::pair<std::string, std::string>> attributes = {});
    ~SignpostInterval();
    SignpostInterval(const SignpostInterval&) = delete;
    SignpostInterval& operator=(const SignpostInterval&) = delete;

    void end(std::vector<std::pair<std::string, std::string>> attributes = {});

private:
    const char* category_;
    std::string name_;
    std::chrono::steady_clock::time_point start_;
    bool ended_ = false;
    bool recording_;
};

}  // namespace tarn
