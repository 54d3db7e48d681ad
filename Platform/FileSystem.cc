#include "Platform/FileSystem.h"

#include <acl/libacl.h>
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <linux/fs.h>
#include <linux/openat2.h>
#include <stdlib.h>
#include <string.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <unordered_set>

#include "Platform/Failpoints.h"

namespace tarn {

namespace {

constexpr size_t kPathBufferSize = 1024;  // the platform's maximum path length

FsStat fromStat(const struct stat& s) {
    FsStat o;
    o.dev = s.st_dev;
    o.ino = s.st_ino;
    o.nlink = s.st_nlink;
    o.mode = s.st_mode;
    o.uid = s.st_uid;
    o.gid = s.st_gid;
    o.size = s.st_size;
    o.blocks = s.st_blocks;
    o.mtimeSec = s.st_mtim.tv_sec;
    return o;
}

int errnoOr(int fallback) { return errno ? errno : fallback; }

// Retries a call interrupted by a signal.
template <class F>
auto noEintr(F f) {
    decltype(f()) r;
    do {
        r = f();
    } while (r == -1 && errno == EINTR);
    return r;
}

std::string joinPath(const std::string& dir, const std::string& name) {
    if (dir.empty()) return name;
    if (dir.back() == '/') return dir + name;
    return dir + "/" + name;
}

// Splits "a/b/c" into its parent directory and last component for the *At
// calls. The parent is trusted (the caller named it); the last component is
// never followed.
void splitParent(const std::string& path, std::string* parent, std::string* name) {
    auto end = path.find_last_not_of('/');
    if (end == std::string::npos) {
        *parent = "/";
        *name = ".";
        return;
    }
    auto slash = path.rfind('/', end);
    if (slash == std::string::npos) {
        *parent = ".";
        *name = path.substr(0, end + 1);
    } else {
        *parent = slash == 0 ? "/" : path.substr(0, slash);
        *name = path.substr(slash + 1, end - slash);
    }
}

int openParent(const std::string& path, FsFd* parentFd, std::string* name) {
    std::string parent;
    splitParent(path, &parent, name);
    int fd = noEintr([&] { return ::open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC); });
    if (fd < 0) return errnoOr(EIO);
    *parentFd = FsFd(fd);
    return 0;
}

// Every name but "." and ".." with its d_type, in directory order.
template <class F>
int forEachName(int dirFd, F each) {
    int dupFd = ::fcntl(dirFd, F_DUPFD_CLOEXEC, 0);
    if (dupFd < 0) return errnoOr(EIO);
    DIR* dir = ::fdopendir(dupFd);
    if (!dir) {
        int err = errnoOr(EIO);
        ::close(dupFd);
        return err;
    }
    ::rewinddir(dir);
    int err = 0;
    for (;;) {
        errno = 0;
        struct dirent* e = ::readdir(dir);
        if (!e) {
            err = errno;
            break;
        }
        if (e->d_name[0] == '.' &&
            (e->d_name[1] == 0 || (e->d_name[1] == '.' && e->d_name[2] == 0)))
            continue;
        each(e->d_name, e->d_type);
    }
    ::closedir(dir);
    return err;
}

// Directory names read whole before anything is changed, so that removal
// and creation inside the directory cannot disturb the listing.
int readNames(int dirFd, std::vector<std::pair<std::string, unsigned char>>* out) {
    return forEachName(
        dirFd, [out](const char* name, unsigned char type) { out->emplace_back(name, type); });
}

// The entry that reports a directory whose listing failed with `err`: it
// stands one level above its children, at the directory itself.
FsWalkEntry listingErrorEntry(int dirFd, const std::string& dirPath, int level, int err) {
    FsWalkEntry e;
    e.path = dirPath;
    e.level = level - 1;
    e.type = FsWalkType::Error;
    e.error = err;
    e.fd = dirFd;
    return e;
}

int openDirAt(int dirFd, const std::string& name, FsFd* fd) {
    int f = noEintr([&] {
        return ::openat(dirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    });
    if (f < 0) return errnoOr(EIO);
    *fd = FsFd(f);
    return 0;
}

FsWalkType walkTypeOf(uint32_t mode) {
    if (S_ISDIR(mode)) return FsWalkType::Directory;
    if (S_ISREG(mode)) return FsWalkType::File;
    if (S_ISLNK(mode)) return FsWalkType::Symlink;
    return FsWalkType::Other;
}

}  // namespace

bool FsStat::isDirectory() const { return S_ISDIR(mode); }
bool FsStat::isRegular() const { return S_ISREG(mode); }
bool FsStat::isSymlink() const { return S_ISLNK(mode); }

FsFd::~FsFd() {
    if (fd_ >= 0) ::close(fd_);
}

FsFd& FsFd::operator=(FsFd&& o) noexcept {
    if (this != &o) {
        if (fd_ >= 0) ::close(fd_);
        fd_ = o.release();
    }
    return *this;
}

std::string FsErrorText(int err) {
    char buf[256];
    return std::string(::strerror_r(err, buf, sizeof buf));
}

// ---- Paths ----

int FsRealPath(const std::string& path, std::string* out, std::string* partial) {
    char buf[PATH_MAX + 1] = {};  // realpath(3) writes up to PATH_MAX bytes
    if (::realpath(path.c_str(), buf) == nullptr) {
        int err = errnoOr(EIO);
        if (partial) *partial = std::string(buf, ::strnlen(buf, kPathBufferSize));
        return err;
    }
    if (::strlen(buf) >= kPathBufferSize) return ENAMETOOLONG;
    *out = buf;
    return 0;
}

int FsReadLink(const std::string& path, std::string* target) {
    char buf[kPathBufferSize] = {};
    ssize_t n = ::readlink(path.c_str(), buf, sizeof buf - 1);
    if (n < 0) return errnoOr(EIO);
    target->assign(buf, static_cast<size_t>(n));
    return 0;
}

int FsLstat(const std::string& path, FsStat* st) {
    struct stat s;
    if (::lstat(path.c_str(), &s) != 0) return errnoOr(EIO);
    if (st) *st = fromStat(s);
    return 0;
}

int FsStatFollow(const std::string& path, FsStat* st) {
    struct stat s;
    if (::stat(path.c_str(), &s) != 0) return errnoOr(EIO);
    if (st) *st = fromStat(s);
    return 0;
}

int FsStatAt(int dirFd, const std::string& name, FsStat* st) {
    struct stat s;
    if (::fstatat(dirFd, name.c_str(), &s, AT_SYMLINK_NOFOLLOW) != 0) return errnoOr(EIO);
    if (st) *st = fromStat(s);
    return 0;
}

// ---- Directories and names ----

int FsMkdir(const std::string& path, mode_t mode) {
    return ::mkdir(path.c_str(), mode) == 0 ? 0 : errnoOr(EIO);
}

int FsMakePath(const std::string& path, mode_t mode, bool* created) {
    if (created) *created = false;
    if (path.empty()) return ENOENT;
    // Leaf first: the parents nearly always exist, so one mkdir usually
    // settles it; only a missing parent sends us up the path (like mkdir -p,
    // each missing component is made with `mode`).
    if (::mkdir(path.c_str(), mode) == 0) {
        if (created) *created = true;
        return 0;
    }
    int err = errno;
    if (err == ENOENT) {
        size_t end = path.find_last_not_of('/');
        size_t slash = end == std::string::npos ? std::string::npos : path.rfind('/', end);
        if (slash == std::string::npos) return ENOENT;
        const std::string parent = path.substr(0, slash == 0 ? 1 : slash);
        if (parent != path) {
            if (int perr = FsMakePath(parent, mode); perr != 0) return perr;
        }
        if (::mkdir(path.c_str(), mode) == 0) {
            if (created) *created = true;
            return 0;
        }
        err = errno;
    }
    if (err != EEXIST) return err;
    // An existing directory is success; anything else in the way is not.
    struct stat s;
    if (::stat(path.c_str(), &s) != 0) return errnoOr(EIO);
    return S_ISDIR(s.st_mode) ? 0 : ENOTDIR;
}

int FsMkdtemp(std::string* pathTemplate) {
    if (::mkdtemp(pathTemplate->data()) == nullptr) return errnoOr(EIO);
    return 0;
}

int FsRename(const std::string& from, const std::string& to) {
    return ::rename(from.c_str(), to.c_str()) == 0 ? 0 : errnoOr(EIO);
}

int FsRenameExchange(const std::string& first, const std::string& second) {
    return ::renameat2(AT_FDCWD, first.c_str(), AT_FDCWD, second.c_str(), RENAME_EXCHANGE) == 0
               ? 0
               : errnoOr(EIO);
}

int FsUnlinkAt(int dirFd, const std::string& name, bool directory) {
    return ::unlinkat(dirFd, name.c_str(), directory ? AT_REMOVEDIR : 0) == 0 ? 0 : errnoOr(EIO);
}

int FsOpenDirectory(const std::string& path, FsFd* fd) {
    int f = noEintr([&] {
        return ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    });
    if (f < 0) return errnoOr(EIO);
    *fd = FsFd(f);
    return 0;
}

int FsOpenItem(int dirFd, const std::string& name, FsFd* fd) {
    int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
    int f = noEintr([&] {
        return dirFd < 0 ? ::open(name.c_str(), flags) : ::openat(dirFd, name.c_str(), flags);
    });
    if (f < 0) return errnoOr(EIO);
    *fd = FsFd(f);
    return 0;
}

int FsFsyncDirectoryOf(const std::string& path) {
    FsFd parent;
    std::string name;
    if (int err = openParent(path, &parent, &name)) return err;
    return ::fsync(parent.get()) == 0 ? 0 : errnoOr(EIO);
}

int FsOpenParent(const std::string& path, FsFd* parent, std::string* name) {
    return openParent(path, parent, name);
}

// ---- Client-named paths below a directory held open ----

namespace {

std::atomic<bool> gForceComponentWalk{false};
// Set once openat2(2) has answered ENOSYS: the kernel will not grow it.
std::atomic<bool> gNoOpenat2{false};

constexpr int kBeneathOpenFlags = O_RDONLY | O_DIRECTORY | O_CLOEXEC;

// The components of a client's relative path that name something: empty and
// "." ones dropped. EXDEV for what would leave the starting directory.
int beneathComponents(const std::string& relativePath, std::vector<std::string>* out) {
    if (!relativePath.empty() && relativePath[0] == '/') return EXDEV;
    size_t start = 0;
    while (start <= relativePath.size()) {
        size_t slash = relativePath.find('/', start);
        if (slash == std::string::npos) slash = relativePath.size();
        std::string component = relativePath.substr(start, slash - start);
        if (component == "..") return EXDEV;
        if (!component.empty() && component != ".") out->push_back(std::move(component));
        start = slash + 1;
    }
    return 0;
}

// 1: opened; 0: the kernel has no openat2(2); otherwise -errno.
int openBeneathWithOpenat2(int dirFd, const std::string& relativePath, FsFd* out) {
#ifdef SYS_openat2
    if (gNoOpenat2.load(std::memory_order_relaxed)) return 0;
    struct open_how how = {};
    how.flags = kBeneathOpenFlags;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    const char* path = relativePath.empty() ? "." : relativePath.c_str();
    // EAGAIN: a rename elsewhere on the file system raced the lookup; the
    // kernel asks for a retry rather than risk a wrong answer.
    long fd = -1;
    for (int attempt = 0; attempt < 16; ++attempt) {
        fd = noEintr([&] { return ::syscall(SYS_openat2, dirFd, path, &how, sizeof how); });
        if (fd >= 0 || errno != EAGAIN) break;
    }
    if (fd >= 0) {
        *out = FsFd(static_cast<int>(fd));
        return 1;
    }
    if (errno == ENOSYS) {
        gNoOpenat2.store(true, std::memory_order_relaxed);
        return 0;
    }
    return -errnoOr(EIO);
#else
    (void)dirFd;
    (void)relativePath;
    (void)out;
    return 0;
#endif
}

}  // namespace

int FsOpenDirectoryBeneath(int dirFd, const std::string& relativePath, FsFd* out) {
    std::vector<std::string> components;
    // Refused here for both ways alike: openat2 would answer EXDEV as well.
    if (int err = beneathComponents(relativePath, &components)) return err;
    if (!gForceComponentWalk.load(std::memory_order_relaxed)) {
        const int opened = openBeneathWithOpenat2(dirFd, relativePath, out);
        if (opened == 1) return 0;
        if (opened < 0) return -opened;
    }
    int f = noEintr([&] { return ::openat(dirFd, ".", kBeneathOpenFlags); });
    if (f < 0) return errnoOr(EIO);
    FsFd current(f);
    for (const std::string& component : components) {
        f = noEintr([&] {
            return ::openat(current.get(), component.c_str(), kBeneathOpenFlags | O_NOFOLLOW);
        });
        if (f < 0) {
            int err = errnoOr(EIO);
            // With O_DIRECTORY a link fails as ENOTDIR; it is answered as
            // RESOLVE_NO_SYMLINKS answers it. The check is only for the
            // answer: nothing was opened through the link either way.
            struct stat s;
            if (err == ENOTDIR &&
                ::fstatat(current.get(), component.c_str(), &s, AT_SYMLINK_NOFOLLOW) == 0 &&
                S_ISLNK(s.st_mode))
                err = ELOOP;
            return err;
        }
        current = FsFd(f);
    }
    *out = std::move(current);
    return 0;
}

void FsTEST_forceComponentWalk(bool force) { gForceComponentWalk.store(force); }

int FsRenameAt(int fromDirFd, const std::string& fromName, int toDirFd, const std::string& toName) {
    return ::renameat(fromDirFd, fromName.c_str(), toDirFd, toName.c_str()) == 0 ? 0
                                                                                   : errnoOr(EIO);
}

int FsMkdtempAt(int dirFd, const std::string& prefix, std::string* name) {
    static constexpr char kLetters[] =
        "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
    // As mkdtemp(3): a taken name is tried again with another suffix.
    for (int attempt = 0; attempt < 100; ++attempt) {
        std::string candidate = prefix;
        for (int i = 0; i < 6; ++i)
            candidate += kLetters[::arc4random_uniform(sizeof kLetters - 1)];
        if (::mkdirat(dirFd, candidate.c_str(), 0700) == 0) {
            *name = std::move(candidate);
            return 0;
        }
        if (errno != EEXIST) return errnoOr(EIO);
    }
    return EEXIST;
}

int FsForEachNameAt(int dirFd, const std::function<void(std::string_view name)>& each) {
    return forEachName(dirFd, [&each](const char* name, unsigned char) { each(name); });
}

int FsListDirectory(const std::string& path, std::vector<FsDirEntry>* out) {
    FsFd dir;
    int f = noEintr([&] { return ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC); });
    if (f < 0) return errnoOr(EIO);
    dir = FsFd(f);
    std::vector<std::pair<std::string, unsigned char>> names;
    if (int err = readNames(dir.get(), &names)) return err;
    out->clear();
    out->reserve(names.size());
    for (auto& [name, dtype] : names) {
        FsDirEntry e{{}, FsEntryType::Unknown};
        switch (dtype) {
            case DT_DIR: e.type = FsEntryType::Directory; break;
            case DT_REG: e.type = FsEntryType::File; break;
            case DT_LNK: e.type = FsEntryType::Symlink; break;
            case DT_UNKNOWN: {
                struct stat s;
                if (::stat(joinPath(path, name).c_str(), &s) == 0) {
                    if (S_ISDIR(s.st_mode)) e.type = FsEntryType::Directory;
                    else if (S_ISLNK(s.st_mode)) e.type = FsEntryType::Symlink;
                    else if (S_ISREG(s.st_mode)) e.type = FsEntryType::File;
                }
                break;
            }
            default: e.type = FsEntryType::Other; break;
        }
        e.name = std::move(name);
        out->push_back(std::move(e));
    }
    return 0;
}

