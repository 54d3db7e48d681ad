#include "Daemon/TarnConsistencyChecker.h"

#include <cstdlib>
#include <map>
#include <set>
#include <tuple>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnDataProtectionChangeOperation.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/FileSystem.h"
#include "Platform/Path.h"
#include "Platform/RootPrefix.h"
#include "Platform/SandboxUserState.h"

namespace tarn {

namespace {

// Fixed daemon directories, computed without the configuration's getters,
// which create what they name.
constexpr const char* kLibraryDirectory = "/private/var/root/Library/TarnKeeper";
constexpr const char* kReplaceDirectory = "/private/var/root/Library/TarnKeeper/Replace";
constexpr const char* kPendingUpdatesDirectory =
    "/private/var/root/Library/TarnKeeper/PendingUpdates";

bool exists(const std::string& path) {
    FsStat st;
    return FsLstat(path, &st) == 0;
}

struct LiveContainer {
    std::string identifier;
    TarnContainerClass containerClass = 0;
};

class Checker {
  public:
    explicit Checker(const TarnConsistencyOptions& options) : options_(options) {}

    TarnConsistencyReport run() {
        checkClassDirectories();
        checkReplaceFiles();
        checkPendingUpdateFiles();
        checkStore();
        checkSandboxState();
        report_.containersSeen = live_.size();
        return std::move(report_);
    }

  private:
    void violation(const std::string& path, std::string problem) {
        report_.violations.push_back({StripRootPrefix(path), std::move(problem)});
    }
    void note(const std::string& path, std::string problem) {
        report_.notes.push_back({StripRootPrefix(path), std::move(problem)});
    }

    // ---- containers ----

    void checkClassDirectories() {
        TarnGlobalConfiguration& global = TarnGlobalConfiguration::sharedInstance();
        const TarnUserIdentityRef defaultUser = TarnUserIdentityCache::defaultUserIdentity();
        for (bool transient : {false, true}) {
            for (TarnContainerClass c = 1; c <= 13; ++c) {
                if (!TarnContainerClassIsGlobal(c)) continue;
                if (auto base = global.globalContainerBaseURLWithContentClass(c, transient))
                    checkClassDirectory(*base, c, defaultUser, transient);
            }
            std::set<std::string> homes;
            TarnUserIdentitySharedCache::sharedInstance()
                .forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
                    [&](const TarnUserIdentityRef& user) {
                        const std::string home = user->homeDirectoryURL();
                        // The personal and unspecific identity of one user share a tree.
                        if (home.empty() || !homes.insert(home).second) return;
                        std::string base = PathJoin(home, "Containers");
                        if (transient) base = PathJoin(base, "Temp");
                        for (TarnContainerClass c = 1; c <= 13; ++c)
                            if (TarnContainerClassIsPerUser(c))
                                checkClassDirectory(
                                    PathJoin(base, TarnContainerClassRelativeDirectory(c)), c, user,
                                    transient);
                    });
        }
    }

    void checkClassDirectory(const std::string& base, TarnContainerClass c,
                             const TarnUserIdentityRef& user, bool transient) {
        std::vector<FsDirEntry> entries;
        if (const int err = FsListDirectory(base, &entries); err != 0) {
            if (err != ENOENT)
                violation(base, "class directory cannot be listed: errno " + std::to_string(err));
            return;
        }
        for (const FsDirEntry& entry : entries) {
            const std::string path = PathJoin(base, entry.name);
            FsStat st;
            if (FsLstat(path, &st) != 0) continue;  // went away while listed
            if (!st.isDirectory()) {
                violation(path, "not a container directory in a class directory");
                continue;
            }
            if (!exists(PathJoin(path, kTarnMetadataFileName))) {
                const std::string why =
                    "directory without a metadata file (the first-boot orphan sweep takes it)";
                options_.orphansAreViolations ? violation(path, why) : note(path, why);
                continue;
            }
            auto read = TarnMetadata::readAndValidateMetadataAtUrl(path, user,
                                                                   /*checkClassPath=*/true);
            if (!read.ok()) {
                violation(path, "invalid metadata: " +
                                    (read.error() ? read.error()->description() : std::string()));
                continue;
            }
            const TarnMetadataRef metadata = *read;
            if (metadata->containerClass() != c) {
                violation(path, "metadata of class " + std::to_string(metadata->containerClass()) +
                                    " in the directory of class " + std::to_string(c));
                continue;
            }
            const auto key = std::make_tuple(c, metadata->userIdentity()->identifier(), transient,
                                             metadata->identifier());
            auto [it, added] = byIdentity_.emplace(key, path);
            if (!added)
                violation(path, "identifier " + metadata->identifier() + " of class " +
                                    std::to_string(c) + " is also live at " +
                                    StripRootPrefix(it->second));
            live_.emplace(path, LiveContainer{metadata->identifier(), c});
        }
    }

