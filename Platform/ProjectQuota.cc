#include "Platform/ProjectQuota.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <linux/quota.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "Platform/FileSystem.h"

namespace tarn {

namespace {

// Ids below this are left to administrators' own projects.
constexpr uint32_t kFirstProjectID = 1u << 16;
// The last id is reserved by some tools as "none".
constexpr uint32_t kProjectIDSpan = UINT32_MAX - 1 - kFirstProjectID;
constexpr int kChooseAttempts = 32;

int errnoOr(int fallback) { return errno ? errno : fallback; }

int openNoFollow(const std::string& path, int flags, FsFd* out) {
    int fd;
    do {
        fd = ::open(path.c_str(), flags | O_NOFOLLOW | O_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) return errnoOr(EIO);
    *out = FsFd(fd);
    return 0;
}

}  // namespace

int ProjectQuotaUsageOf(const std::string& path, uint32_t projectID, ProjectQuotaUsage* usage) {
#ifdef SYS_quotactl_fd
    FsFd fd;
    // quotactl_fd wants a real descriptor, not an O_PATH one.
    if (int err = openNoFollow(path, O_RDONLY | O_NONBLOCK, &fd)) return err;
    struct if_dqblk quota {};
    if (::syscall(SYS_quotactl_fd, fd.get(), QCMD(Q_GETQUOTA, PRJQUOTA), projectID, &quota) != 0)
        return errnoOr(EIO);
    if (!(quota.dqb_valid & QIF_SPACE) || !(quota.dqb_valid & QIF_INODES)) return ENODATA;
    usage->bytes = quota.dqb_curspace;
    usage->inodes = quota.dqb_curinodes;
    return 0;
#else
    (void)path;
    (void)projectID;
    (void)usage;
    return ENOSYS;
#endif
}

int ProjectQuotaChooseID(const std::string& path, uint32_t seed, uint32_t* projectID) {
    for (int attempt = 0; attempt < kChooseAttempts; ++attempt) {
        const uint32_t candidate =
            kFirstProjectID + static_cast<uint32_t>((uint64_t{seed} + attempt) % kProjectIDSpan);
        ProjectQuotaUsage usage;
        if (int err = ProjectQuotaUsageOf(path, candidate, &usage)) return err;
        if (usage.inodes == 0 && usage.bytes == 0) {
            *projectID = candidate;
            return 0;
        }
    }
    return EEXIST;
}

int ProjectQuotaAssign(const std::string& path, uint32_t projectID) {
    FsFd fd;
    if (int err = openNoFollow(path, O_RDONLY | O_NONBLOCK, &fd)) return err;
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) return errnoOr(EIO);
    struct fsxattr attributes {};
    if (::ioctl(fd.get(), FS_IOC_FSGETXATTR, &attributes) != 0) return errnoOr(EIO);
    attributes.fsx_projid = projectID;
    if (S_ISDIR(status.st_mode)) attributes.fsx_xflags |= FS_XFLAG_PROJINHERIT;
    if (::ioctl(fd.get(), FS_IOC_FSSETXATTR, &attributes) != 0) return errnoOr(EIO);
    return 0;
}

int ProjectQuotaRead(const std::string& path, uint32_t* projectID, bool* inherits) {
    FsFd fd;
    if (int err = openNoFollow(path, O_RDONLY | O_NONBLOCK, &fd)) return err;
    struct fsxattr attributes {};
    if (::ioctl(fd.get(), FS_IOC_FSGETXATTR, &attributes) != 0) return errnoOr(EIO);
    *projectID = attributes.fsx_projid;
    *inherits = (attributes.fsx_xflags & FS_XFLAG_PROJINHERIT) != 0;
    return 0;
}

}  // namespace tarn
