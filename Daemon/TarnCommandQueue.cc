#include "Daemon/TarnCommandQueue.h"

#include "Daemon/TarnError.h"
#include "Daemon/TarnRequestProcessor.h"
#include "Platform/PlatformLog.h"

namespace tarn {

TarnCommandQueue::TarnCommandQueue() = default;

void TarnCommandQueue::insertCommand(std::shared_ptr<TarnCommand> command) {
    PlatformLog("unspecified", PlatformLogType::Info, "Added command <%p; %llu> to queue",
                static_cast<const void*>(command.get()), command->command());
    MutexLock lock(mu_);
    commands_.push_back(std::move(command));
}

bool TarnCommandQueue::executeNextCommandWithError(uint64_t* error) {
    std::shared_ptr<TarnCommand> next;
    DispatchQueueRef queue;
    {
        MutexLock lock(mu_);
        if (commands_.empty()) {
            TarnSetError(error, TarnErrorQueueEmpty);
            return false;
        }
        next = std::move(commands_.front());
        commands_.pop_front();
        if (!queue_) queue_ = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.TarnCommandQueue");
        queue = queue_;
    }
    bool ok = false;
    uint64_t code = TarnSuccess;
    queue->sync([&] {
        const void* p = next.get();
        PlatformLog("unspecified", PlatformLogType::Info, "Executing command <%p; %llu>...", p,
                    next->command());
        // A command that throws fails with 40; nothing escapes the work item.
        try {
            ok = next->fromQueue(this, &code);
        } catch (const std::exception& e) {
            ok = false;
            code = TarnHandleCaughtException("fromQueue", &e);
        } catch (...) {
            ok = false;
            code = TarnHandleCaughtException("fromQueue", nullptr);
        }
        PlatformLog("unspecified", PlatformLogType::Info,
                    "Completed command <%p; %llu>: success = %d, error = %llu", p, next->command(),
                    ok, code);
    });
    if (!ok) TarnSetError(error, code);
    return ok;
}

bool TarnCommandQueue::executeAllUntilExhaustedOrError(uint64_t* error) {
    uint64_t code = TarnSuccess;
    while (executeNextCommandWithError(&code)) code = TarnSuccess;
    if (code == TarnErrorQueueEmpty) return true;
    TarnSetError(error, code);
    return false;
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
