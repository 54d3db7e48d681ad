#include "Daemon/TarnFileManager.h"

#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <cstring>

#include "Platform/Accounts.h"
#include "Platform/Failpoints.h"
#include "Platform/HostConfiguration.h"
#include "Platform/LockState.h"
#include "Platform/PlatformLog.h"
#include "Platform/ProjectQuota.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kLogCategory = "fs";
constexpr const char* kSystemUsersGroup = "systemusers";
// The platform's nobody user and group (-2) is the overflow id on Linux.
constexpr uid_t kNobodyID = 65534;
constexpr int32_t kCompleteProtectionClass = 1;

std::string errText(int err) { return FsErrorText(err); }

// Components as the platform lists them: "/" first for an absolute path.
std::vector<std::string> componentsWithRoot(const std::string& path) {
    std::vector<std::string> out;
    if (!path.empty() && path[0] == '/') out.emplace_back("/");
    for (auto& c : PathComponents(path)) out.push_back(std::move(c));
    return out;
}

std::string joinComponents(const std::vector<std::string>& comps, size_t from, size_t to) {
    std::string out;
    for (size_t i = from; i < to; ++i) {
        if (comps[i] == "/") {
            out = "/";
            continue;
        }
        if (!out.empty() && out.back() != '/') out += '/';
        out += comps[i];
    }
    return out;
}

// "/private/var/x" -> "/var/x"; the root prefix is taken off first so that
// the rule sees device paths.
std::string stripPrivate(const std::string& url) {
    std::string p = StripRootPrefix(url);
    if (p.starts_with("/private/")) p.erase(0, 8);
    return p;
}

// A real host path as the device sees it. A path that left the root prefix
// cannot be inside any container: it gets a first component no device path has.
std::vector<std::string> deviceComponents(const std::string& real) {
    if (RootIsSystemRoot()) return componentsWithRoot(real);
    const std::string& root = RootPrefix();
    bool inside = real == root || (real.starts_with(root) && real[root.size()] == '/');
    if (inside) return componentsWithRoot(StripRootPrefix(real));
    auto comps = componentsWithRoot(real);
    comps.insert(comps.begin() + (comps.empty() ? 0 : 1), std::string("\x01outside-root", 13));
    return comps;
}

bool containsMetadataName(const std::string& path) {
    return path.find(kTarnMetadataFileName) != std::string::npos;
}

// Setting a class while locked fails where the platform's does: when the
// item is or becomes class 1 (complete protection), whose keys are gone.
// `fresh`: the caller has just made the directory, which therefore has no
// class yet; its current class need not be read.
int setProtectionClassChecked(int fd, int32_t newClass, bool fresh = false) {
    // The lock state is asked only when class 1 may be involved: reading it
    // opens a file, and new directories (most calls) have no class yet.
    int32_t current = 0;
    const int getErr = fresh ? 0 : FsGetProtectionClass(fd, &current);
    const bool mayBeRefused =
        getErr != 0 || current == kCompleteProtectionClass || newClass == kCompleteProtectionClass;
    if (mayBeRefused && LockStateDeviceIsLocked()) return getErr ? getErr : EPERM;
    return FsSetProtectionClass(fd, newClass);
}

std::string describeURLs(const std::vector<FileURL>& urls) {
    std::string out = "(";
    for (size_t i = 0; i < urls.size(); ++i) {
        if (i) out += ", ";
        out += urls[i];
    }
    return out + ")";
}

// ---- Mapping of the system-users ACLs onto POSIX ACLs ----
//
// The daemon describes its ACLs with the platform's entry-list model: one
// allow entry for the "systemusers" group with fine-grained permissions and
// inheritance flags. POSIX ACLs have rwx per entry and a separate default
// ACL on directories that new items inherit. The mapping:
//   - read-data gives r; write-data or append gives w; execute gives x, on a
//     file only when the file has an execute bit in its mode;
//   - on a directory w implies x: adding items needs search as well;
//   - an entry without inheritance flags (or only "inherited") becomes an
//     access entry; directory/file-inherit makes it an access and a default
//     entry; only-inherit makes it a default entry alone.
// So the top-level directory gets access "-wx" for the group (add items,
// nothing else) and default "rwx" (full access below), other directories get
// access and default "rwx", and files "rw-" plus x for executables. Every ACL
// gets a mask equal to the union of its group class, so the named entry is
// not cut back by the mode; since chmod rewrites the mask, the mode is set
// before the ACL.
int rwxOf(uint32_t perms, bool isDirectory, bool executable) {
    int out = 0;
    if (perms & kTarnACLReadData) out |= 4;
    if (perms & (kTarnACLWriteData | kTarnACLAppendData)) out |= 2;
    if ((perms & kTarnACLExecute) && (isDirectory || executable)) out |= 1;
    if (isDirectory && (out & 2)) out |= 1;
    return out;
}

FsGroupACL posixACLFor(const TarnACL& acl, const FsStat& st) {
    FsGroupACL out;
    bool dir = st.isDirectory();
    bool exec = (st.mode & 0111) != 0;
    for (const auto& e : acl.entries) {
        out.gid = e.qualifier;
        int rwx = rwxOf(e.permissions, dir, exec);
        bool inherits = (e.flags & (kTarnACLFlagFileInherit | kTarnACLFlagDirectoryInherit)) != 0;
        bool onlyInherit = (e.flags & kTarnACLFlagOnlyInherit) != 0;
        if (!onlyInherit) out.accessPerms = std::max(out.accessPerms, 0) | rwx;
        if (dir && (inherits || onlyInherit)) {
            // What is inherited is the full entry, whatever the executable
            // bit of the directory says.
            out.defaultPerms = std::max(out.defaultPerms, 0) |
                               rwxOf(e.permissions, /*isDirectory=*/true, /*executable=*/true);
        }
    }
    return out;
}

int applyACL(int parentFd, const std::string& name, const TarnACL& acl, const FsStat& st) {
    return FsSetGroupACLAt(parentFd, name, posixACLFor(acl, st));
}

void logSkippedOwner(const char* tag, const std::string& path) {
    TarnLog(kLogNotice, tag, "Not privileged: leaving the owner of %s alone", path);
}

}  // namespace

TarnFileManager& TarnFileManager::defaultManager() {
    static TarnFileManager* manager = new TarnFileManager();
    return *manager;
}