// ---- Ownership and modes ----

int FsChown(const std::string& path, uid_t uid, gid_t gid) {
    return ::chown(path.c_str(), uid, gid) == 0 ? 0 : errnoOr(EIO);
}

int FsChownFd(int fd, uid_t uid, gid_t gid) {
    return ::fchown(fd, uid, gid) == 0 ? 0 : errnoOr(EIO);
}

int FsChownAt(int dirFd, const std::string& name, uid_t uid, gid_t gid) {
    return ::fchownat(dirFd, name.c_str(), uid, gid, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errnoOr(EIO);
}

int FsChmodAt(int dirFd, const std::string& name, mode_t mode) {
    // fchmodat(AT_SYMLINK_NOFOLLOW) is not in every kernel; go through a
    // descriptor opened without following instead. O_PATH opens anything,
    // and fchmod through /proc/self/fd acts on that very inode.
    int f = noEintr([&] {
        return ::openat(dirFd, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC);
    });
    if (f < 0) return errnoOr(EIO);
    FsFd fd(f);
    struct stat s;
    if (::fstat(fd.get(), &s) != 0) return errnoOr(EIO);
    if (S_ISLNK(s.st_mode)) return EOPNOTSUPP;
    char proc[64];
    std::snprintf(proc, sizeof proc, "/proc/self/fd/%d", fd.get());
    return ::chmod(proc, mode) == 0 ? 0 : errnoOr(EIO);
}

// ---- Flags ----

int FsGetImmutableAt(int dirFd, const std::string& name, bool* immutable) {
    FsFd fd;
    int err = FsOpenItem(dirFd, name, &fd);
    if (err == ELOOP) {  // a link: links carry no flags on Linux
        *immutable = false;
        return 0;
    }
    if (err) return err;
    int flags = 0;
    if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) {
        err = errnoOr(EIO);
        if (err == ENOTTY || err == EOPNOTSUPP || err == EINVAL) {
            *immutable = false;  // this file system keeps no flags
            return 0;
        }
        return err;
    }
    *immutable = (flags & FS_IMMUTABLE_FL) != 0;
    return 0;
}