    // ---- replace and pending-update files ----

    // Both are read with the daemon's own readers, so that a file start-up
    // would refuse is exactly one reported here.

    // The hidden temporary file of an atomic write the process died in; the
    // readers never list it.
    bool isInterruptedWrite(const std::string& path, const std::string& name) {
        if (!name.starts_with(".") || name.find(".plist.tmp.") == std::string::npos) return false;
        note(path, "temporary file of an interrupted write (never read)");
        return true;
    }

    bool isRegularFile(const std::string& path, const char* what) {
        FsStat st;
        if (FsLstat(path, &st) == 0 && st.isRegular()) return true;
        violation(path, std::string("not a regular file in the ") + what + " directory");
        return false;
    }

    static std::string describeError(const TarnErrorRef& error) {
        return error ? error->description() : std::string();
    }

    void checkReplaceFiles() {
        const std::string dir = RootPath(kReplaceDirectory);
        std::vector<FsDirEntry> entries;
        if (FsListDirectory(dir, &entries) != 0) return;
        for (const FsDirEntry& entry : entries) {
            const std::string path = PathJoin(dir, entry.name);
            const std::string_view name = entry.name;
            if (isInterruptedWrite(path, entry.name)) continue;
            if (name.size() <= 6 || name.substr(name.size() - 6) != ".plist" ||
                !Uuid::parse(name.substr(0, name.size() - 6))) {
                violation(path, "replace file not named <UUID>.plist");
                continue;
            }
            if (!isRegularFile(path, "replace")) continue;
            const auto info = TarnClientConnection::_readAndValidateReplaceFileAtUrl(path);
            if (!info.ok()) {
                violation(path,
                          "invalid replace file (start-up recovery discards it without "
                          "restoring anything): " +
                              describeError(info.error()));
                continue;
            }
            if (!exists(info->oldURL) && !exists(info->destURL) && !exists(info->stagingURL))
                violation(path,
                          "replacement lost its container: neither the old place, the "
                          "destination nor the staging directory exists");
            else
                note(path, "replacement in progress (start-up recovery finishes it)");
        }
    }

    void checkPendingUpdateFiles() {
        const std::string dir = RootPath(kPendingUpdatesDirectory);
        std::vector<FsDirEntry> entries;
        if (FsListDirectory(dir, &entries) != 0) return;
        for (const FsDirEntry& entry : entries) {
            const std::string path = PathJoin(dir, entry.name);
            if (isInterruptedWrite(path, entry.name)) continue;
            if (!isRegularFile(path, "pending data-protection")) continue;
            const auto read =
                TarnDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
                    path, TarnUserIdentitySharedCache::sharedInstance());
            if (!read.ok()) {
                violation(path,
                          "invalid pending data-protection file (start-up leaves it and "
                          "never runs it): " +
                              describeError(read.error()));
                continue;
            }
            const TarnUserIdentityRef owner = read->userIdentity
                                                  ? read->userIdentity
                                                  : TarnUserIdentityCache::defaultUserIdentity();
            const auto identity = TarnContainerIdentity::containerIdentityWithUserIdentity(
                owner, read->identifier, read->containerClass);
            // A newer change of the same container finds its file by name.
            if (!identity.ok() ||
                PathLastComponent(TarnDataProtectionChangeOperation::
                                      urlForProtectionOperationWithContainerIdentity(**identity)) !=
                    entry.name) {
                violation(path,
                          "pending data-protection file not named after the container it "
                          "changes (" +
                              read->identifier + ")");
                continue;
            }
            const auto key = std::make_tuple(read->containerClass, owner->identifier(),
                                             /*transient=*/false, read->identifier);
            if (byIdentity_.count(key))
                note(path, "data-protection change in progress (start-up runs it again)");
            else
                note(path, "pending data-protection change of " + read->identifier +
                               ", which is not live (start-up logs it and leaves the file)");
        }
    }

