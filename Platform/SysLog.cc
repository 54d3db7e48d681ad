#include "Platform/SysLog.h"

#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/spdlog.h>

#include <mutex>

#include "Platform/PlatformLog.h"

namespace tarn {

struct LogHandle {
    std::string identifier;
    std::atomic<int> level;
    std::mutex mu;
    std::shared_ptr<spdlog::sinks::rotating_file_sink_mt> sink;  // guarded by mu
};

LogHandle* LogOpen(const char* identifier, int level) {
    auto* h = new (std::nothrow) LogHandle;
    if (!h) return nullptr;
    h->identifier = identifier ? identifier : "";
    h->level = level;
    return h;
}

int LogEnableDiskLogging(LogHandle* handle, const std::string& path, uint32_t rotationCount,
                         uint64_t sizeLimit) {
    if (!handle) return EINVAL;
    try {
        auto sink = std::make_shared<spdlog::sinks::rotating_file_sink_mt>(
            path, static_cast<size_t>(sizeLimit), rotationCount == 0 ? 1 : rotationCount);
        sink->set_pattern("%Y-%m-%d %H:%M:%S.%e %v");
        std::lock_guard lock(handle->mu);
        handle->sink = std::move(sink);
        return 0;
    } catch (const spdlog::spdlog_ex&) {
        return errno ? errno : EIO;
    }
}

int LogGetLevel(const LogHandle* handle) { return handle ? handle->level.load() : 0; }
void LogSetLevel(LogHandle* handle, int level) {
    if (handle) handle->level = level;
}

void LogWriteString(LogHandle* handle, int level, const char* tag, const std::string& message) {
    // Always mirrored to the platform log: that is where operators look first.
    PlatformLogWrite("daemon", level <= 3 ? PlatformLogType::Error : PlatformLogType::Default,
                     Format("[%s] %s", tag ? tag : "", message));
    if (!handle) return;
    std::shared_ptr<spdlog::sinks::rotating_file_sink_mt> sink;
    {
        std::lock_guard lock(handle->mu);
        sink = handle->sink;
    }
    if (!sink) return;
    std::string line = Format("<%d> [%s] %s", level, tag ? tag : "", message);
    spdlog::details::log_msg msg(handle->identifier, spdlog::level::info, line);
    try {
        sink->log(msg);
        sink->flush();
    } catch (const spdlog::spdlog_ex&) {
        // Disk full or file gone: the platform log already has the line.
    }
}

}  // namespace tarn
