#include "Daemon/TarnLog.h"

#include <atomic>

namespace tarn {

namespace {
std::atomic<LogHandle*> gHandle{nullptr};
}

LogHandle* TarnLogHandle() { return gHandle.load(std::memory_order_acquire); }
void TarnSetLogHandle(LogHandle* handle) { gHandle.store(handle, std::memory_order_release); }

bool TarnLogShouldWrite(int level) {
    LogHandle* h = TarnLogHandle();
    if (level >= kLogDebug) return h && LogGetLevel(h) >= kLogDebug;
    return !h || LogGetLevel(h) >= level;
}

}  // namespace tarn
