// TarnFileManager: the one facade through which the daemon touches the file
// system. It runs as root on trees that clients can write to, so it is the
// security boundary of the daemon:
//   - trees are walked with descriptor-relative calls that never follow a link
//     (a link planted inside a tree is handled as a link, never entered);
//   - owner, mode and ACL changes during walks act on the entry itself
//     (AT_SYMLINK_NOFOLLOW / O_NOFOLLOW), relative to the directory already open;
//   - files written through writeData() are fsynced before their rename and
//     their directory after it.
//
// The shared instance (defaultManager) holds no state; every operation is
// synchronous and may run on any thread. Callers serialise work on one
// container with the identifier locks. URLs are FileURL host paths with the
// root prefix applied; an empty FileURL stands for "no URL" (nil).
//
// Errors: every operation that can fail returns a TarnResult (TarnStatus
// when there is no value), by the convention in Daemon/TarnResult.h.
// File-layer errors are POSIX error values (code = errno) except the ACL
// builders (TarnErrorACLFailed). Two kinds answer otherwise, on purpose: the
// real-path checks answer nullopt and log why, and the descriptor calls of a
// cache rebuild (openDirectoryAtURL, readDataInDirectory,
// forEachNameInDirectory) answer a bare errno, since a rebuild meets many
// unreadable entries and wants no error value for them. No operation throws.
//
// Every mutating operation has a failpoint (Platform/Failpoints.h) that tests
// use to inject errors or crashes.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"
#include "Platform/FileSystem.h"
#include "Platform/Path.h"

namespace tarn {

struct Uuid;

// Name of the container metadata file; the ownership and ACL passes leave any
// path containing it alone.
inline constexpr const char* kTarnMetadataFileName = ".com.ostrea.tarn_keeper.metadata.plist";

// A data-protection class as the file system keeps it: 0 none, 1 to 4 the
// platform classes. A distinct type only so that the creation overloads
// taking a class cannot be confused with those taking an owner; it converts
// to int32_t implicitly. -1 leaves the class alone.
enum TarnDataProtectionClass : int32_t {
    kTarnDataProtectionClassUnchanged = -1,
    kTarnDataProtectionClassNone = 0,
    kTarnDataProtectionClassA = 1,  // complete protection: unreadable while locked
    kTarnDataProtectionClassB = 2,
    kTarnDataProtectionClassC = 3,
    kTarnDataProtectionClassD = 4,
};

// Options of writeData(), numerically those of the platform's write call.
enum : uint64_t {
    kTarnWriteAtomic = 0x1,
    kTarnWriteNoFileProtection = 0x10000000,
};

// One entry of _traverseDirectory(): see FsWalkEntry in Platform/FileSystem.h.
// parentFd/name address the entry without following links; use them (through
// the FileSystem calls taking a directory descriptor) for anything that
// changes the entry.
using TarnTraversalEntry = FsWalkEntry;
// Success goes on; a failure stops the walk with its error (ECANCELED when
// it has no error value).
using TarnTraversalBlock = std::function<TarnStatus(const TarnTraversalEntry& entry)>;
// Given the current class, answers whether to change it.
using TarnDataProtectionPredicate = std::function<bool(int32_t currentClass)>;

// The ACL of the system-users group as the daemon describes it: entries with
// the platform's permission bits and entry flags. The Linux layer maps it onto
// POSIX access and default entries when it is applied (TarnFileManager.cc).
struct TarnACLEntry {
    gid_t qualifier = 0;
    uint32_t permissions = 0;
    uint32_t flags = 0;
};
struct TarnACL {
    size_t capacity = 0;
    std::vector<TarnACLEntry> entries;
};
using TarnACLRef = std::unique_ptr<TarnACL>;

// ACL permission bits and entry flags used by the system-container ACLs.
enum : uint32_t {
    kTarnACLReadData = 0x2,
    kTarnACLWriteData = 0x4,
    kTarnACLExecute = 0x8,
    kTarnACLDelete = 0x10,
    kTarnACLAppendData = 0x20,
    kTarnACLDeleteChild = 0x40,
    kTarnACLReadExtAttributes = 0x200,
    kTarnACLWriteExtAttributes = 0x400,
    kTarnACLChangeOwner = 0x2000,

    kTarnACLPermsDirectory = 0x3FFE,
    kTarnACLPermsFile = 0x3FBE,
    kTarnACLPermsTopLevelSelf = 0x0624,

