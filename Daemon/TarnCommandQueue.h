// Deferred side effects of one request. Handlers queue commands; the request
// processor runs them through completeWithError() after the handler and
// before the reply. Commands run one at a time, in insertion order, on the
// queue's own serial queue "com.ostrea.tarnkeeperd.TarnCommandQueue",
// synchronously for the caller. A command queued by a running command runs
// after it.
#pragma once

#include <cstdint>
#include <list>
#include <memory>
#include <vector>

#include "Daemon/TarnResult.h"
#include "Platform/Dispatch.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnCommandQueue;

// One deferred command. `command()` is the kind number of the class.
class TarnCommand {
public:
    virtual ~TarnCommand() = default;
    virtual uint64_t command() const = 0;
    // Runs the command on `queue`'s serial queue.
    virtual TarnStatus fromQueue(TarnCommandQueue* queue) = 0;
};

class TarnCommandQueue {
public:
    TarnCommandQueue();

    void insertCommand(std::shared_ptr<TarnCommand> command);
    // Runs the first command and answers its result; TarnErrorQueueEmpty when
    // there was none. A command that throws fails with the caught-exception
    // error: the work item is a fence.
    TarnStatus executeNextCommandWithError();
    // Runs commands until the queue is empty (success) or one fails (its
    // error; later commands stay queued).
    TarnStatus executeAllUntilExhaustedOrError();
    // The commands still queued, first to run first.
    std::vector<std::shared_ptr<TarnCommand>> commands();
    // Drops what is still queued: a request whose queue failed ends there.
    void removeAllCommands();
    size_t TEST_count();

private:
    Mutex mu_;
    // Made by the first command that runs: most requests queue none.
    DispatchQueueRef queue_ GUARDED_BY(mu_);
    // A list, not a deque: an empty deque allocates, and every request makes a queue.
    std::list<std::shared_ptr<TarnCommand>> commands_ GUARDED_BY(mu_);
};

}  // namespace tarn
