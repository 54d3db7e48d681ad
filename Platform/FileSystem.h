// The Linux file-system calls of the daemon, in one place. TarnFileManager
// speaks the daemon's operations on top of these; nothing else calls the
// kernel for files.
//
// Every function returns 0 or an errno value (never sets errno for the
// caller to read). Tree functions work relative to directory descriptors and
// never follow a symbolic link below their root: a link met in a tree is an
// entry of type Symlink and is never entered, so a link swapped in during a
// walk cannot redirect it.
//
// Thread-safe: no state besides the process's descriptors.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tarn {

// The stat data the daemon uses.
struct FsStat {
    uint64_t dev = 0;
    uint64_t ino = 0;
    uint64_t nlink = 0;
    uint32_t mode = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    int64_t size = 0;
    int64_t blocks = 0;  // 512-byte units
    int64_t mtimeSec = 0;
    bool isDirectory() const;
    bool isRegular() const;
    bool isSymlink() const;
};

// An owned descriptor, closed on destruction.
class FsFd {
public:
    FsFd() = default;
    explicit FsFd(int fd) : fd_(fd) {}
    ~FsFd();
    FsFd(FsFd&& o) noexcept : fd_(o.release()) {}
    FsFd& operator=(FsFd&& o) noexcept;
    FsFd(const FsFd&) = delete;
    FsFd& operator=(const FsFd&) = delete;
    int get() const { return fd_; }
    int release() {
        int f = fd_;
        fd_ = -1;
        return f;
    }
    explicit operator bool() const { return fd_ >= 0; }

private:
    int fd_ = -1;
};

// Text of an errno value.
std::string FsErrorText(int err);

// ---- Paths ----

// realpath(3) into a 1024-byte buffer; on failure `partial` gets what the
// buffer held.
int FsRealPath(const std::string& path, std::string* out, std::string* partial = nullptr);
// readlink(2) into a zero-filled 1024-byte buffer.
int FsReadLink(const std::string& path, std::string* target);
int FsLstat(const std::string& path, FsStat* st);
int FsStatFollow(const std::string& path, FsStat* st);
int FsStatAt(int dirFd, const std::string& name, FsStat* st);  // never follows

// ---- Directories and names ----

int FsMkdir(const std::string& path, mode_t mode);
// Creates every missing component with `mode`; an existing directory is 0.
// `created`, when given, tells whether this call made the last component.
int FsMakePath(const std::string& path, mode_t mode, bool* created = nullptr);
// `pathTemplate` ends in XXXXXX, replaced in place.
int FsMkdtemp(std::string* pathTemplate);
int FsRename(const std::string& from, const std::string& to);
// renameat2(2) with RENAME_EXCHANGE: both names must exist and trade places
// in one step. EINVAL / ENOSYS / EOPNOTSUPP where the file system (or the
// kernel) cannot exchange.
int FsRenameExchange(const std::string& first, const std::string& second);
int FsUnlinkAt(int dirFd, const std::string& name, bool directory);
// Opens a directory without following a final link.
int FsOpenDirectory(const std::string& path, FsFd* fd);
// Opens any item for metadata work: O_RDONLY|O_NOFOLLOW|O_NONBLOCK, so a link
// fails with ELOOP and a FIFO does not block. `dirFd` -1 means `name` is a path.
int FsOpenItem(int dirFd, const std::string& name, FsFd* fd);
int FsFsyncDirectoryOf(const std::string& path);
// Opens the directory holding `path` (following links above it: the caller
// named it) and gives the last component, for the *At calls below.
int FsOpenParent(const std::string& path, FsFd* parent, std::string* name);

// ---- Client-named paths below a directory held open ----
//
// A client names an item by a path relative to a directory the daemon opened
// itself; these resolve it without ever leaving that directory or passing a
// link, so that a link swapped in while a request runs cannot redirect it.

// Opens the directory `relativePath` names below the open directory `dirFd`.
// Empty and "." components are skipped (an empty path opens `dirFd` again).
// EXDEV: the path is absolute or has a ".." component; ELOOP: a component is
// a symbolic link; ENOENT / ENOTDIR as openat(2). Uses openat2(2) with
// RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS where the kernel has it, otherwise a
// walk opening one component at a time with O_NOFOLLOW; both answer alike.
int FsOpenDirectoryBeneath(int dirFd, const std::string& relativePath, FsFd* out);
// Tests: true makes FsOpenDirectoryBeneath take the component walk even
// where openat2(2) exists.
void FsTEST_forceComponentWalk(bool force);
// renameat(2): both names are single components of the open directories.
int FsRenameAt(int fromDirFd, const std::string& fromName, int toDirFd, const std::string& toName);
// A new directory `prefix` + 6 random characters inside the open directory
// `dirFd`, mode 0700 (as mkdtemp(3)); `name` receives its name.
int FsMkdtempAt(int dirFd, const std::string& prefix, std::string* name);

enum class FsEntryType : uint8_t { Unknown, Directory, File, Symlink, Other };
struct FsDirEntry {
    std::string name;
    FsEntryType type = FsEntryType::Unknown;
};
// Every entry except "." and ".."; unknown types are resolved with stat(2)
// of "dir/name" (following links).
int FsListDirectory(const std::string& path, std::vector<FsDirEntry>* out);
// Every name except "." and ".." of the open directory `dirFd`, in directory
// order, without copies.
int FsForEachNameAt(int dirFd, const std::function<void(std::string_view name)>& each);