// ---- Real paths and the child test ----

bool TarnFileManager::_validateSymlink(const std::optional<std::string>& path, int32_t withStartingDepth,
                                       int32_t* andEndingDepth) {
    if (!path) return false;
    int64_t depth = withStartingDepth;
    for (const auto& c : componentsWithRoot(*path)) {
        if (c == "..") {
            --depth;
        } else if (c.empty() || c == "." || c == "/") {
            // no change
        } else {
            ++depth;
        }
        if (depth < withStartingDepth) return false;
    }
    if (andEndingDepth) *andEndingDepth = static_cast<int32_t>(depth);
    return true;
}

std::optional<FileURL> TarnFileManager::_realPathForURL(const FileURL& url,
                                                        bool allowNonExistentPathComponents) {
    std::string real, partial;
    int err = FsRealPath(url, &real, &partial);
    if (err == 0) return real;
    if (err == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url);
    TarnLog(kLogError, __func__, "Failed to realpath %s : %s at %s", url, errText(err), partial);
    return std::nullopt;
}

std::optional<FileURL> TarnFileManager::_realPathWhatExistsInPath(const std::string& path) {
    auto comps = componentsWithRoot(path);
    size_t n = comps.size();
    if (n <= 1) return std::nullopt;
    for (size_t k = n; k >= 2; --k) {
        std::string prefix = joinComponents(comps, 0, k);
        if (!itemExistsAtURL(prefix)) continue;
        auto real = _realPathForURL(prefix, false);
        if (!real) {
            // It exists but does not resolve: a dangling or looping link.
            // Appending the tail to a shorter prefix would hide that the
            // path goes through it, and whoever creates the tail later
            // would follow it wherever it points.
            TarnLog(kLogError, __func__, "Refusing %@: %@ exists but has no real path", path, prefix);
            return std::nullopt;
        }
        std::string rest = joinComponents(comps, k, n);
        TarnLog(kLogDebug, __func__, "Realpathed %@ ; appending non-existing components %@", *real, rest);
        return PathJoin(*real, rest);
    }
    return std::nullopt;
}

std::optional<FileURL> TarnFileManager::realPathForURL(const FileURL& url, const FileURL& ifChildOfURL) {
    const char* tag = __func__;
    const FileURL& baseURL = ifChildOfURL;
    if (url.empty() || baseURL.empty()) {
        TarnLog(kLogError, tag, "The base path %@ and/or suspicious path %@ were nil", baseURL, url);
        return std::nullopt;
    }
    // The textual checks see device paths with "/private" taken off; the
    // system calls use the URLs as given, which name the same items.
    std::string base = stripPrivate(baseURL);
    std::string suspicious = stripPrivate(url);
    if (!suspicious.starts_with(base)) {
        TarnLog(kLogError, tag, "supiscious path %@ does not contain base path %@ as a prefix", suspicious, base);
        return std::nullopt;
    }
    if (PathHasDotDotComponent(suspicious)) {
        TarnLog(kLogError, tag, "The suspicious path %@ contains '..' paths, which are invalid", suspicious);
        return std::nullopt;
    }

    std::string target;
    int err = FsReadLink(url, &target);
    if (err != 0 && err != EINVAL && err != ENOENT) {
        TarnLog(kLogError, tag, "Readlink failed: %s", errText(err));
        return std::nullopt;
    }
    if (err == 0) {
        if (!target.empty() && target[0] == '/') {
            TarnLog(kLogError, tag, "Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious, target);
            return std::nullopt;
        }
        int32_t baseDepth = 0;
        if (!_validateSymlink(base, 0, &baseDepth)) {
            TarnLog(kLogError, tag, "Failed to retrieve depth of %@", base);
            return std::nullopt;
        }
        std::string below = suspicious.substr(base.size());
        std::string joined = PathJoin(PathParent(below), target);
        if (!_validateSymlink(joined, baseDepth, nullptr)) {
            TarnLog(kLogError, tag, "Rejecting %@ -> %@, as it is points outside or to the base %@", suspicious,
                    joined, base);
            return std::nullopt;
        }
    }

    auto baseReal = _realPathForURL(baseURL, false);
    if (!baseReal) {
        TarnLog(kLogError, tag, "Failed to retrieve realpath for base path %@ ", base);
        return std::nullopt;
    }
    auto suspiciousReal = _realPathForURL(url, true);
    if (!suspiciousReal) {
        TarnLog(kLogError, tag, "Failed to retrieve realpath for suspicious path %@", suspicious);
        return std::nullopt;
    }

    // The comparison also runs for a link that passed the depth walk: links
    // further along its target are resolved by realpath and could leave the
    // base, and the real path is what the caller will act on.
    auto B = deviceComponents(*baseReal);
    auto S = deviceComponents(*suspiciousReal);
    if (B.size() < 2 || S.size() < 2) {
        TarnLog(kLogError, tag,
                "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
                suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    size_t i = B[1] == "private" ? 2 : 1;
    size_t j = S[1] == "private" ? 2 : 1;
    if (B.size() - i > S.size() - j) {
        TarnLog(kLogError, tag,
                "Rejecting %@ with base %@ because base component count is greater than child component count "
                "(reals %@ ; %@)",
                suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    for (; i < B.size(); ++i, ++j) {
        if (B[i] != S[j]) {
            TarnLog(kLogError, tag, "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                    suspicious, base, *suspiciousReal, *baseReal, B[i], S[j]);
            return std::nullopt;
        }
    }
    return suspiciousReal;
}

FileURL TarnFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
    auto user = AccountUserByUID(uid);
    if (!user) {
        TarnLog(kLogError, __func__, "Failed to getpwuid for uid: %u", uid);
    } else if (!user->home.empty()) {
        std::string home = RootPath(PathStandardize(user->home));
        std::string real;
        // A home that does not exist yet is still the home.
        if (FsRealPath(home, &real) == 0) return real;
        return home;
    }
    TarnLog(kLogError, __func__, "Failed to get home dir using getpwuid for uid: %u", uid);
    return RootPath("/private/var/mobile");
}

// ---- Client-named items below a directory held open ----

TarnResult<TarnFileManager::ItemInDirectory> TarnFileManager::itemBelowDirectory(
    const FsFd& base, const std::string& relativePath) {
    const std::string standardized = PathStandardize(relativePath);
    if (!standardized.empty() && standardized[0] == '/')
        return TARN_POSIX_ERROR(EXDEV, "Absolute path %@ refused below a directory", relativePath);
    if (standardized.empty() || standardized == ".")
        return TARN_POSIX_ERROR(EINVAL, "Path %@ names the directory itself", relativePath);
    ItemInDirectory item;
    item.name = PathLastComponent(standardized);
    if (item.name == "..")
        return TARN_POSIX_ERROR(EXDEV, "Path %@ leaves its directory", relativePath);
    item.directory = TARN_TRY(openDirectoryBelowDirectory(base, PathParent(standardized)));
    FsStat st;
    if (int err = FsStatAt(item.directory.get(), item.name, &st)) {
        if (err != ENOENT)
            return TARN_POSIX_ERROR(err, "stat of %@ failed: %s", relativePath, errText(err));
    } else {
        item.stat = st;
    }
    return item;
}

TarnResult<FsFd> TarnFileManager::openDirectoryBelowDirectory(const FsFd& base,
                                                              const std::string& relativePath) {
    if (!base) return TARN_POSIX_ERROR(EBADF, "No directory to resolve %@ below", relativePath);
    FsFd directory;
    if (int err = FsOpenDirectoryBeneath(base.get(), relativePath, &directory)) {
        return TARN_POSIX_ERROR(err, "Failed to open %@ below its directory: %s", relativePath,
                                errText(err));
    }
    return directory;
}

TarnStatus TarnFileManager::renameItemInDirectory(const FsFd& fromDirectory,
                                                  const std::string& fromName,
                                                  const FsFd& toDirectory,
                                                  const std::string& toName) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.move"))
        err = *fp;
    else
        err = FsRenameAt(fromDirectory.get(), fromName, toDirectory.get(), toName);
    if (err == 0) return {};
    return TARN_POSIX_ERROR(err, "rename of %@ to %@ failed: %s", fromName, toName, errText(err));
}

TarnResult<std::string> TarnFileManager::createTemporaryDirectoryInDirectory(
    const FsFd& directory, const std::string& withNamePrefix) {
    int err = 0;
    std::string name;
    if (auto fp = TARN_FAILPOINT("fm.createTemporaryDirectory"))
        err = *fp;
    else
        err = FsMkdtempAt(directory.get(), withNamePrefix, &name);
    if (err)
        return TARN_POSIX_ERROR(err, "Failed to create temp dir with prefix %s : %s",
                                withNamePrefix, errText(err));
    return name;
}

TarnStatus TarnFileManager::setModeOfItemInDirectory(const FsFd& directory,
                                                     const std::string& name, mode_t mode) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.setMode"))
        err = *fp;
    else
        err = FsChmodAt(directory.get(), name, mode);
    if (err)
        return TARN_POSIX_ERROR(err, "chmod(%o) of %@ failed: %s", mode, name, errText(err));
    return {};
}

TarnStatus TarnFileManager::setOwnerOfItemInDirectory(const FsFd& directory,
                                                      const std::string& name, uid_t uid,
                                                      gid_t gid) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.setOwner")) {
        err = *fp;
    } else if (!ProcessIsPrivileged()) {
        logSkippedOwner(__func__, name);
        return {};
    } else {
        // AT_SYMLINK_NOFOLLOW would change a link's own owner; a link is
        // never what a caller of this means, so it is refused instead.
        FsStat st;
        err = FsStatAt(directory.get(), name, &st);
        if (err == 0 && st.isSymlink()) err = ELOOP;
        if (err == 0) err = FsChownAt(directory.get(), name, uid, gid);
    }
    if (err)
        return TARN_POSIX_ERROR(err, "chown(%d,%d) of %@ failed: %s", uid, gid, name,
                                errText(err));
    return {};
}

// ---- Directories ----

TarnStatus TarnFileManager::createDirectoryAtURL(const FileURL& url,
                                                 bool withIntermediateDirectories, mode_t mode) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0,
                                kTarnDataProtectionClassUnchanged);
}

