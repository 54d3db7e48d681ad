// TarnCommandStageForDelete: takes containers out of service. Each listed
// container's directory is renamed into the death-row directory (or, when that
// rename fails, removed in place) and dropped from the container cache; the
// bytes on death row go with the next deletion pass. Bundle containers also
// lose their code-signing records, except a transient bundle whose identifier
// still has a permanent one.
//
// Runs on its command queue's serial queue (TarnCommandQueue). With
// `useLocking` it holds the global identifier write lock across all of its
// containers, so that no lookup sees a container between its rename and its
// removal from the cache; without it the caller must hold that lock.
//
// Immutable after construction; `onError` is called at most once, on the
// command queue, with the code of a failing run.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnContainerIdentity.h"

namespace tarn {

class TarnCommandStageForDelete : public TarnCommand {
  public:
    using ErrorCallback = std::function<void(uint64_t error)>;
    static constexpr uint64_t kCommand = 3;

    // Plain identities are looked up by identifier and class (the permanent
    // container), concrete ones by their exact UUID (live or transient).
    static std::shared_ptr<TarnCommandStageForDelete>
    commandForStageForDeleteWithContainerIdentities(
        std::vector<TarnContainerIdentityRef> containerIdentities, bool useLocking,
        ErrorCallback onError);
    TarnCommandStageForDelete(std::vector<TarnContainerIdentityRef> containerIdentities,
                              bool useLocking, ErrorCallback onError);

    uint64_t command() const override { return kCommand; }
    // A container that is already gone is skipped without failing; one that
    // can be neither moved nor removed is logged and stays. Fails
    // (TarnErrorCacheRemoveFailed) only when the cache refuses to forget a
    // container, leaving later ones alone.
    TarnStatus fromQueue(TarnCommandQueue* queue) override;

    const std::vector<TarnContainerIdentityRef>& containerIdentities() const {
        return containerIdentities_;
    }
    bool useLocking() const { return useLocking_; }
    const ErrorCallback& onError() const { return onError_; }

  private:
    TarnStatus stageAll(TarnCommandQueue* queue);

    const bool useLocking_;
    const std::vector<TarnContainerIdentityRef> containerIdentities_;
    const ErrorCallback onError_;
};

}  // namespace tarn