// ---- Ownership and modes, never following a final link ----

int FsChown(const std::string& path, uid_t uid, gid_t gid);  // follows (chown(2))
int FsChownFd(int fd, uid_t uid, gid_t gid);
int FsChownAt(int dirFd, const std::string& name, uid_t uid, gid_t gid);
// Links have no mode on Linux: EOPNOTSUPP for a link.
int FsChmodAt(int dirFd, const std::string& name, mode_t mode);

// ---- Flags (FS_IOC_GETFLAGS / FS_IOC_SETFLAGS) ----

// The user-immutable flag of the item. A link has none (false).
int FsGetImmutableAt(int dirFd, const std::string& name, bool* immutable);
int FsSetImmutableAt(int dirFd, const std::string& name, bool immutable);

// ---- Data-protection class (an extended attribute) ----

// "trusted.tarnkeeper.protection-class" when the process starts as root, the
// "user." namespace otherwise (decided once). No attribute reads as class 0,
// and a new directory has none.
const char* FsProtectionClassAttributeName();
int FsGetProtectionClass(int fd, int32_t* cls);
int FsSetProtectionClass(int fd, int32_t cls);

// ---- POSIX ACLs for one group ----

// Permissions as rwx bits (4 read, 2 write, 1 execute/search); -1 = no entry.
struct FsGroupACL {
    gid_t gid = 0;
    int accessPerms = -1;
    int defaultPerms = -1;        // directories only
    int defaultOwnerPerms = 07;   // user:: of the default ACL
};
// Replaces the item's access ACL (and default ACL for a directory) with
// owner/group/other entries from its mode, one named-group entry and a mask
// that is the union of the group class. Opens with O_NOFOLLOW; a link is
// EOPNOTSUPP.
int FsSetGroupACLAt(int dirFd, const std::string& name, const FsGroupACL& acl);
// Reads the named-group entry of `gid` (-1 when absent) for tests and checks.
int FsGetGroupACLAt(int dirFd, const std::string& name, gid_t gid, int* accessPerms,
                    int* defaultPerms, int* maskPerms);

// ---- Trees ----

enum class FsWalkType : uint8_t { Directory, DirectoryPost, File, Symlink, Other, Error };
// One entry of a walk. The path is for messages; act on the entry through
// parentFd + name (or fd for a directory), which do not follow links.
struct FsWalkEntry {
    std::string path;
    int level = 0;
    FsWalkType type = FsWalkType::Other;
    int error = 0;      // for Error: the errno
    int parentFd = -1;  // directory holding the entry
    std::string name;
    int fd = -1;  // for Directory/DirectoryPost: the open directory
    FsStat st;
};
// Pre-order walk with a post-order visit of every directory, physical, not
// crossing devices (a mount point is reported but not entered). `visit`
// returns false to stop; the walk then answers ECANCELED. An unreadable
// directory or item is delivered as an Error entry. The root's failure to
// open is the result.
int FsWalk(const std::string& root, const std::function<bool(const FsWalkEntry&)>& visit);
// The same from the entry `name` of the open directory `parentFd` (not
// followed when it is a link); `path` names it in the entries' paths.
int FsWalkAt(int parentFd, const std::string& name, const std::string& path,
             const std::function<bool(const FsWalkEntry&)>& visit);

// Children-first removal. For every item that cannot be removed `onError`
// is called with the entry and errno and answers whether the item has been
// dealt with after all (then it counts as removed). Returns 0, or the errno
// of a failure to start (ENOENT when the root is missing).
using FsRemoveErrorFn = std::function<bool(const FsWalkEntry& entry, int err)>;
int FsRemoveTree(const std::string& root, const FsRemoveErrorFn& onError);

// Copies `from` to `to` (which must not exist): data (FICLONE, else
// copy_file_range), mode, owner (when privileged), times, extended attributes
// (POSIX ACLs included); links as links.
int FsCopyTree(const std::string& from, const std::string& to);

// Allocated bytes of every item (st_blocks * 512, hard links once), links not
// followed, one device. `descendants` counts items below the root.
int FsDiskUsage(const std::string& root, uint64_t* bytes, uint64_t* descendants);
// Directory statistics kept by the file system. Not available on Linux yet:
// both answer ENOTSUP; project quotas can stand behind them later.
int FsDirectoryStatisticsFast(const std::string& path, int64_t* totalSize, uint64_t* descendants);
int FsEnableDirectoryStatistics(const std::string& path);

// ---- Files ----

// Write `data` to `path` with `mode`. `atomic`: temporary file, fsync,
// rename, fsync of the directory. `protectionClass` >= 0 is set on the file
// before it becomes visible.
int FsWriteFile(const std::string& path, const std::string& data, mode_t mode, bool atomic,
                int32_t protectionClass);
// Reads a regular file opened with O_NOFOLLOW; EFBIG beyond `maxBytes`.
int FsReadFile(const std::string& path, size_t maxBytes, std::string* out);
// The same for `name` relative to the open directory `dirFd`, with no fstat:
// read until a short read, EFBIG beyond `maxBytes`. An item that is not a
// regular file fails (a directory: EISDIR) or reads as whatever it gives
// without blocking (a FIFO: nothing), for the caller's parser to refuse.
int FsReadFileAt(int dirFd, const std::string& name, size_t maxBytes, std::string* out);

}  // namespace tarn
