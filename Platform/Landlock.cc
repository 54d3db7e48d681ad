#include "Platform/Landlock.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>

#include "Platform/Failpoints.h"
#include "Platform/FileSystem.h"
#include "Platform/Format.h"

// Rights newer than some installed headers.
#ifndef LANDLOCK_ACCESS_FS_TRUNCATE
#define LANDLOCK_ACCESS_FS_TRUNCATE (1ULL << 14)
#endif
#ifndef LANDLOCK_ACCESS_FS_IOCTL_DEV
#define LANDLOCK_ACCESS_FS_IOCTL_DEV (1ULL << 15)
#endif

namespace tarn {

namespace {

constexpr uint64_t kReadRights =
    LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
// The rights that make sense on a file rather than a directory.
constexpr uint64_t kFileRights = LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                                 LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_TRUNCATE |
                                 LANDLOCK_ACCESS_FS_IOCTL_DEV;

// Every file-system right ABI version `abi` knows.
uint64_t handledRights(int abi) {
    uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // version 1
    if (abi >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
    if (abi >= 3) rights |= LANDLOCK_ACCESS_FS_TRUNCATE;
    if (abi >= 5) rights |= LANDLOCK_ACCESS_FS_IOCTL_DEV;
    return rights;
}

std::string errText(int err) { return std::strerror(err); }

// Adds a rule for `path`; *missing when it does not exist.
int addRule(int ruleset, const std::string& path, uint64_t rights, bool* missing,
            std::string* why) {
    *missing = false;
    const int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
    if (fd < 0) {
        const int err = errno;
        *missing = err == ENOENT;
        *why = Format("cannot open %s: %s", path, errText(err));
        return err;
    }
    FsFd holder(fd);
    struct stat status {};
    if (::fstat(fd, &status) != 0) {
        const int err = errno;
        *why = Format("cannot stat %s: %s", path, errText(err));
        return err;
    }
    if (!S_ISDIR(status.st_mode)) rights &= kFileRights;
    struct landlock_path_beneath_attr rule {};
    rule.allowed_access = rights;
    rule.parent_fd = fd;
    if (::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) != 0) {
        const int err = errno;
        *why = Format("landlock_add_rule(%s): %s", path, errText(err));
        return err;
    }
    return 0;
}

}  // namespace

int LandlockABIVersion(std::string* why) {
    long abi = -1;
    if (auto injected = TARN_FAILPOINT("landlock.abi"))
        errno = *injected;
    else
        abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
    if (abi > 0) return static_cast<int>(abi);
    const int err = errno;
    *why = err == ENOSYS       ? "the kernel was built without Landlock"
           : err == EOPNOTSUPP ? "Landlock is disabled at boot (see the lsm= kernel parameter)"
                               : Format("landlock_create_ruleset: %s", errText(err));
    return 0;
}

std::unique_ptr<LandlockRuleset> LandlockRuleset::create(const LandlockPolicy& policy,
                                                         std::string* why) {
    const int abi = LandlockABIVersion(why);
    if (abi == 0) return nullptr;
    const uint64_t handled = handledRights(abi);
    struct landlock_ruleset_attr attributes {};
    attributes.handled_access_fs = handled;
    const long fd = ::syscall(SYS_landlock_create_ruleset, &attributes, sizeof attributes, 0);
    if (fd < 0) {
        *why = Format("landlock_create_ruleset: %s", errText(errno));
        return nullptr;
    }
    std::unique_ptr<LandlockRuleset> ruleset(new LandlockRuleset(static_cast<int>(fd)));
    bool missing = false;
    for (const std::string& path : policy.writable)
        if (addRule(ruleset->fd_, path, handled, &missing, why) != 0) return nullptr;
    for (const std::string& path : policy.readable)
        if (addRule(ruleset->fd_, path, handled & kReadRights, &missing, why) != 0 && !missing)
            return nullptr;
    const uint64_t readWrite =
        handled & (LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_WRITE_FILE |
                   LANDLOCK_ACCESS_FS_TRUNCATE);
    for (const std::string& path : policy.readWriteFiles)
        if (addRule(ruleset->fd_, path, readWrite, &missing, why) != 0 && !missing) return nullptr;
    why->clear();
    return ruleset;
}

LandlockRuleset::~LandlockRuleset() { (void)::close(fd_); }

int LandlockRuleset::enforce(std::string* why) {
    // Required of an unprivileged caller, and what a confined program should
    // have anyway: no set-user-id escape from the sandbox.
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) {
        const int err = errno;
        *why = Format("prctl(PR_SET_NO_NEW_PRIVS): %s", errText(err));
        return err;
    }
    if (::syscall(SYS_landlock_restrict_self, fd_, 0) != 0) {
        const int err = errno;
        *why = Format("landlock_restrict_self: %s", errText(err));
        return err;
    }
    return 0;
}

}  // namespace tarn