TarnStatus TarnFileManager::createDirectoryAtURL(const FileURL& url,
                                                 bool withIntermediateDirectories, mode_t mode,
                                                 TarnDataProtectionClass dataProtectionClass) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, dataProtectionClass);
}

TarnStatus TarnFileManager::createDirectoryAtURL(const FileURL& url,
                                                 bool withIntermediateDirectories, mode_t mode,
                                                 uid_t owner) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner,
                                kTarnDataProtectionClassUnchanged);
}

TarnStatus TarnFileManager::createDirectoryAtURL(const FileURL& url,
                                                 bool withIntermediateDirectories, mode_t mode,
                                                 uid_t owner,
                                                 TarnDataProtectionClass dataProtectionClass) {
    if (auto fp = TARN_FAILPOINT("fm.createDirectory"))
        return TARN_POSIX_ERROR(*fp, "mkdir of %s failed: %s", url, errText(*fp));
    if (dataProtectionClass == kTarnDataProtectionClassUnchanged) {
        // The daemon's own directories are asked for on every creation and
        // nearly always exist as asked: one lstat instead of mkdir, stat, open
        // and chown. Anything else (missing, a link, another owner) takes the
        // full path below.
        struct stat st;
        if (::lstat(url.c_str(), &st) == 0 && S_ISDIR(st.st_mode) &&
            (owner == 0 || (st.st_uid == owner && st.st_gid == owner)))
            return {};
    }
    bool created = false;
    if (withIntermediateDirectories) {
        int err = FsMakePath(url, mode, &created);
        if (err != 0 && err != EEXIST)
            return TARN_POSIX_ERROR(err, "mkpath of %s failed: %s", url, errText(err));
    } else {
        int err = FsMkdir(url, mode);
        if (err != 0 && err != EEXIST)
            return TARN_POSIX_ERROR(err, "mkdir of %s failed: %s", url, errText(err));
        created = err == 0;
    }
    if (dataProtectionClass == kTarnDataProtectionClassUnchanged && owner == 0) return {};

    // Class and owner go through the directory's own descriptor, opened
    // without following: a link planted at the path is refused, not chowned.
    FsFd dir;
    if (int err = FsOpenDirectory(url, &dir))
        return TARN_POSIX_ERROR(err, "opendir of %s failed: %s", url, errText(err));
    if (dataProtectionClass != kTarnDataProtectionClassUnchanged) {
        if (int err = setProtectionClassChecked(dir.get(), dataProtectionClass, created)) {
            return TARN_POSIX_ERROR(err, "Failed to setclass(%d) on directory %s: %s",
                                    static_cast<int32_t>(dataProtectionClass), url, errText(err));
        }
    }
    if (owner != 0) {
        if (!ProcessIsPrivileged()) {
            logSkippedOwner(__func__, url);
        } else if (int err = FsChownFd(dir.get(), owner, owner)) {
            return TARN_POSIX_ERROR(err, "Failed to chown(%d,%d) %s: %s", owner, owner, url,
                                    errText(err));
        }
    }
    return {};
}

