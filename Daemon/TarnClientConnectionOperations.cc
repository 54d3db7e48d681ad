// TarnClientConnection: operations on one existing container, found by its
// concrete identity.
#include "Daemon/TarnClientConnection.h"

namespace tarn {

TarnMetadataRef TarnClientConnection::metadataWithContainerIdentity(
    const TarnConcreteContainerIdentityRef&, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
    return nullptr;
}

std::optional<PlistValue> TarnClientConnection::infoValueForKey(
    const std::optional<std::string>&, const TarnConcreteContainerIdentityRef&, bool,
    uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
    return std::nullopt;
}

void TarnClientConnection::setInfoValue(const std::optional<PlistValue>&,
                                        const std::optional<std::string>&,
                                        const TarnConcreteContainerIdentityRef&, bool,
                                        uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

uint64_t TarnClientConnection::diskUsageWithContainerIdentity(
    const TarnConcreteContainerIdentityRef&, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
    return 0;
}

void TarnClientConnection::recreateDefaultStructureWithContainerIdentity(
    const TarnConcreteContainerIdentityRef&, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

void TarnClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const TarnConcreteContainerIdentityRef&, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

}  // namespace tarn
