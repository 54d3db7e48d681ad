// The object through which every container operation is carried out, for one
// request (or, privileged, for the daemon's own work). It carries the caller's
// rights and its command queue; it holds no container state of its own.
// Used from request threads; several connections run at once.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnCommandQueue.h"
#include "Platform/Dispatch.h"
#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnClientConnection {
public:
    TarnClientConnection(TarnClientIdentityRef clientIdentity, bool entitled,
                         bool allowOtherIdLookup, bool unrestricted,
                         std::optional<PlistValue> lookup,
                         std::optional<PlistValue> entitledWipeIdentifiers,
                         std::shared_ptr<TarnCommandQueue> commandQueue);
    // The anonymous privileged connection.
    TarnClientConnection();

    static std::shared_ptr<TarnClientConnection> initWithClientIdentity(
        TarnClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
        bool unrestricted, std::optional<PlistValue> lookup,
        std::optional<PlistValue> entitledWipeIdentifiers,
        std::shared_ptr<TarnCommandQueue> commandQueue);
    static std::shared_ptr<TarnClientConnection> privilegedClientConnectionWithUserIdentity(
        std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel = false);
    static TarnClientConnection& sharedClientConnection();

    const TarnClientIdentityRef& clientIdentity() const { return clientIdentity_; }
    std::string clientBundleIdentifier() const;
    bool entitled() const { return entitled_; }
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    bool unrestricted() const { return unrestricted_; }
    void setUnrestricted(bool value) { unrestricted_ = value; }
    void setAllowGroupIdLookup(bool value) { allowGroupIdLookup_ = value; }
    const std::shared_ptr<TarnCommandQueue>& commandQueue() const { return commandQueue_; }
    const std::optional<PlistValue>& lookup() const { return lookup_; }
    const std::optional<PlistValue>& entitledWipeIdentifiers() const {
        return entitledWipeIdentifiers_;
    }

    // Runs the command queue until it is exhausted or a command fails.
    bool completeWithError(uint64_t* error);

    // Boot work run by start-up on the shared connection.
    void rebootKeeperSetup();
    void keeperSetup();
    void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
    void keeperCleanupWithCompletion(std::function<void()> completion);

    static DispatchQueueRef _sharedBackgroundQueue();

private:
    TarnClientIdentityRef clientIdentity_;
    bool entitled_;
    bool allowOtherIdLookup_;
    bool allowGroupIdLookup_ = false;
    bool unrestricted_;
    std::optional<PlistValue> lookup_;
    std::optional<PlistValue> entitledWipeIdentifiers_;
    std::shared_ptr<TarnCommandQueue> commandQueue_;
    DispatchQueueRef backgroundQueue_;
};

}  // namespace tarn
