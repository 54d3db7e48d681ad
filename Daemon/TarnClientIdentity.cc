#include "Daemon/TarnClientIdentity.h"

#include <cstring>
#include <mutex>

#include "Daemon/TarnError.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/CodeSignRegistry.h"
#include "Platform/Conduit.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kInstallerIdentifier = "com.ostrea.installd";

const std::shared_ptr<const PlistValue>& emptyEntitlements() {
    static const auto* empty = new std::shared_ptr<const PlistValue>(
        std::make_shared<const PlistValue>(PlistDict{}));  // never freed: used until exit
    return *empty;
}

// The installer sends many requests from one process; its identity is kept.
std::mutex gInstallerMu;
TarnClientIdentityRef gInstallerIdentity;  // guarded by gInstallerMu

}  // namespace

TarnClientIdentity::TarnClientIdentity(std::string bundleIdentifier, uid_t UID, gid_t GID,
                                       pid_t PID,
                                       std::shared_ptr<const TarnUserIdentity> userIdentity,
                                       PlistValue entitlements, bool sandboxed,
                                       TarnAuditToken auditToken, bool kernel)
    : TarnClientIdentity(std::move(bundleIdentifier), UID, GID, PID, std::move(userIdentity),
                         entitlements.isDict()
                             ? std::make_shared<const PlistValue>(std::move(entitlements))
                             : nullptr,
                         sandboxed, auditToken, kernel) {}

TarnClientIdentity::TarnClientIdentity(std::string bundleIdentifier, uid_t UID, gid_t GID,
                                       pid_t PID,
                                       std::shared_ptr<const TarnUserIdentity> userIdentity,
                                       std::shared_ptr<const PlistValue> entitlements,
                                       bool sandboxed, TarnAuditToken auditToken, bool kernel)
    : sandboxed_(sandboxed),
      kernel_(kernel),
      posixPID_(PID),
      posixUID_(UID),
      posixGID_(GID),
      bundleIdentifier_(std::move(bundleIdentifier)),
      entitlements_(entitlements && entitlements->isDict() ? std::move(entitlements)
                                                           : emptyEntitlements()),
      userIdentity_(std::move(userIdentity)),
      auditToken_(auditToken) {}

TarnClientIdentityRef TarnClientIdentity::initWithBundleIdentifier(
    std::string bundleIdentifier, uid_t UID, gid_t GID, pid_t PID,
    std::shared_ptr<const TarnUserIdentity> userIdentity, PlistValue entitlements, bool sandboxed,
    TarnAuditToken auditToken, bool kernel) {
    return std::make_shared<const TarnClientIdentity>(std::move(bundleIdentifier), UID, GID, PID,
                                                      std::move(userIdentity),
                                                      std::move(entitlements), sandboxed,
                                                      auditToken, kernel);
}

bool TarnClientIdentity::boolValueOfEntitlement(std::string_view key) const {
    const PlistValue* v = entitlements_->find(key);
    if (!v || !(v->isNumber() || v->isBool())) return false;
    return v->truthy();
}

uid_t TarnClientIdentity::posixUIDForContainerClass(uint64_t containerClass) const {
    return userIdentity_ ? userIdentity_->posixUIDForContainerClass(containerClass) : posixUID_;
}

gid_t TarnClientIdentity::posixGIDForContainerClass(uint64_t containerClass) const {
    return userIdentity_ ? userIdentity_->posixGIDForContainerClass(containerClass) : posixGID_;
}

std::string TarnClientIdentity::description() const {
    return Format(
        "<%@: %p; bundleIdentifier = %@, userIdentity = %@, posixUID = %u, posixGID = %u, "
        "posixPID = %u, isSandboxed = %d, entitlements = %@>",
        "TarnClientIdentity", static_cast<const void*>(this), bundleIdentifier_, userIdentity_,
        posixUID_, posixGID_, posixPID_, sandboxed_, *entitlements_);
}

std::shared_ptr<const CodeSignInfo> TarnClientIdentity::codeSignInfoForConnection(
    const std::shared_ptr<conduit::Connection>& connection) {
    // The process is named through the connection's pidfd, never by a bare PID.
    auto exe = connection->executablePath();
    return exe ? CodeSignRegistry::shared().infoForExecutable(*exe) : nullptr;
}

