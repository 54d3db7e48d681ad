// TarnClientConnection: the user-managed assets directory of a data
// container and the staging of shared content inside a system group
// container. Clients name paths relative to a container the daemon acts on
// as root, so every path is checked to stay inside it.
#include "Daemon/TarnClientConnection.h"

namespace tarn {

// Not built yet.
TarnResult<TarnClientConnection::AssetsPath>
TarnClientConnection::userManagedAssetsPathWithContainerIdentity(const TarnContainerIdentityRef&,
                                                                 bool, bool) {
    return TARN_ERROR_CODE(TarnErrorInvalidCommand, nullptr);
}

TarnStatus TarnClientConnection::deleteUserManagedAssetWithContainerIdentity(
    const TarnContainerIdentityRef&, const std::optional<std::string>&) {
    return TARN_ERROR_CODE(TarnErrorInvalidCommand, nullptr);
}

TarnStatus TarnClientConnection::stageSharedContentForIdentifier(
    const std::optional<std::string>&, const std::optional<std::string>&,
    const std::optional<std::string>&) {
    return TARN_ERROR_CODE(TarnErrorInvalidCommand, nullptr);
}

}  // namespace tarn
