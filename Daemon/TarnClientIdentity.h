// Who is asking: the caller's code-signing identifier, POSIX credentials,
// process, user identity (persona), entitlements, sandbox flag and audit
// token. Immutable once made; shared freely between threads.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "Platform/PropertyList.h"

namespace tarn {

namespace conduit {
class Connection;
}
class TarnUserIdentity;
template <class T>
class TarnResult;  // Daemon/TarnResult.h
struct CodeSignInfo;

using TarnAuditToken = std::array<uint8_t, 32>;

class TarnClientIdentity;
using TarnClientIdentityRef = std::shared_ptr<const TarnClientIdentity>;

class TarnClientIdentity {
public:
    TarnClientIdentity(std::string bundleIdentifier, uid_t UID, gid_t GID, pid_t PID,
                       std::shared_ptr<const TarnUserIdentity> userIdentity,
                       PlistValue entitlements, bool sandboxed, TarnAuditToken auditToken,
                       bool kernel);
    // Shares the entitlements (typically the registry's own), copying nothing.
    TarnClientIdentity(std::string bundleIdentifier, uid_t UID, gid_t GID, pid_t PID,
                       std::shared_ptr<const TarnUserIdentity> userIdentity,
                       std::shared_ptr<const PlistValue> entitlements, bool sandboxed,
                       TarnAuditToken auditToken, bool kernel);

    static TarnClientIdentityRef initWithBundleIdentifier(
        std::string bundleIdentifier, uid_t UID, gid_t GID, pid_t PID,
        std::shared_ptr<const TarnUserIdentity> userIdentity, PlistValue entitlements,
        bool sandboxed, TarnAuditToken auditToken, bool kernel);

    bool isSandboxed() const { return sandboxed_; }
    bool isKernel() const { return kernel_; }
    pid_t posixPID() const { return posixPID_; }
    uid_t posixUID() const { return posixUID_; }
    gid_t posixGID() const { return posixGID_; }
    const std::string& bundleIdentifier() const { return bundleIdentifier_; }
    // Always a dictionary (empty when the caller has none).
    const PlistValue& entitlements() const { return *entitlements_; }
    const std::shared_ptr<const TarnUserIdentity>& userIdentity() const { return userIdentity_; }
    const TarnAuditToken& auditToken() const { return auditToken_; }

    // True only for an entitlement whose value is a number (or boolean) that is non-zero.
    bool boolValueOfEntitlement(std::string_view key) const;
    uid_t posixUIDForContainerClass(uint64_t containerClass) const;
    gid_t posixGIDForContainerClass(uint64_t containerClass) const;
    std::string description() const;

    // The caller of a peer connection, or nullptr (no signing identifier or no
    // user identity). Thread-safe.
    static TarnClientIdentityRef clientIdentityWithConduitConnection(
        const std::shared_ptr<conduit::Connection>& connection);
    // The same with the peer's code-signing registration already looked up
    // (the request processor needs it first, to make the peer's persona current).
    // `reuse`, when given, is one connection's slot (used only from that
    // connection's serial queue): the identity made for its last request is
    // answered again while the registration and user identity behind it are
    // the same objects, so that a client sending many requests costs no
    // rebuilding.
    struct Reuse {
        std::shared_ptr<const CodeSignInfo> codeSignInfo;
        std::shared_ptr<const TarnUserIdentity> userIdentity;
        TarnClientIdentityRef identity;
    };
    static TarnClientIdentityRef clientIdentityWithConduitConnection(
        const std::shared_ptr<conduit::Connection>& connection,
        const std::shared_ptr<const CodeSignInfo>& codeSignInfo, Reuse* reuse = nullptr);
    // The peer's registration, read once per request through its pidfd.
    static std::shared_ptr<const CodeSignInfo> codeSignInfoForConnection(
        const std::shared_ptr<conduit::Connection>& connection);
    // The code-signing identifier of the process behind the connection, or a
    // POSIX ESRCH error when its executable has no code-signing registration.
    static TarnResult<std::string> _bundleIdentifierFromAuditToken(
        const std::shared_ptr<conduit::Connection>& connection);
    static TarnClientIdentityRef privilegedClientIdentityWithUserIdentity(
        std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel);
    static TarnClientIdentityRef anonymousPrivilegedClientIdentity();

private:
    bool sandboxed_;
    bool kernel_;
    pid_t posixPID_;
    uid_t posixUID_;
    gid_t posixGID_;
    std::string bundleIdentifier_;
    std::shared_ptr<const PlistValue> entitlements_;  // never null
    std::shared_ptr<const TarnUserIdentity> userIdentity_;
    TarnAuditToken auditToken_;
};

}  // namespace tarn