    kTarnACLFlagInherited = 0x10,
    kTarnACLFlagFileInherit = 0x20,
    kTarnACLFlagDirectoryInherit = 0x40,
    kTarnACLFlagOnlyInherit = 0x100,
};

class TarnFileManager {
public:
    static TarnFileManager& defaultManager();

    // ---- Real paths and the child test ----

    // The real URL of `url` when, after links and "..", it lies inside
    // `ifChildOfURL` (the base itself counts); otherwise nullopt with the
    // reason logged. A missing tail is allowed (it is appended unresolved).
    std::optional<FileURL> realPathForURL(const FileURL& url, const FileURL& ifChildOfURL);
    // Textual depth walk: false when the path ever climbs above the starting
    // depth. `andEndingDepth` (optional) receives the final depth on success.
    bool _validateSymlink(const std::optional<std::string>& path, int32_t withStartingDepth,
                          int32_t* andEndingDepth);
    std::optional<FileURL> _realPathForURL(const FileURL& url, bool allowNonExistentPathComponents);
    std::optional<FileURL> _realPathWhatExistsInPath(const std::string& path);
    // The home directory of `uid` under the root prefix, never empty; falls
    // back to /private/var/mobile.
    static FileURL homeDirectoryURLForPOSIXUID(uid_t uid);

    // ---- Client-named items below a directory held open ----
    //
    // A path a client hands in is resolved below a directory the daemon has
    // opened itself, one descriptor at a time, never through a link (see
    // FsOpenDirectoryBeneath); the caller then acts through the descriptor it
    // got, so a link swapped in after the check cannot redirect the act.

    // The item a relative path names: the directory that holds it, opened,
    // and its last component. `stat` is the item itself, not followed (a
    // link reads as a link); empty when nothing is there yet.
    struct ItemInDirectory {
        FsFd directory;
        std::string name;
        std::optional<FsStat> stat;
    };
    // Resolves `relativePath` below the open directory `base`. POSIX errors:
    // EXDEV when the path would leave `base` (absolute, a ".." component),
    // ELOOP when a directory on the way is a link, EINVAL when it names `base`
    // itself ("", "."), ENOENT / ENOTDIR for a directory on the way that is
    // missing or not one.
    TarnResult<ItemInDirectory> itemBelowDirectory(const FsFd& base,
                                                   const std::string& relativePath);
    // The directory `relativePath` names below `base`, opened the same way
    // (ELOOP when it is a link itself); "" opens `base` again.
    TarnResult<FsFd> openDirectoryBelowDirectory(const FsFd& base,
                                                 const std::string& relativePath);
    // One renameat(2) between two open directories; never a copy.
    TarnStatus renameItemInDirectory(const FsFd& fromDirectory, const std::string& fromName,
                                     const FsFd& toDirectory, const std::string& toName);
    // createTemporaryDirectoryInDirectoryURL inside an open directory: a new
    // owner-only directory prefix + 6 random characters; answers its name.
    TarnResult<std::string> createTemporaryDirectoryInDirectory(const FsFd& directory,
                                                                const std::string& withNamePrefix);
    // Mode and owner of the entry `name` of an open directory, never through
    // a link (a link fails: ELOOP / EOPNOTSUPP). Not privileged: the owner is
    // left alone with a notice, as everywhere in this class.
    TarnStatus setModeOfItemInDirectory(const FsFd& directory, const std::string& name,
                                        mode_t mode);
    TarnStatus setOwnerOfItemInDirectory(const FsFd& directory, const std::string& name, uid_t uid,
                                         gid_t gid);

    // ---- Directories ----

    // Owner 0 leaves the owner alone (it is used as user and group id);
    // class -1 leaves the class alone. An existing directory is not an error
    // and still gets class and owner.
    TarnStatus createDirectoryAtURL(const FileURL& url, bool withIntermediateDirectories,
                                    mode_t mode);
    TarnStatus createDirectoryAtURL(const FileURL& url, bool withIntermediateDirectories,
                                    mode_t mode, TarnDataProtectionClass dataProtectionClass);
    TarnStatus createDirectoryAtURL(const FileURL& url, bool withIntermediateDirectories,
                                    mode_t mode, uid_t owner);
    TarnStatus createDirectoryAtURL(const FileURL& url, bool withIntermediateDirectories,
                                    mode_t mode, uid_t owner,
                                    TarnDataProtectionClass dataProtectionClass);