TarnResult<FileURL> TarnFileManager::createTemporaryDirectoryInDirectoryURL(const FileURL& url) {
    return createTemporaryDirectoryInDirectoryURL(url, "temp.");
}

TarnResult<FileURL> TarnFileManager::createTemporaryDirectoryInDirectoryURL(
    const FileURL& url, const std::string& withNamePrefix) {
    std::string path = PathJoin(url, Format("%@XXXXXX", withNamePrefix));
    if (auto fp = TARN_FAILPOINT("fm.createTemporaryDirectory"))
        return TARN_POSIX_ERROR(*fp, "Failed to create temp dir at path %s : %s", path,
                                errText(*fp));
    std::string made = path;
    if (int err = FsMkdtemp(&made))
        return TARN_POSIX_ERROR(err, "Failed to create temp dir at path %s : %s", path,
                                errText(err));
    return made;
}

// ---- Move, copy, remove ----

TarnStatus TarnFileManager::moveItemAtURL(const FileURL& url, const FileURL& toURL) {
    return _moveItemAtURL(url, toURL, /*failIfSrcMissing=*/true);
}

TarnStatus TarnFileManager::moveItemIfExistsAtURL(const FileURL& url, const FileURL& toURL) {
    return _moveItemAtURL(url, toURL, /*failIfSrcMissing=*/false);
}

TarnStatus TarnFileManager::copyItemAtURL(const FileURL& url, const FileURL& toURL) {
    return _copyItemAtURL(url, toURL, /*failIfSrcMissing=*/true);
}

TarnStatus TarnFileManager::copyItemIfExistsAtURL(const FileURL& url, const FileURL& toURL) {
    return _copyItemAtURL(url, toURL, /*failIfSrcMissing=*/false);
}

TarnStatus TarnFileManager::renameItemAtURL(const FileURL& url, const FileURL& toURL) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.move"))
        err = *fp;
    else
        err = FsRename(url, toURL);
    if (err == 0) return {};
    return TARN_POSIX_ERROR(err, "rename of %@ to %@ failed: %s", url, toURL, errText(err));
}

TarnStatus TarnFileManager::exchangeItemAtURL(const FileURL& url, const FileURL& withURL) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.exchange"))
        err = *fp;
    else
        err = FsRenameExchange(url, withURL);
    if (err == 0) return {};
    return TARN_POSIX_ERROR(err, "exchange of %@ and %@ failed: %s", url, withURL, errText(err));
}

bool TarnFileManager::exchangeIsUnsupported(const TarnErrorRef& error) {
    const int err = error ? error->posixCode() : 0;
    return err == EINVAL || err == ENOSYS || err == EOPNOTSUPP;
}

TarnStatus TarnFileManager::_moveItemAtURL(const FileURL& url, const FileURL& toURL,
                                           bool failIfSrcMissing) {
    if (!failIfSrcMissing) {
        int err = FsLstat(url, nullptr);
        if (err == ENOENT) return {};
        if (err) return TARN_POSIX_ERROR(err, "stat of %@ failed: %s", url, errText(err));
    }
    TarnStatus renamed = renameItemAtURL(url, toURL);
    if (renamed.ok()) return {};
    if (renamed.error()->posixCode() != EXDEV) return renamed;
    TARN_TRY(_copyItemAtURL(url, toURL, /*failIfSrcMissing=*/true));
    if (auto fp = TARN_FAILPOINT("fm.move.afterCopy"))
        return TARN_POSIX_ERROR(*fp, "rename of %@ to %@ failed: %s", url, toURL, errText(*fp));
    if (TarnStatus removed = removeItemAtURL(url); !removed.ok())
        TarnLog(kLogError, __func__, "Failed to remove move source after copy at %@ : %@", url,
                removed.error());
    return {};
}

TarnStatus TarnFileManager::_copyItemAtURL(const FileURL& url, const FileURL& toURL,
                                           bool failIfSrcMissing) {
    int err = FsLstat(url, nullptr);
    if (err == ENOENT && !failIfSrcMissing) return {};
    if (err) return TARN_POSIX_ERROR(err, "stat of %@ failed: %s", url, errText(err));
    if (auto fp = TARN_FAILPOINT("fm.copy"))
        err = *fp;
    else
        err = FsCopyTree(url, toURL);
    if (err) return TARN_POSIX_ERROR(err, "copy of %@ to %@ failed: %s", url, toURL, errText(err));
    return {};
}

TarnStatus TarnFileManager::removeItemAtURL(const FileURL& url) {
    if (url.empty()) return TARN_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:");
    if (auto fp = TARN_FAILPOINT("fm.remove"))
        return TARN_POSIX_ERROR(*fp, "remove of %@ failed: %s", url, errText(*fp));
    int firstError = 0;
    auto callback = [&firstError](const FsWalkEntry& entry, int err) {
        const char* tag = "_remove_error_callback";
        if (err == 0) {
            TarnLog(kLogError, tag, "remove hit error for %s but we failed to get the error number", entry.path);
            err = ENOENT;
        }
        if (err != ENOENT) TarnLog(kLogError, tag, "remove hit error for %s : %s", entry.path, errText(err));
        if (err == EPERM && entry.parentFd >= 0) {
            bool immutable = false;
            if (int e = FsGetImmutableAt(entry.parentFd, entry.name, &immutable)) {
                TarnLog(kLogError, tag, "Failed to stat %s before unsetting the immutable flag: %s", entry.path,
                        errText(e));
            } else if (immutable) {
                if (int e = FsSetImmutableAt(entry.parentFd, entry.name, false))
                    TarnLog(kLogError, tag, "Failed to clear flags of %s: %s", entry.path, errText(e));
                TarnLog(kLogNotice, tag, "Unset immutable flag on %s", entry.path);
                bool directory = entry.type == FsWalkType::Directory;
                int e = FsUnlinkAt(entry.parentFd, entry.name, directory);
                if (e == 0) return true;
                TarnLog(kLogError, tag, "unlink of %s failed: %s", entry.path, errText(e));
            }
        }
        if (firstError == 0) firstError = err;
        return err == ENOENT;
    };
    int err = FsRemoveTree(url, callback);
    if (err != 0 && err != ENOENT)
        return TARN_POSIX_ERROR(err, "remove of %@ failed: %s", url, errText(err));
    if (firstError != 0 && firstError != ENOENT)
        return TARN_POSIX_ERROR(firstError, "remove of %@ failed: %s", url, errText(firstError));
    return {};
}

