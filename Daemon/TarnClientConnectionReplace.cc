// Replacement of one container by another, and recovery of replacements a
// previous run left behind.
#include "Daemon/TarnClientConnection.h"

namespace tarn {

TarnStatus TarnClientConnection::_recoverFromReplaceOperationsWithError() { return {}; }

}  // namespace tarn
