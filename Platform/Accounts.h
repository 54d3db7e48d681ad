// Account lookups (getpwnam/getpwuid/getgrnam). Under the system root they ask
// libc; under a scratch root they read DIR/etc/passwd and DIR/etc/group so
// that the scratch tree is hermetic. Home directories are returned as written
// in the account database (not placed under the root prefix).
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace tarn {

struct AccountUser {
    std::string name;
    uid_t uid = 0;
    gid_t gid = 0;
    std::string home;
};

struct AccountGroup {
    std::string name;
    gid_t gid = 0;
};

std::optional<AccountUser> AccountUserByName(const std::string& name);
std::optional<AccountUser> AccountUserByUID(uid_t uid);
std::optional<AccountGroup> AccountGroupByName(const std::string& name);

// Whether the process may change owners (root, or CAP_CHOWN). When it may not,
// the file layer skips owner changes with a notice instead of failing.
bool ProcessIsPrivileged();

}  // namespace tarn
