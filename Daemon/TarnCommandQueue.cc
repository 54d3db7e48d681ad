#include "Daemon/TarnCommandQueue.h"

#include "Daemon/TarnError.h"
#include "Daemon/TarnExceptionFence.h"
#include "Platform/PlatformLog.h"

namespace tarn {

TarnCommandQueue::TarnCommandQueue() = default;

void TarnCommandQueue::insertCommand(std::shared_ptr<TarnCommand> command) {
    PlatformLog("unspecified", PlatformLogType::Info, "Added command <%p; %llu> to queue",
                static_cast<const void*>(command.get()), command->command());
    MutexLock lock(mu_);
    commands_.push_back(std::move(command));
}

TarnStatus TarnCommandQueue::executeNextCommandWithError() {
    std::shared_ptr<TarnCommand> next;
    DispatchQueueRef queue;
    {
        MutexLock lock(mu_);
        if (commands_.empty()) return TARN_ERROR_CODE(TarnErrorQueueEmpty, nullptr);
        next = std::move(commands_.front());
        commands_.pop_front();
        if (!queue_) queue_ = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.TarnCommandQueue");
        queue = queue_;
    }
    TarnStatus result;
    queue->sync([&] {
        const void* p = next.get();
        PlatformLog("unspecified", PlatformLogType::Info, "Executing command <%p; %llu>...", p,
                    next->command());
        // Nothing escapes the work item.
        result = TarnFenceExceptions("fromQueue", [&] { return next->fromQueue(this); });
        // A command that fails without an error value reads as 1 here, as it
        // always has; the request's slot never does (completeWithError).
        PlatformLog("unspecified", PlatformLogType::Info,
                    "Completed command <%p; %llu>: success = %d, error = %llu", p, next->command(),
                    result.ok(), result.code(TarnSuccess));
    });
    return result;
}

TarnStatus TarnCommandQueue::executeAllUntilExhaustedOrError() {
    for (;;) {
        TarnStatus ran = executeNextCommandWithError();
        if (ran.ok()) continue;
        if (ran.code(TarnSuccess) == TarnErrorQueueEmpty) return {};
        return ran;
    }
}

std::vector<std::shared_ptr<TarnCommand>> TarnCommandQueue::commands() {
    MutexLock lock(mu_);
    return {commands_.begin(), commands_.end()};
}

void TarnCommandQueue::removeAllCommands() {
    std::list<std::shared_ptr<TarnCommand>> dropped;
    {
        MutexLock lock(mu_);
        dropped.swap(commands_);
    }
    // Released outside the lock: a command's destructor may queue or log.
}

size_t TarnCommandQueue::TEST_count() {
    MutexLock lock(mu_);
    return commands_.size();
}

}  // namespace tarn