    // A new owner-only directory named prefix + 6 random characters ("temp."
    // by default) inside `url`.
    TarnResult<FileURL> createTemporaryDirectoryInDirectoryURL(const FileURL& url);
    TarnResult<FileURL> createTemporaryDirectoryInDirectoryURL(const FileURL& url,
                                                               const std::string& withNamePrefix);

    // ---- Move, copy, remove ----

    // rename(); across volumes a copy followed by removal of the source.
    TarnStatus moveItemAtURL(const FileURL& url, const FileURL& toURL);
    // A missing source succeeds and moves nothing.
    TarnStatus moveItemIfExistsAtURL(const FileURL& url, const FileURL& toURL);
    // One rename and nothing else: across volumes it fails (EXDEV) rather
    // than copy. For an item whose removal failed, a copy would only leave a
    // second one behind.
    TarnStatus renameItemAtURL(const FileURL& url, const FileURL& toURL);
    // The two items trade places in one step (both must exist). POSIX errors;
    // EINVAL, ENOSYS or EOPNOTSUPP where the file system cannot do it
    // (exchangeIsUnsupported()), and nothing has moved then.
    TarnStatus exchangeItemAtURL(const FileURL& url, const FileURL& withURL);
    static bool exchangeIsUnsupported(const TarnErrorRef& error);
    // Recursive copy: data, mode, owner, times, xattrs, ACLs; links as links.
    TarnStatus copyItemAtURL(const FileURL& url, const FileURL& toURL);
    TarnStatus copyItemIfExistsAtURL(const FileURL& url, const FileURL& toURL);
    TarnStatus _moveItemAtURL(const FileURL& url, const FileURL& toURL, bool failIfSrcMissing);
    TarnStatus _copyItemAtURL(const FileURL& url, const FileURL& toURL, bool failIfSrcMissing);

    // Recursive removal, children first, never following links; immutable
    // items are cleared and unlinked; a missing path succeeds. The first
    // error met decides the result (the rest of the tree is still tried).
    TarnStatus removeItemAtURL(const FileURL& url);

    // ---- Files the daemon writes for itself ----

    // Writes `data` to `toURL` with mode 0644 (or `mode`). With
    // kTarnWriteAtomic: a temporary file in the same directory, fsynced,
    // renamed into place, then the directory fsynced, so that a crash leaves
    // the old or the new contents, never a torn file. Without file protection
    // the file gets class 0 (readable while locked); otherwise it is left to
    // inherit.
    TarnStatus writeData(const std::string& data, const FileURL& toURL, uint64_t options);
    TarnStatus writeData(const std::string& data, const FileURL& toURL, uint64_t options,
                         mode_t mode);
    // Reads a whole regular file (not through a link), at most `maxBytes`.
    TarnResult<std::string> readDataAtURL(const FileURL& url, size_t maxBytes);
    // The same for `relativePath` below `directory`, a directory held open
    // (openDirectoryAtURL) so that many reads below it do not walk its path
    // again. On failure the POSIX error value; no error object is made.
    int readDataInDirectory(const FsFd& directory, const std::string& relativePath, size_t maxBytes,
                            std::string* data);
    // The directory itself, not through a final link.
    int openDirectoryAtURL(const FileURL& url, FsFd* directory);
    // How many subdirectories the open `directory` holds, as its link count
    // tells; 0 where the file system does not count them. A hint for sizing,
    // not a listing.
    uint64_t subdirectoryCountHint(const FsFd& directory);
    // Names not starting with "." of the open `directory`, in directory order.
    int forEachNameInDirectory(const FsFd& directory,
                               const std::function<void(std::string_view name)>& each);

    // ---- Listing and traversal ----

    // Names not starting with "." in directory order, as URLs below `url`.
    // A missing directory fails with code ENOENT.
    TarnResult<std::vector<FileURL>> urlsForItemsInDirectoryAtURL(const FileURL& url);
    // Pre-order walk with post-order directory visits, physical, one file
    // system. Entries with unreadable metadata stop the walk with their errno.
    // A directory that cannot be opened for lack of permission is handed on
    // as a directory with `error` set and no descriptor, and the walk goes on:
    // its contents are skipped and no post-order visit follows.
    TarnStatus _traverseDirectory(const FileURL& url, const TarnTraversalBlock& withBlock);
    // The same from the entry `name` of an open directory (`url` for messages).
    TarnStatus _traverseItemInDirectory(const FsFd& directory, const std::string& name,
                                        const FileURL& url, const TarnTraversalBlock& withBlock);
    // Logs every item of the tree at error level (orphaned data).
    void printDirectoryStructureAtURL(const FileURL& url);