int FsSetImmutableAt(int dirFd, const std::string& name, bool immutable) {
    FsFd fd;
    if (int err = FsOpenItem(dirFd, name, &fd)) return err;
    int flags = 0;
    if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return errnoOr(EIO);
    int wanted = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    if (wanted == flags) return 0;
    return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &wanted) == 0 ? 0 : errnoOr(EIO);
}

// ---- Data-protection class ----

const char* FsProtectionClassAttributeName() {
    // The trusted namespace needs CAP_SYS_ADMIN; an unprivileged development
    // daemon keeps the class where it may write. Asked for every directory
    // the daemon makes; its user does not change while it runs.
    static const char* const name = ::geteuid() == 0 ? "trusted.tarnkeeper.protection-class"
                                                     : "user.tarnkeeper.protection-class";
    return name;
}

int FsGetProtectionClass(int fd, int32_t* cls) {
    int32_t v = 0;
    ssize_t n = ::fgetxattr(fd, FsProtectionClassAttributeName(), &v, sizeof v);
    if (n < 0) {
        if (errno == ENODATA) {
            *cls = 0;
            return 0;
        }
        return errnoOr(EIO);
    }
    if (n != sizeof v) return EINVAL;  // someone else's bytes
    *cls = v;
    return 0;
}

int FsSetProtectionClass(int fd, int32_t cls) {
    return ::fsetxattr(fd, FsProtectionClassAttributeName(), &cls, sizeof cls, 0) == 0
               ? 0
               : errnoOr(EIO);
}

