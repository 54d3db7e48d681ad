// Boot work of the shared connection: set-up before the listener opens,
// clean-up on the background queue while requests are already served.
#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnLog.h"

namespace tarn {

void TarnClientConnection::rebootKeeperSetup() {}

void TarnClientConnection::keeperSetup() {
    if (auto recovered = _recoverFromReplaceOperationsWithError(); !recovered)
        TarnLog(kLogError, "keeperSetup", "Failed recovering from replace operations: %@",
                recovered.error());
    if (auto restarted = TarnDataProtectionManager::defaultManager()
                             .restartPendingDataProtectionOperationsWithError();
        !restarted)
        TarnLog(kLogError, "keeperSetup",
                "Failed restarting pending data protection operations: %@", restarted.error());
}

void TarnClientConnection::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
    transactionAsync(_sharedBackgroundQueue(), std::move(completion));
}

void TarnClientConnection::keeperCleanupWithCompletion(std::function<void()> completion) {
    transactionAsync(_sharedBackgroundQueue(), std::move(completion));
}

}  // namespace tarn