// ---- Files the daemon writes for itself ----

TarnStatus TarnFileManager::writeData(const std::string& data, const FileURL& toURL,
                                      uint64_t options) {
    return writeData(data, toURL, options, 0644);
}

TarnStatus TarnFileManager::writeData(const std::string& data, const FileURL& toURL,
                                      uint64_t options, mode_t mode) {
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.writeData"))
        err = *fp;
    else
        // Without file protection the file simply carries no class, which
        // reads as class 0; with it, nothing is inherited on Linux either.
        err = FsWriteFile(toURL, data, mode, (options & kTarnWriteAtomic) != 0, -1);
    if (err) return TARN_POSIX_ERROR(err, "write of %@ failed: %s", toURL, errText(err));
    return {};
}

TarnResult<std::string> TarnFileManager::readDataAtURL(const FileURL& url, size_t maxBytes) {
    std::string out;
    if (int err = FsReadFile(url, maxBytes, &out))
        return TARN_POSIX_ERROR(err, "read of %@ failed: %s", url, errText(err));
    return out;
}

int TarnFileManager::readDataInDirectory(const FsFd& directory, const std::string& relativePath,
                                         size_t maxBytes, std::string* data) {
    if (!directory) return EBADF;
    return FsReadFileAt(directory.get(), relativePath, maxBytes, data);
}

int TarnFileManager::openDirectoryAtURL(const FileURL& url, FsFd* directory) {
    return FsOpenDirectory(url, directory);
}

uint64_t TarnFileManager::subdirectoryCountHint(const FsFd& directory) {
    FsStat st;
    if (!directory || FsStatAt(directory.get(), ".", &st) != 0 || st.nlink < 2) return 0;
    return std::min<uint64_t>(st.nlink - 2, uint64_t{1} << 20);
}

int TarnFileManager::forEachNameInDirectory(const FsFd& directory,
                                            const std::function<void(std::string_view)>& each) {
    if (!directory) return EBADF;
    return FsForEachNameAt(directory.get(), [&each](std::string_view name) {
        if (!name.empty() && name[0] != '.') each(name);
    });
}

// ---- Listing and traversal ----

TarnResult<std::vector<FileURL>> TarnFileManager::urlsForItemsInDirectoryAtURL(const FileURL& url) {
    std::vector<FsDirEntry> entries;
    if (int err = FsListDirectory(url, &entries)) {
        if (err != ENOENT) TarnLog(kLogError, __func__, "opendir of %s failed: %s", url, errText(err));
        return TARN_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errText(err));
    }
    std::vector<FileURL> out;
    out.reserve(entries.size());
    // PathJoin(url, name) for names without slashes: the joined prefix once,
    // then one allocation per entry (a class directory lists thousands).
    std::string prefix = PathJoin(url, "x");
    prefix.pop_back();
    for (const auto& e : entries) {
        if (e.name.empty() || e.name[0] == '.') continue;
        FileURL& entry = out.emplace_back();
        entry.reserve(prefix.size() + e.name.size());
        entry.append(prefix).append(e.name);
    }
    return out;
}

namespace {

using FsVisit = std::function<bool(const FsWalkEntry&)>;

// A directory the walk found but could not open (no search or read
// permission): its stat is known, its contents are not. A directory swapped
// between the stat and the open (EAGAIN) is no such thing and still stops the walk.
bool unreadableDirectory(const FsWalkEntry& entry) {
    return entry.type == FsWalkType::Error && entry.st.isDirectory() && !entry.name.empty() &&
           entry.fd < 0 && (entry.error == EACCES || entry.error == EPERM);
}

// A traversal over the walk `walk` starts (FsWalk or FsWalkAt), handing every
// entry to `withBlock`, under the name of `operation`.
TarnStatus traverse(const char* operation, const FileURL& url,
                    const std::function<int(const FsVisit&)>& walk,
                    const TarnTraversalBlock& withBlock) {
    SignpostInterval interval(kLogCategory, "TraversingDirectory");
    uint64_t handed = 0;
    TarnErrorRef walkError;
    int err = walk([&](const FsWalkEntry& entry) {
        // An unreadable directory is handed on like any directory (its own
        // owner, mode and ACL can still be set through its parent) and the
        // walk goes on with its siblings; only its contents stay unseen.
        std::optional<FsWalkEntry> unreadable;
        if (unreadableDirectory(entry)) {
            unreadable = entry;
            unreadable->type = FsWalkType::Directory;
        } else if (entry.type == FsWalkType::Error) {
            walkError = TARN_POSIX_ERROR_IN(operation, entry.error, "Error for path %s: %s", url,
                                            errText(entry.error));
            return false;
        }
        ++handed;
        if (TarnStatus visited = withBlock(unreadable ? *unreadable : entry); !visited.ok()) {
            walkError = visited.error();
            if (!walkError)
                walkError = TARN_POSIX_ERROR_IN(operation, ECANCELED, "traversal of %s stopped", url);
            return false;
        }
        return true;
    });
    interval.end({{"count", std::to_string(handed)}});
    if (walkError) return walkError;
    if (err)
        return TARN_POSIX_ERROR_IN(operation, err, "fts_open failed for %s with error %s", url,
                                   errText(err));
    return {};
}

}  // namespace

TarnStatus TarnFileManager::_traverseDirectory(const FileURL& url,
                                               const TarnTraversalBlock& withBlock) {
    return traverse(
        __func__, url, [&](const FsVisit& visit) { return FsWalk(url, visit); }, withBlock);
}