// ---- POSIX ACLs ----

namespace {

struct AclHolder {
    acl_t acl = nullptr;
    ~AclHolder() {
        if (acl) acl_free(acl);
    }
};

int addEntry(acl_t* acl, acl_tag_t tag, int perms, const gid_t* qualifier) {
    acl_entry_t e;
    if (acl_create_entry(acl, &e) != 0) return errnoOr(EIO);
    if (acl_set_tag_type(e, tag) != 0) return errnoOr(EIO);
    if (qualifier && acl_set_qualifier(e, qualifier) != 0) return errnoOr(EIO);
    acl_permset_t ps;
    if (acl_get_permset(e, &ps) != 0) return errnoOr(EIO);
    acl_clear_perms(ps);
    if (perms & 4) acl_add_perm(ps, ACL_READ);
    if (perms & 2) acl_add_perm(ps, ACL_WRITE);
    if (perms & 1) acl_add_perm(ps, ACL_EXECUTE);
    if (acl_set_permset(e, ps) != 0) return errnoOr(EIO);
    return 0;
}

int buildAcl(int ownerPerms, int groupPerms, int otherPerms, gid_t gid, int namedPerms,
             AclHolder* out) {
    out->acl = acl_init(5);
    if (!out->acl) return errnoOr(ENOMEM);
    if (int err = addEntry(&out->acl, ACL_USER_OBJ, ownerPerms, nullptr)) return err;
    if (int err = addEntry(&out->acl, ACL_GROUP_OBJ, groupPerms, nullptr)) return err;
    if (int err = addEntry(&out->acl, ACL_OTHER, otherPerms, nullptr)) return err;
    if (int err = addEntry(&out->acl, ACL_GROUP, namedPerms, &gid)) return err;
    // The mask bounds the group class: the owning group and the named group.
    if (int err = addEntry(&out->acl, ACL_MASK, 0, nullptr)) return err;
    if (acl_calc_mask(&out->acl) != 0) return errnoOr(EIO);
    if (acl_valid(out->acl) != 0) return EINVAL;
    return 0;
}

int permsOf(acl_entry_t e) {
    acl_permset_t ps;
    if (acl_get_permset(e, &ps) != 0) return 0;
    return (acl_get_perm(ps, ACL_READ) == 1 ? 4 : 0) | (acl_get_perm(ps, ACL_WRITE) == 1 ? 2 : 0) |
           (acl_get_perm(ps, ACL_EXECUTE) == 1 ? 1 : 0);
}

void readGroupEntry(acl_t acl, gid_t gid, int* named, int* mask) {
    *named = -1;
    if (mask) *mask = -1;
    if (!acl) return;
    acl_entry_t e;
    for (int id = ACL_FIRST_ENTRY; acl_get_entry(acl, id, &e) == 1; id = ACL_NEXT_ENTRY) {
        acl_tag_t tag;
        if (acl_get_tag_type(e, &tag) != 0) continue;
        if (tag == ACL_MASK && mask) *mask = permsOf(e);
        if (tag != ACL_GROUP) continue;
        auto* q = static_cast<gid_t*>(acl_get_qualifier(e));
        if (q && *q == gid) *named = permsOf(e);
        if (q) acl_free(q);
    }
}

std::string procPath(int fd) {
    char proc[64];
    std::snprintf(proc, sizeof proc, "/proc/self/fd/%d", fd);
    return proc;
}

}  // namespace