    // ---- code-signing store and group containers ----

    void checkStore() {
        const std::string dbPath = PathJoin(RootPath(kLibraryDirectory), "containers.sqlite3");
        std::set<std::string> referenced;
        if (exists(dbPath)) {
            const std::vector<std::string> problems = TarnSQLiteDB::integrityProblemsAtURL(dbPath);
            for (const std::string& p : problems) violation(dbPath, "integrity check: " + p);
            // A damaged store tells nothing reliable about group references.
            if (!problems.empty()) return;
            TarnSQLiteDB db(dbPath);
            const TarnStatus listed = db.enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                [&](const std::string& identifier, const TarnCodeSigningEntryRef& entry) {
                    const PlistDict* entitlements =
                        TarnCodeSigningMapping::_entitlementsFromCodeSigningEntry(entry);
                    for (auto groups :
                         {TarnCodeSigningMapping::_appGroupIdentifiersForIdentifier(identifier,
                                                                                    entitlements),
                          TarnCodeSigningMapping::_systemGroupIdentifiersForIdentifier(
                              identifier, entitlements)})
                        if (groups) referenced.insert(groups->begin(), groups->end());
                });
            if (!listed.ok())
                violation(dbPath, "stored entries cannot all be read: " +
                                      (listed.error() ? listed.error()->description() : ""));
        }
        for (const auto& [path, container] : live_)
            if (TarnContainerClassIsGroup(container.containerClass) &&
                !referenced.count(container.identifier))
                violation(path, "group container " + container.identifier +
                                    " is referenced by no stored entitlement");
    }

    // ---- sandbox state ----

    void checkSandboxState() {
        const FileURL dir = FileSandboxUserState::defaultDirectory();
        std::vector<FsDirEntry> entries;
        if (FsListDirectory(dir, &entries) != 0) return;
        std::set<uint32_t> uids;
        for (const FsDirEntry& entry : entries) {
            char* end = nullptr;
            const unsigned long uid = std::strtoul(entry.name.c_str(), &end, 10);
            if (end != entry.name.c_str() &&
                (std::string_view(end) == ".plist" || std::string_view(end) == ".journal"))
                uids.insert(static_cast<uint32_t>(uid));
        }
        // A state of its own, so that nothing the daemon's instance holds is used.
        FileSandboxUserState state(dir);
        for (uint32_t uid : uids) {
            const int err = state.iterateUserStateItems(
                uid, [&](uint64_t type, const SandboxUserStateItem* item) {
                    if (item && item->path) checkSandboxItem(uid, type, *item);
                });
            if (err != 0)
                violation(state.fileForUID(uid),
                          "sandbox state cannot be read: errno " + std::to_string(err));
        }
    }

    void checkSandboxItem(uint32_t uid, uint64_t type, const SandboxUserStateItem& item) {
        const std::string where = "sandbox item of user " + std::to_string(uid) + " for " +
                                  item.identifier + " (type " + std::to_string(type) + ")";
        const std::string& path = *item.path;
        if (!exists(path)) {
            note(path, where + " names a path that is gone (the next lookup drops it)");
            return;
        }
        auto it = live_.find(path);
        if (it == live_.end()) {
            violation(path, where + " names a directory that is not a live container");
            return;
        }
        if (it->second.identifier != item.identifier ||
            TarnContainerClassSandboxItemType(it->second.containerClass) != type)
            violation(path, where + " names the container of " + it->second.identifier +
                                " (class " + std::to_string(it->second.containerClass) + ")");
    }

    const TarnConsistencyOptions options_;
    TarnConsistencyReport report_;
    // Container path -> what lives there.
    std::map<std::string, LiveContainer> live_;
    // (class, user identity, transient, identifier) -> path.
    std::map<std::tuple<TarnContainerClass, std::string, bool, std::string>, std::string>
        byIdentity_;
};

}  // namespace

std::string TarnConsistencyReport::describe() const {
    std::string out;
    for (const auto& v : violations) out += "violation: " + v.path + ": " + v.problem + "\n";
    for (const auto& n : notes) out += "note: " + n.path + ": " + n.problem + "\n";
    return out;
}

TarnConsistencyReport TarnCheckContainerTree(const TarnConsistencyOptions& options) {
    return Checker(options).run();
}

}  // namespace tarn
