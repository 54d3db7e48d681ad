#include "Daemon/TarnAssetCommands.h"

#include "Daemon/TarnError.h"

namespace tarn {

// Not built yet: these answer as a command without a handler does.
void TarnHandleStageSharedContentCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                         TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleUserManagedAssetsPathCommand(const TarnRequestContext&, const PlistValue&,
                                            PlistValue&, TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleDeleteUserManagedAssetCommand(const TarnRequestContext&, const PlistValue&,
                                             PlistValue&, TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

}  // namespace tarn