int FsSetGroupACLAt(int dirFd, const std::string& name, const FsGroupACL& wanted) {
    FsFd fd;
    if (int err = FsOpenItem(dirFd, name, &fd)) return err == ELOOP ? EOPNOTSUPP : err;
    struct stat s;
    if (::fstat(fd.get(), &s) != 0) return errnoOr(EIO);
    int owner = (s.st_mode >> 6) & 7, group = (s.st_mode >> 3) & 7, other = s.st_mode & 7;
    if (wanted.accessPerms >= 0) {
        AclHolder acl;
        if (int err = buildAcl(owner, group, other, wanted.gid, wanted.accessPerms, &acl)) return err;
        if (acl_set_fd(fd.get(), acl.acl) != 0) return errnoOr(EIO);
    }
    if (wanted.defaultPerms >= 0 && S_ISDIR(s.st_mode)) {
        AclHolder acl;
        if (int err = buildAcl(wanted.defaultOwnerPerms, 0, 0, wanted.gid, wanted.defaultPerms, &acl))
            return err;
        // Default ACLs have no descriptor call; the /proc path names the
        // directory already open, so no link can redirect it.
        if (acl_set_file(procPath(fd.get()).c_str(), ACL_TYPE_DEFAULT, acl.acl) != 0)
            return errnoOr(EIO);
    }
    return 0;
}

int FsGetGroupACLAt(int dirFd, const std::string& name, gid_t gid, int* accessPerms,
                    int* defaultPerms, int* maskPerms) {
    FsFd fd;
    if (int err = FsOpenItem(dirFd, name, &fd)) return err;
    AclHolder access;
    access.acl = acl_get_fd(fd.get());
    if (!access.acl) return errnoOr(EIO);
    readGroupEntry(access.acl, gid, accessPerms, maskPerms);
    *defaultPerms = -1;
    struct stat s;
    if (::fstat(fd.get(), &s) == 0 && S_ISDIR(s.st_mode)) {
        AclHolder def;
        def.acl = acl_get_file(procPath(fd.get()).c_str(), ACL_TYPE_DEFAULT);
        readGroupEntry(def.acl, gid, defaultPerms, nullptr);
    }
    return 0;
}

// ---- Trees ----

namespace {

struct Walker {
    const std::function<bool(const FsWalkEntry&)>& visit;
    dev_t rootDev = 0;
    bool stopped = false;

    // Visits the children of the open directory `dirFd` (whose path is
    // `dirPath`), recursing into subdirectories on the same device.
    void children(int dirFd, const std::string& dirPath, int level) {
        std::vector<std::pair<std::string, unsigned char>> names;
        if (int err = readNames(dirFd, &names)) {
            if (!visit(listingErrorEntry(dirFd, dirPath, level, err))) stopped = true;
            return;
        }
        for (auto& [name, dtype] : names) {
            if (stopped) return;
            (void)dtype;
            FsWalkEntry e;
            e.path = joinPath(dirPath, name);
            e.level = level;
            e.parentFd = dirFd;
            e.name = name;
            struct stat s;
            if (::fstatat(dirFd, name.c_str(), &s, AT_SYMLINK_NOFOLLOW) != 0) {
                e.type = FsWalkType::Error;
                e.error = errnoOr(EIO);
                if (e.error == ENOENT) continue;  // gone since the listing
                if (!visit(e)) stopped = true;
                continue;
            }
            e.st = fromStat(s);
            e.type = walkTypeOf(s.st_mode);
            if (e.type != FsWalkType::Directory) {
                if (!visit(e)) stopped = true;
                continue;
            }
            directory(dirFd, std::move(e), s.st_dev);
        }
    }

    void directory(int parentFd, FsWalkEntry e, dev_t dev) {
        FsFd fd;
        int err = openDirAt(parentFd, e.name.empty() ? "." : e.name, &fd);
        if (err == 0) {
            // The directory must be the one we stat'ed: a swap between the
            // stat and the open is refused rather than followed.
            struct stat s;
            if (::fstat(fd.get(), &s) != 0 || s.st_ino != e.st.ino || s.st_dev != e.st.dev)
                err = EAGAIN;
        }
        if (err) {
            e.type = FsWalkType::Error;
            e.error = err;
            if (!visit(e)) stopped = true;
            return;
        }
        e.fd = fd.get();
        if (!visit(e)) {
            stopped = true;
            return;
        }
        if (dev == rootDev) children(fd.get(), e.path, e.level + 1);
        if (stopped) return;
        e.type = FsWalkType::DirectoryPost;
        if (!visit(e)) stopped = true;
    }
};

}  // namespace

namespace {

// The entry `name` of the open directory `parentFd` as a tree's root, not
// followed when it is a link; fills `st` with what was found there.
int rootEntryAt(int parentFd, std::string name, const std::string& path, FsWalkEntry* e,
                struct stat* st) {
    if (::fstatat(parentFd, name.c_str(), st, AT_SYMLINK_NOFOLLOW) != 0) return errnoOr(EIO);
    e->path = path;
    e->level = 0;
    e->parentFd = parentFd;
    e->name = std::move(name);
    e->st = fromStat(*st);
    e->type = walkTypeOf(st->st_mode);
    return 0;
}

// The same for a root named by its path, through its open parent.
int rootEntry(const std::string& root, FsFd* parent, FsWalkEntry* e, struct stat* st) {
    std::string name;
    if (int err = openParent(root, parent, &name)) return err;
    return rootEntryAt(parent->get(), std::move(name), root, e, st);
}

int walkFrom(FsWalkEntry e, const struct stat& s,
             const std::function<bool(const FsWalkEntry&)>& visit) {
    Walker w{visit, s.st_dev};
    if (e.type == FsWalkType::Directory) {
        const int parentFd = e.parentFd;
        w.directory(parentFd, std::move(e), s.st_dev);
    } else if (!visit(e)) {
        w.stopped = true;
    }
    return w.stopped ? ECANCELED : 0;
}

}  // namespace