    // lstat-based; neither follows a final link. On an unexpected error both
    // answer false.
    bool itemExistsAtURL(const FileURL& url);
    bool itemDoesNotExistAtURL(const FileURL& url);

    // ---- Data protection ----

    TarnResult<int32_t> dataProtectionClassOfItemAtURL(const FileURL& url);
    // Fails with EPERM while the device is locked when the current or the new
    // class is 1. A predicate answering false ends with success and no change.
    TarnStatus setDataProtectionClassOfItemAtURL(const FileURL& url, int32_t toClass,
                                                 const TarnDataProtectionPredicate& ifPredicate);
    // The same for the entry `name` of the open directory `directoryFd`, not
    // through a link (`url` names it in messages): a walk sets each entry
    // without resolving its path again.
    TarnStatus setDataProtectionClassOfItemInDirectory(
        int directoryFd, const std::string& name, const FileURL& url, int32_t toClass,
        const TarnDataProtectionPredicate& ifPredicate);

    // ---- Ownership, ACLs, disk usage ----

    // Owner/group of every item to uid/gid, mode 0755 for directories and
    // executables, 0644 otherwise. Per-item failures are logged only; a walk
    // that stops part way still fails, after the root has been seen to.
    TarnStatus standardizeOwnershipAtURL(const FileURL& url, uid_t toUID, gid_t GID);
    TarnStatus setTopLevelSystemContainerACLAtURL(const FileURL& url);
    TarnStatus standardizeACLsAtURL(const FileURL& url, bool isSystemContainer);
    // The same for the entry `name` of an open directory (`url` names it in
    // messages); the walk starts there and never follows a link.
    TarnStatus standardizeACLsOfItemInDirectory(const FsFd& directory, const std::string& name,
                                                const FileURL& url, bool isSystemContainer);
    TarnStatus standardizeACLsForSystemContainerAtURL(const FileURL& url);
    // Every item of `url` as a system container; a missing `url` succeeds.
    // The other items are still tried after a failure; the last failure is
    // the result.
    TarnStatus standardizeAllSystemContainerACLsAtURL(const FileURL& url);
    // Bytes allocated to the tree; 0 when no size can be had. With fast
    // sizing on and the container's `projectID`, the project's quota usage
    // answers at once; without quotas (or when the tree is not in that
    // project) the tree is measured as if no id had been given.
    uint64_t fastDiskUsageForURL(const FileURL& url,
                                 std::optional<uint32_t> projectID = std::nullopt);
    // With fast sizing on and project quotas kept by the file system of
    // `url` (a new container directory, still empty, so that all it will hold
    // inherits the project): gives it a project of its own and answers the
    // id. nullopt when there is none to give; the container is then walked.
    // Callers serialise creations (the global write lock does).
    std::optional<uint32_t> assignProjectToNewContainer(const FileURL& url, const Uuid& uuid);
    // Puts the file `url` into project `projectID` before it is renamed into
    // a container of that project (a rename across projects fails with EXDEV).
    // Succeeds where the file system has no project ids.
    TarnStatus moveIntoProject(const FileURL& url, uint32_t projectID);
    uint64_t diskUsageForURL(const FileURL& url);
    // Test-only: fastDiskUsageForURL() calls so far, process-wide.
    static uint64_t TEST_diskUsageMeasurementCount();

    // ACL builders (callers own the result). Failures are TarnErrorACLFailed.
    TarnStatus _CreateSystemUserACEInACL(TarnACL* acl, uint32_t withPermissions, uint32_t andFlags);
    TarnResult<TarnACLRef> _CopySystemContainerACLWithNumACEs(size_t numACEs, bool isDir,
                                                              bool inheritOnly);
    TarnResult<TarnACLRef> _CopyTopLevelSystemContainerACLWithError();

  private:
    TarnFileManager() = default;
};

}  // namespace tarn
