#include "Daemon/TarnGroupCommands.h"

#include "Daemon/TarnError.h"

namespace tarn {

// Not built yet: these answer as a command without a handler does.
void TarnHandleGroupContainersCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                      TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleSystemContainerPathCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                          TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleSystemGroupContainersCommand(const TarnRequestContext&, const PlistValue&,
                                            PlistValue&, TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleSystemGroupContainerPathCommand(const TarnRequestContext&, const PlistValue&,
                                               PlistValue&, TarnClientConnection*,
                                               uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandleRetryTestCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnHandlePersonaStringsCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                     TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

}  // namespace tarn