int FsWalk(const std::string& root, const std::function<bool(const FsWalkEntry&)>& visit) {
    FsFd parent;
    FsWalkEntry e;
    struct stat s;
    if (int err = rootEntry(root, &parent, &e, &s)) return err;
    return walkFrom(std::move(e), s, visit);
}

int FsWalkAt(int parentFd, const std::string& name, const std::string& path,
             const std::function<bool(const FsWalkEntry&)>& visit) {
    FsWalkEntry e;
    struct stat s;
    if (int err = rootEntryAt(parentFd, name, path, &e, &s)) return err;
    return walkFrom(std::move(e), s, visit);
}

namespace {

struct Remover {
    const FsRemoveErrorFn& onError;

    // Removes everything inside the open directory; true when it emptied it.
    bool children(int dirFd, const std::string& dirPath, int level) {
        std::vector<std::pair<std::string, unsigned char>> names;
        if (int err = readNames(dirFd, &names)) {
            onError(listingErrorEntry(dirFd, dirPath, level, err), err);
            return false;
        }
        bool all = true;
        for (auto& [name, dtype] : names) {
            FsWalkEntry e;
            e.path = joinPath(dirPath, name);
            e.level = level;
            e.parentFd = dirFd;
            e.name = name;
            if (!item(std::move(e), dtype == DT_DIR || dtype == DT_UNKNOWN)) all = false;
        }
        return all;
    }

    bool item(FsWalkEntry e, bool maybeDirectory) {
        if (maybeDirectory) {
            FsFd fd;
            int err = openDirAt(e.parentFd, e.name, &fd);
            if (err == 0) {
                e.type = FsWalkType::Directory;
                e.fd = fd.get();
                children(fd.get(), e.path, e.level + 1);
                e.fd = -1;
                fd = FsFd();
                return unlink(e, true);
            }
            // ENOTDIR / ELOOP: not a directory (or a link) after all.
            if (err == ENOENT) return true;
            if (err != ENOTDIR && err != ELOOP) {
                e.type = FsWalkType::Error;
                return onError(e, err);
            }
        }
        e.type = FsWalkType::File;
        return unlink(e, false);
    }

    bool unlink(const FsWalkEntry& e, bool directory) {
        if (::unlinkat(e.parentFd, e.name.c_str(), directory ? AT_REMOVEDIR : 0) == 0) return true;
        int err = errnoOr(EIO);
        if (err == ENOENT) return true;
        if (!directory && err == EISDIR) {
            // Became a directory since the listing: remove it as one.
            FsWalkEntry again = e;
            return item(std::move(again), true);
        }
        return onError(e, err);
    }
};

}  // namespace

int FsRemoveTree(const std::string& root, const FsRemoveErrorFn& onError) {
    FsFd parent;
    FsWalkEntry e;
    struct stat s;
    if (int err = rootEntry(root, &parent, &e, &s)) return err;
    Remover r{onError};
    r.item(std::move(e), S_ISDIR(s.st_mode));
    return 0;
}

// ---- Copy ----