TarnStatus TarnFileManager::_traverseItemInDirectory(const FsFd& directory,
                                                     const std::string& name, const FileURL& url,
                                                     const TarnTraversalBlock& withBlock) {
    return traverse(
        __func__, url,
        [&](const FsVisit& visit) { return FsWalkAt(directory.get(), name, url, visit); },
        withBlock);
}

void TarnFileManager::printDirectoryStructureAtURL(const FileURL& url) {
    const char* tag = __func__;
    int err = FsWalk(url, [&](const FsWalkEntry& entry) {
        if (entry.type == FsWalkType::Error)
            TarnLog(kLogError, tag, "FTS returned error for %s : %s", entry.path, errText(entry.error));
        else if (entry.type != FsWalkType::DirectoryPost)
            TarnLog(kLogError, tag, "\tOrphaned File: %s", entry.path);
        return true;
    });
    if (err) TarnLog(kLogError, tag, "fts_open failed for %@ : %s", url, errText(err));
}

bool TarnFileManager::itemExistsAtURL(const FileURL& url) {
    int err = FsLstat(url, nullptr);
    if (err == 0) return true;
    if (err != ENOENT) TarnLog(kLogError, __func__, "Failed to determine if %@ exists: %s", url, errText(err));
    return false;
}

bool TarnFileManager::itemDoesNotExistAtURL(const FileURL& url) {
    int err = FsLstat(url, nullptr);
    if (err == ENOENT) return true;
    if (err != 0) TarnLog(kLogError, __func__, "Failed to determine if %@ exists: %s", url, errText(err));
    return false;
}

// ---- Data protection ----

TarnResult<int32_t> TarnFileManager::dataProtectionClassOfItemAtURL(const FileURL& url) {
    FsFd fd;
    if (int err = FsOpenItem(-1, url, &fd))
        return TARN_POSIX_ERROR(err, "Failed to open %s : %s", url, errText(err));
    int32_t cls = 0;
    if (int err = FsGetProtectionClass(fd.get(), &cls))
        return TARN_POSIX_ERROR(err, "Failed to getclass of file %s: %s", url, errText(err));
    return cls;
}

TarnStatus TarnFileManager::setDataProtectionClassOfItemAtURL(
    const FileURL& url, int32_t toClass, const TarnDataProtectionPredicate& ifPredicate) {
    return setDataProtectionClassOfItemInDirectory(-1, url, url, toClass, ifPredicate);
}

TarnStatus TarnFileManager::setDataProtectionClassOfItemInDirectory(
    int directoryFd, const std::string& name, const FileURL& url, int32_t toClass,
    const TarnDataProtectionPredicate& ifPredicate) {
    FsFd fd;
    if (int err = FsOpenItem(directoryFd, name, &fd))
        return TARN_POSIX_ERROR(err, "Failed to open %s : %s", url, errText(err));
    if (ifPredicate) {
        int32_t current = 0;
        if (int err = FsGetProtectionClass(fd.get(), &current))
            return TARN_POSIX_ERROR(err, "Failed to getclass of file %s: %s", url, errText(err));
        if (!ifPredicate(current)) return {};
    }
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.setDataProtectionClass"))
        err = *fp;
    else
        err = setProtectionClassChecked(fd.get(), toClass);
    if (err)
        return TARN_POSIX_ERROR(err, "Failed to setclass(%d) on file %s: %s", toClass, url,
                                errText(err));
    return {};
}

// ---- Ownership ----

TarnStatus TarnFileManager::standardizeOwnershipAtURL(const FileURL& url, uid_t toUID, gid_t GID) {
    const char* tag = __func__;
    if (auto fp = TARN_FAILPOINT("fm.standardizeOwnership"))
        return TARN_POSIX_ERROR(*fp, "Could not stat %s: %s", url, errText(*fp));
    bool privileged = ProcessIsPrivileged();
    bool skipNoted = false;
    // Owner first: chown clears set-id bits, and the mode set next is final.
    auto standardize = [&](int parentFd, const std::string& name, const std::string& path, const FsStat& st,
                           bool compareGroup) {
        bool differs = st.uid != toUID || (compareGroup && st.gid != GID);
        if (differs) {
            if (!privileged) {
                if (!skipNoted) logSkippedOwner(tag, path);
                skipNoted = true;
            } else if (int err = FsChownAt(parentFd, name, toUID, GID)) {
                TarnLog(kLogError, tag, "Could not chown %s: %s", path, errText(err));
            }
        }
        if (st.isSymlink()) return;  // links have no mode of their own here
        mode_t mode = (st.isDirectory() || (st.mode & 0111)) ? 0755 : 0644;
        if (int err = FsChmodAt(parentFd, name, mode))
            TarnLog(kLogError, tag, "Could not chmod %s: %s", path, errText(err));
    };
    TarnStatus walked = _traverseDirectory(url, [&](const TarnTraversalEntry& e) -> TarnStatus {
        if (e.type == FsWalkType::DirectoryPost || containsMetadataName(e.path)) return {};
        standardize(e.parentFd, e.name, e.path, e.st, /*compareGroup=*/true);
        return {};
    });
    // The root once more, as it stands now.
    FsFd parent;
    std::string name;
    FsStat st;
    int err = FsOpenParent(url, &parent, &name);
    if (err == 0) err = FsStatAt(parent.get(), name, &st);
    if (err) return TARN_POSIX_ERROR(err, "Could not stat %s: %s", url, errText(err));
    if (!containsMetadataName(url))
        standardize(parent.get(), name, url, st, /*compareGroup=*/false);
    return walked;
}

// ---- ACLs ----

TarnStatus TarnFileManager::_CreateSystemUserACEInACL(TarnACL* acl, uint32_t withPermissions,
                                                      uint32_t andFlags) {
    if (!acl)
        return TARN_ERROR(TarnErrorACLFailed, nullptr, "acl_create_entry() failed: %s",
                          errText(EINVAL));
    auto group = AccountGroupByName(kSystemUsersGroup);
    if (!group)
        return TARN_ERROR(TarnErrorACLFailed, nullptr, "group lookup for systemusers failed: %s",
                          errText(ENOENT));
    TarnACLEntry entry;
    entry.qualifier = group->gid;
    entry.permissions = withPermissions;
    entry.flags = andFlags;
    acl->entries.push_back(entry);
    return {};
}

