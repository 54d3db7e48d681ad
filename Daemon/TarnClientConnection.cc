#include "Daemon/TarnClientConnection.h"

#include <mutex>

#include "Daemon/TarnError.h"

namespace tarn {

TarnClientConnection::TarnClientConnection(TarnClientIdentityRef clientIdentity, bool entitled,
                                           bool allowOtherIdLookup, bool unrestricted,
                                           std::optional<PlistValue> lookup,
                                           std::optional<PlistValue> entitledWipeIdentifiers,
                                           std::shared_ptr<TarnCommandQueue> commandQueue)
    : clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)),
      backgroundQueue_(_sharedBackgroundQueue()) {}

TarnClientConnection::TarnClientConnection()
    : TarnClientConnection(TarnClientIdentity::anonymousPrivilegedClientIdentity(), true, false,
                           true, std::nullopt, std::nullopt,
                           std::make_shared<TarnCommandQueue>()) {}

std::shared_ptr<TarnClientConnection> TarnClientConnection::initWithClientIdentity(
    TarnClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
    bool unrestricted, std::optional<PlistValue> lookup,
    std::optional<PlistValue> entitledWipeIdentifiers,
    std::shared_ptr<TarnCommandQueue> commandQueue) {
    return std::make_shared<TarnClientConnection>(
        std::move(clientIdentity), entitled, allowOtherIdLookup, unrestricted, std::move(lookup),
        std::move(entitledWipeIdentifiers), std::move(commandQueue));
}

std::shared_ptr<TarnClientConnection> TarnClientConnection::privilegedClientConnectionWithUserIdentity(
    std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel) {
    return std::make_shared<TarnClientConnection>(
        TarnClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity), kernel),
        true, true, true, std::nullopt, std::nullopt, std::make_shared<TarnCommandQueue>());
}

TarnClientConnection& TarnClientConnection::sharedClientConnection() {
    static auto* shared = new TarnClientConnection();
    return *shared;
}

std::string TarnClientConnection::clientBundleIdentifier() const {
    return clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string();
}

bool TarnClientConnection::completeWithError(uint64_t* error) {
    return commandQueue_->executeAllUntilExhaustedOrError(error);
}

// Boot set-up and clean-up steps arrive with the boot maintenance work; start-up
// already calls them in order so that the sequence and its notifications hold.
void TarnClientConnection::rebootKeeperSetup() {}
void TarnClientConnection::keeperSetup() {}
void TarnClientConnection::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
    transactionAsync(_sharedBackgroundQueue(), std::move(completion));
}
void TarnClientConnection::keeperCleanupWithCompletion(std::function<void()> completion) {
    transactionAsync(_sharedBackgroundQueue(), std::move(completion));
}

DispatchQueueRef TarnClientConnection::_sharedBackgroundQueue() {
    static DispatchQueueRef q = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.background",
                                                            DispatchQueue::global(QoS::Background));
    return q;
}

}  // namespace tarn