namespace {

int copyXattrs(int from, int to) {
    ssize_t len = ::flistxattr(from, nullptr, 0);
    if (len < 0) return errno == ENOTSUP ? 0 : errnoOr(EIO);
    if (len == 0) return 0;
    std::vector<char> names(static_cast<size_t>(len));
    len = ::flistxattr(from, names.data(), names.size());
    if (len < 0) return errnoOr(EIO);
    std::vector<char> value;
    for (ssize_t i = 0; i < len;) {
        const char* n = names.data() + i;
        i += static_cast<ssize_t>(::strlen(n)) + 1;
        ssize_t vlen = ::fgetxattr(from, n, nullptr, 0);
        if (vlen < 0) {
            if (errno == ENODATA) continue;
            return errnoOr(EIO);
        }
        value.resize(static_cast<size_t>(vlen));
        vlen = ::fgetxattr(from, n, value.data(), value.size());
        if (vlen < 0) return errnoOr(EIO);
        if (::fsetxattr(to, n, value.data(), static_cast<size_t>(vlen), 0) != 0) {
            // Namespaces this process may not write (trusted.* when
            // unprivileged) are left behind rather than failing the copy.
            if (errno == EPERM || errno == ENOTSUP) continue;
            return errnoOr(EIO);
        }
    }
    return 0;
}

// Owner, mode, xattrs (ACLs among them) and times of `to` from `st`.
int copyMetadata(int from, int to, const struct stat& st) {
    if (::geteuid() == 0 && ::fchown(to, st.st_uid, st.st_gid) != 0) return errnoOr(EIO);
    if (::fchmod(to, st.st_mode & 07777) != 0) return errnoOr(EIO);
    if (int err = copyXattrs(from, to)) return err;
    struct timespec times[2] = {st.st_atim, st.st_mtim};
    if (::futimens(to, times) != 0) return errnoOr(EIO);
    return 0;
}

int copyData(int from, int to, off_t size) {
    if (::ioctl(to, FICLONE, from) == 0) return 0;
    off_t left = size;
    bool useRange = true;
    while (left > 0 || !useRange) {
        if (useRange) {
            ssize_t n = ::copy_file_range(from, nullptr, to, nullptr, static_cast<size_t>(left), 0);
            if (n < 0) {
                if (errno == EINTR) continue;
                if (errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP) {
                    useRange = false;
                    continue;
                }
                return errnoOr(EIO);
            }
            if (n == 0) break;  // file shrank
            left -= n;
        } else {
            char buf[65536];
            ssize_t n = noEintr([&] { return ::read(from, buf, sizeof buf); });
            if (n < 0) return errnoOr(EIO);
            if (n == 0) break;
            for (ssize_t off = 0; off < n;) {
                ssize_t w = noEintr([&] { return ::write(to, buf + off, static_cast<size_t>(n - off)); });
                if (w < 0) return errnoOr(EIO);
                off += w;
            }
        }
    }
    return 0;
}

int copyItem(int fromDir, const std::string& fromName, int toDir, const std::string& toName) {
    struct stat st;
    if (::fstatat(fromDir, fromName.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errnoOr(EIO);
    if (S_ISLNK(st.st_mode)) {
        char buf[PATH_MAX] = {};
        ssize_t n = ::readlinkat(fromDir, fromName.c_str(), buf, sizeof buf - 1);
        if (n < 0) return errnoOr(EIO);
        if (::symlinkat(buf, toDir, toName.c_str()) != 0) return errnoOr(EIO);
        if (::geteuid() == 0 &&
            ::fchownat(toDir, toName.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0)
            return errnoOr(EIO);
        struct timespec times[2] = {st.st_atim, st.st_mtim};
        (void)::utimensat(toDir, toName.c_str(), times, AT_SYMLINK_NOFOLLOW);  // best effort
        return 0;
    }
    if (S_ISDIR(st.st_mode)) {
        FsFd src;
        if (int err = openDirAt(fromDir, fromName, &src)) return err;
        if (::mkdirat(toDir, toName.c_str(), 0700) != 0) return errnoOr(EIO);
        FsFd dst;
        if (int err = openDirAt(toDir, toName, &dst)) return err;
        std::vector<std::pair<std::string, unsigned char>> names;
        if (int err = readNames(src.get(), &names)) return err;
        for (auto& [name, dtype] : names) {
            (void)dtype;
            if (int err = copyItem(src.get(), name, dst.get(), name)) return err;
        }
        struct stat now;
        if (::fstat(src.get(), &now) != 0) return errnoOr(EIO);
        return copyMetadata(src.get(), dst.get(), now);
    }
    if (S_ISREG(st.st_mode)) {
        int f = noEintr([&] {
            return ::openat(fromDir, fromName.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
        });
        if (f < 0) return errnoOr(EIO);
        FsFd src(f);
        int t = noEintr([&] {
            return ::openat(toDir, toName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                            0600);
        });
        if (t < 0) return errnoOr(EIO);
        FsFd dst(t);
        struct stat now;
        if (::fstat(src.get(), &now) != 0) return errnoOr(EIO);
        if (int err = copyData(src.get(), dst.get(), now.st_size)) return err;
        return copyMetadata(src.get(), dst.get(), now);
    }
    if (S_ISFIFO(st.st_mode)) {
        if (::mkfifoat(toDir, toName.c_str(), st.st_mode & 07777) != 0) return errnoOr(EIO);
        if (::geteuid() == 0)
            (void)::fchownat(toDir, toName.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW);
        return 0;
    }
    if (S_ISCHR(st.st_mode) || S_ISBLK(st.st_mode)) {
        if (::mknodat(toDir, toName.c_str(), st.st_mode, st.st_rdev) != 0) return errnoOr(EIO);
        (void)::fchownat(toDir, toName.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW);
        return 0;
    }
    return 0;  // sockets cannot be copied; they belong to a running process
}

}  // namespace

int FsCopyTree(const std::string& from, const std::string& to) {
    FsFd fromParent, toParent;
    std::string fromName, toName;
    if (int err = openParent(from, &fromParent, &fromName)) return err;
    if (int err = openParent(to, &toParent, &toName)) return err;
    struct stat s;
    if (::fstatat(toParent.get(), toName.c_str(), &s, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
    int err = copyItem(fromParent.get(), fromName, toParent.get(), toName);
    if (err) {
        // Leave no half copy behind; the destination did not exist before.
        (void)FsRemoveTree(to, [](const FsWalkEntry&, int) { return false; });
    }
    return err;
}

// ---- Disk usage ----

namespace {

struct Usage {
    dev_t dev = 0;
    uint64_t bytes = 0;
    uint64_t count = 0;
    std::unordered_set<uint64_t> seen;  // (ino) of multiply linked files on `dev`
    int firstError = 0;

    void directory(int dirFd) {
        int dupFd = ::fcntl(dirFd, F_DUPFD_CLOEXEC, 0);
        if (dupFd < 0) return note(errnoOr(EIO));
        DIR* dir = ::fdopendir(dupFd);
        if (!dir) {
            note(errnoOr(EIO));
            ::close(dupFd);
            return;
        }
        for (;;) {
            errno = 0;
            struct dirent* e = ::readdir(dir);
            if (!e) {
                if (errno) note(errno);
                break;
            }
            const char* n = e->d_name;
            if (n[0] == '.' && (n[1] == 0 || (n[1] == '.' && n[2] == 0))) continue;
            struct stat s;
            if (::fstatat(dirFd, n, &s, AT_SYMLINK_NOFOLLOW) != 0) {
                if (errno != ENOENT) note(errno);
                continue;
            }
            if (s.st_dev != dev) continue;  // a mount point: not ours to count
            ++count;
            if (!S_ISDIR(s.st_mode) && s.st_nlink > 1 && !seen.insert(s.st_ino).second) continue;
            bytes += static_cast<uint64_t>(s.st_blocks) * 512;
            if (!S_ISDIR(s.st_mode)) continue;
            int f = ::openat(dirFd, n, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            if (f < 0) {
                note(errno);
                continue;
            }
            directory(f);
            ::close(f);
        }
        ::closedir(dir);
    }

    void note(int err) {
        if (!firstError) firstError = err;
    }
};

}  // namespace

int FsDiskUsage(const std::string& root, uint64_t* bytes, uint64_t* descendants) {
    int f = noEintr([&] { return ::open(root.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK); });
    if (f < 0) {
        if (errno != ELOOP) return errnoOr(EIO);
        // The root is a link: its own blocks only.
        struct stat s;
        if (::lstat(root.c_str(), &s) != 0) return errnoOr(EIO);
        *bytes = static_cast<uint64_t>(s.st_blocks) * 512;
        *descendants = 0;
        return 0;
    }
    FsFd fd(f);
    struct stat s;
    if (::fstat(fd.get(), &s) != 0) return errnoOr(EIO);
    Usage u;
    u.dev = s.st_dev;
    u.bytes = static_cast<uint64_t>(s.st_blocks) * 512;
    if (S_ISDIR(s.st_mode)) u.directory(fd.get());
    // Unreadable parts are left out of the count, as du does; the size is
    // still the best answer there is.
    *bytes = u.bytes;
    *descendants = u.count;
    return 0;
}

int FsDirectoryStatisticsFast(const std::string& path, int64_t* totalSize, uint64_t* descendants) {
    (void)path;
    (void)totalSize;
    (void)descendants;
    return ENOTSUP;
}

int FsEnableDirectoryStatistics(const std::string& path) {
    (void)path;
    return ENOTSUP;
}

// ---- Files ----

int FsWriteFile(const std::string& path, const std::string& data, mode_t mode, bool atomic,
                int32_t protectionClass) {
    FsFd parent;
    std::string name;
    if (int err = openParent(path, &parent, &name)) return err;
    std::string target = name;
    if (atomic) {
        // A unique hidden name in the same directory, so the rename is atomic.
        char suffix[48];
        std::snprintf(suffix, sizeof suffix, ".tmp.%d.%08x", static_cast<int>(::getpid()),
                      static_cast<unsigned>(::arc4random()));
        target = "." + name + suffix;
    }
    int flags = O_WRONLY | O_CREAT | O_NOFOLLOW | O_CLOEXEC | (atomic ? O_EXCL : O_TRUNC);
    int f = noEintr([&] { return ::openat(parent.get(), target.c_str(), flags, mode); });
    if (f < 0) return errnoOr(EIO);
    FsFd fd(f);
    auto fail = [&](int err) {
        if (atomic) (void)::unlinkat(parent.get(), target.c_str(), 0);  // leave no debris
        return err;
    };
    if (::fchmod(fd.get(), mode) != 0) return fail(errnoOr(EIO));
    if (protectionClass >= 0) {
        if (int err = FsSetProtectionClass(fd.get(), protectionClass)) return fail(err);
    }
    for (size_t off = 0; off < data.size();) {
        ssize_t w = noEintr([&] { return ::write(fd.get(), data.data() + off, data.size() - off); });
        if (w < 0) return fail(errnoOr(EIO));
        off += static_cast<size_t>(w);
    }
    if (!atomic) return ::fsync(fd.get()) == 0 ? 0 : errnoOr(EIO);
    if (::fsync(fd.get()) != 0) return fail(errnoOr(EIO));
    fd = FsFd();
    if (auto err = TARN_FAILPOINT("fm.writeData.beforeRename")) return fail(*err);
    if (::renameat(parent.get(), target.c_str(), parent.get(), name.c_str()) != 0)
        return fail(errnoOr(EIO));
    if (auto err = TARN_FAILPOINT("fm.writeData.afterRename")) return *err;
    return ::fsync(parent.get()) == 0 ? 0 : errnoOr(EIO);
}

int FsReadFile(const std::string& path, size_t maxBytes, std::string* out) {
    int f = noEintr([&] { return ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC); });
    if (f < 0) return errnoOr(EIO);
    FsFd fd(f);
    struct stat s;
    if (::fstat(fd.get(), &s) != 0) return errnoOr(EIO);
    if (!S_ISREG(s.st_mode)) return EINVAL;
    if (static_cast<uint64_t>(s.st_size) > maxBytes) return EFBIG;
    out->clear();
    char buf[65536];
    for (;;) {
        ssize_t n = noEintr([&] { return ::read(fd.get(), buf, sizeof buf); });
        if (n < 0) return errnoOr(EIO);
        if (n == 0) break;
        if (out->size() + static_cast<size_t>(n) > maxBytes) return EFBIG;
        out->append(buf, static_cast<size_t>(n));
    }
    return 0;
}

int FsReadFileAt(int dirFd, const std::string& name, size_t maxBytes, std::string* out) {
    // No access time: nobody reads it, and keeping it costs every read a
    // clock read and a check. Only the file's owner (or a holder of
    // CAP_FOWNER) may ask that; anyone else reads it the ordinary way.
    constexpr int kFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
    int f = noEintr([&] { return ::openat(dirFd, name.c_str(), kFlags | O_NOATIME); });
    if (f < 0 && errno == EPERM) f = noEintr([&] { return ::openat(dirFd, name.c_str(), kFlags); });
    if (f < 0) return errnoOr(EIO);
    FsFd fd(f);
    out->clear();
    char buf[16384];
    for (;;) {
        ssize_t n = noEintr([&] { return ::read(fd.get(), buf, sizeof buf); });
        if (n < 0) return errnoOr(EIO);
        if (out->size() + static_cast<size_t>(n) > maxBytes) return EFBIG;
        out->append(buf, static_cast<size_t>(n));
        // A regular file reads short only at its end. Anything else (a FIFO
        // reads empty or short without blocking) yields bytes its reader
        // refuses, so it needs no fstat of its own.
        if (static_cast<size_t>(n) < sizeof buf) break;
    }
    return 0;
}

}  // namespace tarn
