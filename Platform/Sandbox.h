// Sandbox checks and file extensions.
//
// Whether a process is sandboxed is the code-signing registry's "Sandboxed"
// flag, read once per request into TarnClientIdentity::isSandboxed(); this
// layer adds the extension tokens the daemon hands to sandboxed clients.
//
// An extension token grants one process (by audit token) access of one class
// to one path. Linux layer: the token is self-authenticating text,
//
//     "1;" CLASS ";" HEX(PATH) ";" HEX(AUDIT_TOKEN) ";" HEX(HMAC)
//
// where HEX is lower-case hexadecimal, AUDIT_TOKEN the 32 bytes of the
// client's audit token and HMAC = HMAC-SHA256(key, "1;" CLASS ";" HEX(PATH)
// ";" HEX(AUDIT_TOKEN)), i.e. over everything before the last ';'. The key is
// 32 random bytes made on first use for this boot and kept in
// DIR/run/tarnkeeper/extension-key (mode 0600, created exclusively so that
// concurrent first users agree on one key); it vanishes with DIR/run, which
// invalidates every token at reboot. A consumer holding the key checks a
// token with SandboxExtensionVerify().
//
// Thread-safe.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>

namespace tarn {

using SandboxAuditToken = std::array<uint8_t, 32>;

// Extension classes the daemon issues.
inline constexpr const char* kSandboxExtensionClassContainer = "com.ostrea.sandbox.container";
inline constexpr const char* kSandboxExtensionClassApplicationGroup =
    "com.ostrea.sandbox.application-group";

// Issues a token, or nullopt with an errno value in *error (EINVAL for an
// empty class or path, or a class containing ';'; otherwise the failure to
// read or make the key).
std::optional<std::string> SandboxExtensionIssueFile(const std::string& extensionClass,
                                                     const std::string& path,
                                                     const SandboxAuditToken& auditToken,
                                                     int* error);

// True when `token` is well formed, carries a valid HMAC under this boot's
// key and names exactly this class, path and audit token.
bool SandboxExtensionVerify(const std::string& token, const std::string& extensionClass,
                            const std::string& path, const SandboxAuditToken& auditToken);

// DIR/run/tarnkeeper/extension-key below the current root prefix.
std::string SandboxExtensionKeyPath();

}  // namespace tarn