TarnResult<TarnACLRef> TarnFileManager::_CopySystemContainerACLWithNumACEs(size_t numACEs,
                                                                           bool isDir,
                                                                           bool inheritOnly) {
    auto acl = std::make_unique<TarnACL>();
    acl->capacity = numACEs;
    acl->entries.reserve(numACEs);
    uint32_t perms = isDir ? kTarnACLPermsDirectory : kTarnACLPermsFile;
    uint32_t flags = isDir ? (inheritOnly ? kTarnACLFlagOnlyInherit | kTarnACLFlagDirectoryInherit |
                                                kTarnACLFlagFileInherit
                                          : kTarnACLFlagDirectoryInherit | kTarnACLFlagFileInherit)
                           : kTarnACLFlagInherited;
    TARN_TRY(_CreateSystemUserACEInACL(acl.get(), perms, flags));
    return acl;
}

TarnResult<TarnACLRef> TarnFileManager::_CopyTopLevelSystemContainerACLWithError() {
    TarnACLRef acl =
        TARN_TRY(_CopySystemContainerACLWithNumACEs(2, /*isDir=*/true, /*inheritOnly=*/true));
    TARN_TRY(_CreateSystemUserACEInACL(acl.get(), kTarnACLPermsTopLevelSelf, 0));
    return acl;
}

TarnStatus TarnFileManager::setTopLevelSystemContainerACLAtURL(const FileURL& url) {
    const TarnACLRef acl = TARN_TRY(_CopyTopLevelSystemContainerACLWithError());
    int err = 0;
    if (auto fp = TARN_FAILPOINT("fm.setTopLevelACL")) err = *fp;
    FsFd parent;
    std::string name;
    FsStat st;
    if (!err) err = FsOpenParent(url, &parent, &name);
    if (!err) err = FsStatAt(parent.get(), name, &st);
    if (!err) err = applyACL(parent.get(), name, *acl, st);
    if (err)
        return TARN_ERROR(TarnErrorACLFailed, nullptr, "Failed to set ACL on %@: %s", url,
                          errText(err));
    return {};
}

namespace {

// The ACL standardisation of a tree; `traverseWith` walks it (from a path or
// from an entry of an open directory).
using TarnTraversal = std::function<TarnStatus(const TarnTraversalBlock&)>;

TarnStatus standardizeACLs(TarnFileManager& fm, const char* tag, const FileURL& url,
                           bool isSystemContainer, const TarnTraversal& traverseWith) {
    const TarnACLRef topLevel = TARN_TRY(fm._CopyTopLevelSystemContainerACLWithError());
    const TarnACLRef dirACL =
        TARN_TRY(fm._CopySystemContainerACLWithNumACEs(1, /*isDir=*/true, /*inheritOnly=*/false));
    const TarnACLRef fileACL =
        TARN_TRY(fm._CopySystemContainerACLWithNumACEs(1, /*isDir=*/false, /*inheritOnly=*/false));
    if (auto fp = TARN_FAILPOINT("fm.standardizeACLs"))
        return TARN_POSIX_ERROR_IN(tag, *fp, "Error for path %s: %s", url, errText(*fp));
    bool privileged = ProcessIsPrivileged();
    bool skipNoted = false;
    return traverseWith([&](const TarnTraversalEntry& e) -> TarnStatus {
        if (e.type == FsWalkType::DirectoryPost || containsMetadataName(e.path)) return {};
        bool isDir = e.type == FsWalkType::Directory;
        if (e.level == 0 && isSystemContainer && isDir) {
            if (int err = applyACL(e.parentFd, e.name, *topLevel, e.st))
                TarnLog(kLogError, tag, "Failed to set top level ACL on dir %s: %s", e.path, errText(err));
            return {};
        }
        if (e.type != FsWalkType::Symlink) {
            // Mode before ACL: chmod rewrites the ACL mask.
            if (int err = FsChmodAt(e.parentFd, e.name, 0))
                TarnLog(kLogError, tag, "Could not chmod %s: %s", e.path, errText(err));
            FsStat now = e.st;
            now.mode &= ~07777u;
            // The file ACL's x follows the item's executable bit as it was.
            now.mode |= e.st.mode & 0111;
            if (int err = applyACL(e.parentFd, e.name, isDir ? *dirACL : *fileACL, now))
                TarnLog(kLogError, tag, "Failed to set ACL on dir %s: %s", e.path, errText(err));
        }
        if (!privileged) {
            if (!skipNoted) logSkippedOwner(tag, e.path);
            skipNoted = true;
        } else if (int err = FsChownAt(e.parentFd, e.name, kNobodyID, kNobodyID)) {
            TarnLog(kLogError, tag, "Could not chown %s: %s", e.path, errText(err));
        }
        return {};
    });
}

}  // namespace

TarnStatus TarnFileManager::standardizeACLsAtURL(const FileURL& url, bool isSystemContainer) {
    return standardizeACLs(*this, __func__, url, isSystemContainer,
                           [&](const TarnTraversalBlock& block) {
                               return _traverseDirectory(url, block);
                           });
}

TarnStatus TarnFileManager::standardizeACLsOfItemInDirectory(const FsFd& directory,
                                                             const std::string& name,
                                                             const FileURL& url,
                                                             bool isSystemContainer) {
    return standardizeACLs(*this, __func__, url, isSystemContainer,
                           [&](const TarnTraversalBlock& block) {
                               return _traverseItemInDirectory(directory, name, url, block);
                           });
}

TarnStatus TarnFileManager::standardizeACLsForSystemContainerAtURL(const FileURL& url) {
    return standardizeACLsAtURL(url, /*isSystemContainer=*/true);
}

TarnStatus TarnFileManager::standardizeAllSystemContainerACLsAtURL(const FileURL& url) {
    auto items = urlsForItemsInDirectoryAtURL(url);
    if (!items.ok()) {
        if (items.error() && items.error()->posixCode() == ENOENT) return {};
        TarnLog(kLogError, __func__, "Failed to get items at URL%@ : %@", url, items.error());
        return items.error();
    }
    if (items->empty()) return {};
    TarnLog(kLogNotice, __func__, "Potential containers requiring ACL migration: %@", describeURLs(*items));
    TarnStatus result;
    for (const auto& item : *items) {
        if (TarnStatus standardized = standardizeACLsForSystemContainerAtURL(item);
            !standardized.ok()) {
            TarnLog(kLogError, __func__, "Failed to set system container ACL at %@: %@", item,
                    standardized.error());
            result = standardized;
        }
    }
    return result;
}