TarnResult<std::string> TarnClientIdentity::_bundleIdentifierFromAuditToken(
    const std::shared_ptr<conduit::Connection>& connection) {
    auto info = codeSignInfoForConnection(connection);
    if (!info) {
        return TARN_POSIX_ERROR(ESRCH, "no code-signing registration for the executable of pid %d",
                                connection->pid());
    }
    return info->signingIdentifier;
}

TarnClientIdentityRef TarnClientIdentity::clientIdentityWithConduitConnection(
    const std::shared_ptr<conduit::Connection>& connection) {
    return clientIdentityWithConduitConnection(connection, codeSignInfoForConnection(connection));
}

TarnClientIdentityRef TarnClientIdentity::clientIdentityWithConduitConnection(
    const std::shared_ptr<conduit::Connection>& connection,
    const std::shared_ptr<const CodeSignInfo>& info, Reuse* reuse) {
    uid_t uid = connection->euid();
    gid_t gid = connection->egid();
    pid_t pid = connection->pid();
    TarnUserIdentityRef userIdentity =
        TarnUserIdentitySharedCache::sharedInstance().userIdentityForCurrentContextWithUID(
            uid, gid, info ? info->personaUniqueString : std::nullopt);
    if (reuse && reuse->identity && info && reuse->codeSignInfo == info &&
        reuse->userIdentity == userIdentity) {
        // Every build reports a registration without usable entitlements,
        // a reused one too.
        if (!info->entitlements.isDict())
            TarnLog(kLogError, "clientIdentityWithConduitConnection",
                    "Missing or malformed entitlements for pid %d", pid);
        PlatformLog("conduit", PlatformLogType::Info, "[%s] Conduit client identity: %@",
                    "clientIdentityWithConduitConnection", reuse->identity);
        return reuse->identity;
    }
    const TarnAuditToken& token = connection->auditToken();
    std::optional<std::string> identifier;
    TarnErrorRef err;
    if (info)
        identifier = info->signingIdentifier;
    else
        err = TARN_POSIX_ERROR(ESRCH, "no code-signing registration for the executable of pid %d", pid);
    bool installer = identifier && *identifier == kInstallerIdentifier;

    TarnClientIdentityRef result;
    if (installer) {
        std::lock_guard lock(gInstallerMu);
        if (gInstallerIdentity && gInstallerIdentity->auditToken() == token) result = gInstallerIdentity;
    }
    if (!result) {
        // The registry's entries never change once made: share, don't copy.
        std::shared_ptr<const PlistValue> entitlements;
        if (info && info->entitlements.isDict())
            entitlements = std::shared_ptr<const PlistValue>(info, &info->entitlements);
        else
            TarnLog(kLogError, "clientIdentityWithConduitConnection",
                    "Missing or malformed entitlements for pid %d", pid);
        bool sandboxed = info && info->sandboxed;
        if (!identifier) {
            TarnLog(kLogError, "clientIdentityWithConduitConnection",
                    "Failed to copy signing ID for pid %d : %@", pid, err);
        } else if (userIdentity) {
            result = std::make_shared<const TarnClientIdentity>(*identifier, uid, gid, pid, userIdentity,
                                                                std::move(entitlements), sandboxed,
                                                                token, false);
        }
        if (installer) {
            std::lock_guard lock(gInstallerMu);
            gInstallerIdentity = result;
        }
    }
    PlatformLog("conduit", PlatformLogType::Info, "[%s] Conduit client identity: %@",
                "clientIdentityWithConduitConnection", result);
    if (reuse) *reuse = Reuse{info, userIdentity, result};
    return result;
}

TarnClientIdentityRef TarnClientIdentity::privilegedClientIdentityWithUserIdentity(
    std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel) {
    return initWithBundleIdentifier("com.ostrea.tarnkeeperd.internal", 0, 0, 0,
                                    std::move(userIdentity), PlistValue(PlistDict{}),
                                    /*sandboxed=*/false, TarnAuditToken{}, kernel);
}

TarnClientIdentityRef TarnClientIdentity::anonymousPrivilegedClientIdentity() {
    return privilegedClientIdentityWithUserIdentity(TarnUserIdentityCache::defaultUserIdentity(),
                                                    false);
}

}  // namespace tarn
