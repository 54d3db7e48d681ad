// TarnClientConnection: the group containers of an owner, and the retry test.
#include "Daemon/TarnClientConnection.h"

namespace tarn {

// Not built yet.
TarnResult<std::map<std::string, TarnMetadataRef>>
TarnClientConnection::groupContainersForOwnerIdentifier(const std::string&,
                                                        const TarnUserIdentityRef&,
                                                        TarnContainerClass) {
    return TARN_ERROR_CODE(TarnErrorInvalidCommand, nullptr);
}

TarnStatus TarnClientConnection::retryTestWithNumCrashes(uint64_t) {
    return TARN_ERROR_CODE(TarnErrorInvalidCommand, nullptr);
}

}  // namespace tarn