// ---- Disk usage ----

namespace {
std::atomic<uint64_t> gDiskUsageMeasurementCount{0};
}  // namespace

uint64_t TarnFileManager::TEST_diskUsageMeasurementCount() {
    return gDiskUsageMeasurementCount.load();
}

namespace {

// The usage of `projectID` when `url` is the root of that project; nullopt
// (with a line saying why) when the file system cannot answer for the tree.
std::optional<ProjectQuotaUsage> projectUsage(const FileURL& url, uint32_t projectID) {
    uint32_t rootProject = 0;
    bool inherits = false;
    int err = ProjectQuotaRead(url, &rootProject, &inherits);
    // A container restored or copied from elsewhere lost its project: its
    // usage would be another tree's, or nothing.
    if (err == 0 && (rootProject != projectID || !inherits)) err = EXDEV;
    ProjectQuotaUsage usage;
    if (err == 0) err = ProjectQuotaUsageOf(url, projectID, &usage);
    // The root itself is always in its project.
    if (err == 0 && usage.inodes == 0) err = ENODATA;
    if (err) {
        PlatformLog(kLogCategory, PlatformLogType::Error,
                    "Failed to get usage of project %u on %s: (err %d) %s", projectID, url, err,
                    errText(err));
        return std::nullopt;
    }
    return usage;
}

}  // namespace

uint64_t TarnFileManager::fastDiskUsageForURL(const FileURL& url,
                                              std::optional<uint32_t> projectID) {
    gDiskUsageMeasurementCount.fetch_add(1, std::memory_order_relaxed);
    if (!HostConfiguration::shared().featureEnabled("fast_container_sizing")) return diskUsageForURL(url);
    SignpostInterval interval(kLogCategory, "CalculatingDiskUsage");
    int64_t total = 0;
    uint64_t descendants = 0;
    if (std::optional<ProjectQuotaUsage> usage =
            projectID ? projectUsage(url, *projectID) : std::nullopt) {
        descendants = usage->inodes - 1;  // the root is not its own descendant
        PlatformLog(kLogCategory, PlatformLogType::Default,
                    "[%s]: descendants: %llu, total size: %llu", url, descendants, usage->bytes);
        interval.end(
            {{"descendants", std::to_string(descendants)}, {"size", std::to_string(usage->bytes)}});
        return usage->bytes;
    }
    int err = FsDirectoryStatisticsFast(url, &total, &descendants);
    bool fallback = false;
    if (err == ENOTSUP) {
        if (int e = FsEnableDirectoryStatistics(url)) {
            PlatformLog(kLogCategory, PlatformLogType::Error, "Failed to set maintain-dir-stats on %s: (err %d) %s",
                        url, e, errText(e));
            fallback = true;
        } else {
            PlatformLog(kLogCategory, PlatformLogType::Default, "Enabled fast directory sizing on [%s]", url);
            err = FsDirectoryStatisticsFast(url, &total, &descendants);
        }
    }
    if (!fallback && err) {
        PlatformLog(kLogCategory, PlatformLogType::Error, "Failed to get dirstats on %s: (err %d) %s", url, err,
                    errText(err));
        fallback = true;
    }
    if (!fallback && total < 0) {
        PlatformLog(kLogCategory, PlatformLogType::Error, "Invalid size (%lld) from dirstats on %s: (err %d) %s",
                    total, url, 0, errText(0));
        fallback = true;
    }
    if (fallback) {
        interval.end();
        return diskUsageForURL(url);
    }
    PlatformLog(kLogCategory, PlatformLogType::Default, "[%s]: descendants: %llu, total size: %llu", url,
                descendants, static_cast<uint64_t>(total));
    interval.end({{"descendants", std::to_string(descendants)}, {"size", std::to_string(total)}});
    return static_cast<uint64_t>(total);
}

std::optional<uint32_t> TarnFileManager::assignProjectToNewContainer(const FileURL& url,
                                                                     const Uuid& uuid) {
    if (!HostConfiguration::shared().featureEnabled("fast_container_sizing")) return std::nullopt;
    // Seeded by the container's UUID so that concurrent daemons on one file
    // system (scratch roots, tests) rarely probe the same ids.
    uint32_t seed = 0;
    std::memcpy(&seed, uuid.bytes.data(), sizeof seed);
    uint32_t projectID = 0;
    int err = ProjectQuotaChooseID(url, seed, &projectID);
    if (err == 0) err = ProjectQuotaAssign(url, projectID);
    if (err) {
        // Most file systems keep no project usage: an everyday answer, the
        // container is then sized by walking it.
        PlatformLog(kLogCategory, PlatformLogType::Debug,
                    "No project for new container %s: (err %d) %s", url, err, errText(err));
        return std::nullopt;
    }
    PlatformLog(kLogCategory, PlatformLogType::Default, "Container %s sized by project %u", url,
                projectID);
    return projectID;
}

TarnStatus TarnFileManager::moveIntoProject(const FileURL& url, uint32_t projectID) {
    const int err = ProjectQuotaAssign(url, projectID);
    // No project ids on this file system: no project to be out of either.
    if (err == EOPNOTSUPP || err == ENOTTY) return {};
    if (err)
        return TARN_POSIX_ERROR(err, "Failed to put %@ into project %u: %s", url, projectID,
                                errText(err));
    return {};
}

uint64_t TarnFileManager::diskUsageForURL(const FileURL& url) {
    SignpostInterval interval(kLogCategory, "CalculatingDiskUsage");
    if (url.empty()) {
        PlatformLog(kLogCategory, PlatformLogType::Error, "Failed to get path to url %@", url);
        return 0;
    }
    uint64_t bytes = 0, descendants = 0;
    if (int err = FsDiskUsage(url, &bytes, &descendants)) {
        PlatformLog(kLogCategory, PlatformLogType::Error, "Failed to get dirstats on %s using fallback: (err %d) %s",
                    url, err, errText(err));
        return 0;
    }
    PlatformLog(kLogCategory, PlatformLogType::Debug, "[%s]: descendants: %llu, total size: %llu, using fallback",
                url, descendants, bytes);
    interval.end({{"descendants", std::to_string(descendants)}, {"size", std::to_string(bytes)}});
    return bytes;
}

}  // namespace tarn
