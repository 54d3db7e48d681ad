// The imports of code-signing records kept before the store existed (the
// legacy entitlements file, info cached in bundle container metadata,
// app-group identifiers in data container metadata) and the boot pass that
// runs them with the app-group reconciliation.
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnGroupManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnMigrationStatus.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"

namespace tarn {

namespace {

constexpr const char* kLegacyEntitlementsFileName = "tarn_entitlements.plist";
constexpr const char* kLegacyChildrenKey = "com.ostrea.TarnKeeper.ChildPluginBundleIDs";
constexpr const char* kLegacyRegisteredByCallerKey =
    "com.ostrea.TarnKeeper.EntitlementsRegisteredByCaller";
constexpr const char* kLegacyPlaceholderKey = "com.ostrea.TarnKeeper.PlaceholderEntitlements";
// The key under which a bundle container's cached info keeps its entitlements.
constexpr const char* kCachedInfoEntitlementsKey = "Entitlements";

// The legacy mobile user whose data containers once held the group lists.
constexpr uint32_t kLegacyMobileUserId = 501;

// Multi-user mode: the host's flags can be read and their top bit is set.
// App groups are then per session and must not be judged from this store.
bool multiUserMode() {
    const auto& flags = HostConfiguration::shared().multiUserFlags;
    return flags && (*flags & 0x80000000u) != 0;
}

// One of the per-identifier tables of the legacy file, or nothing.
const PlistDict* legacyTable(const PlistDict& file, const char* key) {
    auto it = file.find(key);
    return it == file.end() ? nullptr : it->second.asDict();
}

const PlistValue* tableValue(const PlistDict* table, const std::string& identifier) {
    if (!table) return nullptr;
    auto it = table->find(identifier);
    return it == table->end() ? nullptr : &it->second;
}

// The import's clean-up: the metadata value is cleared once its content is
// in the store (or was there already); `failed` logs a failure. The global
// write lock is held by the boot pass, so no identifier lock is taken.
void clearInfoValues(const std::vector<TarnMetadataRef>& containers, const char* key,
                     const std::function<void(const TarnMetadataRef&, uint64_t code)>& failed) {
    for (const TarnMetadataRef& container : containers) {
        const TarnStatus cleared = TarnClientConnection::sharedClientConnection().setInfoValue(
            std::nullopt, std::string(key), container->containerIdentity(), /*useLocking=*/false);
        if (!cleared.ok()) failed(container, cleared.code(TarnErrorWriteFailed));
    }
}

// Every non-transient container of the class for `userIdentity`; a listing
// failure is logged with `failureFormat` and reads as none.
std::vector<TarnMetadataRef> containersHolding(const TarnUserIdentityRef& userIdentity,
                                               TarnContainerClass containerClass, const char* key,
                                               const char* tag, const char* failureFormat) {
    TarnResult<std::vector<TarnMetadataRef>> all =
        TarnContainerCache::sharedInstance().allContainersForUserIdentity(
            userIdentity, containerClass, /*transient=*/false);
    if (!all.ok()) {
        TarnLog(kLogError, tag, failureFormat, static_cast<int64_t>(containerClass), all.error());
        return {};
    }
    std::vector<TarnMetadataRef> holding;
    for (const TarnMetadataRef& container : *all) {
        if (container->info() && container->info()->find(key)) holding.push_back(container);
    }
    return holding;
}

}  // namespace

// ---- decoding ----

std::vector<TarnCodeSigningMapping::LegacyEntitlementsEntry>
TarnCodeSigningMapping::_entriesFromLegacyEntitlements(const PlistDict& file) {
    const PlistDict* children = legacyTable(file, kLegacyChildrenKey);
    const PlistDict* registeredByCaller = legacyTable(file, kLegacyRegisteredByCallerKey);
    const PlistDict* placeholders = legacyTable(file, kLegacyPlaceholderKey);
    std::vector<LegacyEntitlementsEntry> entries;
    for (const auto& [identifier, entitlements] : file) {
        if (identifier == kLegacyChildrenKey || identifier == kLegacyRegisteredByCallerKey ||
            identifier == kLegacyPlaceholderKey)
            continue;
        LegacyEntitlementsEntry& out = entries.emplace_back();
        out.identifier = identifier;
        // Anything but a dictionary would be stored as entitlements that every
        // reader then takes for none.
        if (identifier.empty() || !entitlements.isDict()) {
            out.why = identifier.empty() ? "empty identifier" : "entitlements are not a dictionary";
            continue;
        }
        auto entry = std::make_shared<TarnCodeSigningEntry>(
            PlistDict{{kEntitlementsKey, entitlements}}, uint64_t{0});
        if (const PlistValue* list = tableValue(children, identifier)) {
            if (const PlistArray* array = list->asArray()) {
                std::vector<std::string> ids;
                for (const PlistValue& child : *array) {
                    if (const std::string* s = child.asString(); s && !s->empty())
                        ids.push_back(*s);
                }
                entry->setChildBundleIdentifiers(std::move(ids));
            }
        }
        if (tableValue(placeholders, identifier)) entry->setPlaceholder(true);
        const PlistValue* byCaller = tableValue(registeredByCaller, identifier);
        if (byCaller && byCaller->asBool().value_or(false))
            entry->setRegisteredByCaller(true);
        else
            // The installer never vouched for these: kept, but not trusted.
            entry->setInvalid(true);
        out.entry = std::move(entry);
    }
    return entries;
}

TarnCodeSigningEntryRef TarnCodeSigningMapping::_entryFromCachedCodeSigningInfo(
    PlistDict cachedInfo, uint64_t dataContainerClass) {
    if (auto it = cachedInfo.find(kCachedInfoEntitlementsKey); it != cachedInfo.end()) {
        PlistValue entitlements = it->second;
        cachedInfo.insert_or_assign(kEntitlementsKey, std::move(entitlements));
    }
    return std::make_shared<const TarnCodeSigningEntry>(std::move(cachedInfo), dataContainerClass);
}

// ---- the boot pass ----

void TarnCodeSigningMapping::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    TarnCommandQueue* commandQueue) {
    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    const bool multiUser = multiUserMode();
    if (!multiUser) migrateAppGroupIdsFromDataContainersToFile();
    runOnQueue([&] { _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile(); });
    migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    if (!multiUser)
        TarnGroupManager::defaultManager().reconcileGroupContainersOfType(TarnGroupTypeApplication,
                                                                          commandQueue);
}

// ---- legacy entitlements file ----

void TarnCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
    static constexpr const char* kTag =
        "_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile";
    assertOnQueue();
    const FileURL url = PathJoin(TarnGlobalConfiguration::sharedInstance().libraryDirectory(),
                                 kLegacyEntitlementsFileName);
    TarnResult<PlistDict> file = _readCodeSigningMappingFromDiskAtURL(url);
    if (!file.ok() && file.error() && file.error()->posixCode() == ENOENT) return;
    TarnLog(kLogNotice, kTag, "Performing legacy entitlement migration");
    if (!file.ok()) {
        TarnLog(kLogError, kTag, "Entitlement File exists at %@, but we unexpectedly cant read it",
                url);
        return;
    }
    for (const LegacyEntitlementsEntry& legacy : _entriesFromLegacyEntitlements(*file)) {
        TarnLog(kLogNotice, kTag, "Migrating legacy entitlements for %@", legacy.identifier);
        if (!legacy.entry) {
            TarnLog(kLogError, kTag, "Skipping legacy entitlements for %@: %@", legacy.identifier,
                    legacy.why);
            continue;
        }
        // A read failure other than "none stored" is logged by the read.
        TarnResult<TarnCodeSigningEntryRef> stored =
            _onQueue_codeSigningEntryForIdentifier(legacy.identifier);
        if (!stored.ok() &&
            !(stored.error() && stored.error()->code() == TarnErrorDatabaseNotFound))
            continue;
        if (stored.ok() && !(*stored)->invalid()) {
            TarnLog(kLogNotice, kTag,
                    "Already have code signing info for %@.  No need to migrate legacy "
                    "entitlements.",
                    legacy.identifier);
            continue;
        }
        _onQueue_storeWillChange();
        if (TarnStatus added =
                codeSigningMappingDB_->addCodeSigningEntry(legacy.entry, legacy.identifier);
            !added.ok()) {
            TarnLog(kLogError, kTag, "Failed to write migrated legacy info to DB for %@ : %@",
                    legacy.identifier, added.error());
        }
    }
    std::error_code ec;
    if (!std::filesystem::remove(url, ec) && ec) {
        TarnLog(kLogError, kTag, "Failed to remove legacy file at %@: %@", url,
                TARN_POSIX_ERROR(ec.value(), "%@: %s", url, ec.message()));
    }
    TarnLog(kLogNotice, kTag, "Legacy entitlement migration completed");
}

// ---- info cached in bundle containers ----

void TarnCodeSigningMapping::migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
    static constexpr const char* kTag = "migrateCachedCodeSigningInfoFromBundleContainersToMapping";
    std::unique_ptr<TarnMigrationStatus> status = TarnMigrationStatus::initForSystemMigration();
    if (!status || status->hasMigrationOccurredForType(kTarnMigrationTypeCodeSigning)) return;
    TarnLog(kLogNotice, kTag, "Performing code signing migration");
    for (TarnContainerClass bundleClass :
         {TarnContainerClassAppBundle, TarnContainerClassPluginBundle,
          TarnContainerClassVPNPluginBundle, TarnContainerClassFrameworkBundle}) {
        const std::vector<TarnMetadataRef> holding =
            containersHolding(TarnUserIdentityCache::defaultUserIdentity(), bundleClass,
                              kTarnInfoCachedCodeSigningInfoKey, kTag,
                              "Failed to fetch list of containers for class %llu : %@");
        std::vector<TarnMetadataRef> toClear;
        runOnQueue([&] {
            toClear =
                _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
                    holding, bundleClass);
        });
        clearInfoValues(toClear, kTarnInfoCachedCodeSigningInfoKey,
                        [](const TarnMetadataRef& container, uint64_t code) {
                            TarnLog(kLogError, kTag,
                                    "Error setting info value for identity %@ : %llu",
                                    container->containerIdentity(), code);
                        });
    }
    (void)status->setMigrationCompleteForType(kTarnMigrationTypeCodeSigning);  // logged there
}

std::vector<TarnMetadataRef> TarnCodeSigningMapping::
    _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
        const std::vector<TarnMetadataRef>& containers, TarnContainerClass containerClass) {
    static constexpr const char* kTag =
        "_onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers";
    assertOnQueue();
    // The data container that goes with each bundle class.
    const uint64_t dataContainerClass =
        containerClass == TarnContainerClassAppBundle         ? TarnContainerClassAppData
        : containerClass == TarnContainerClassPluginBundle    ? TarnContainerClassPluginData
        : containerClass == TarnContainerClassVPNPluginBundle ? TarnContainerClassVPNPluginData
                                                              : TarnContainerClassUndefined;
    std::vector<TarnMetadataRef> toClear;
    for (const TarnMetadataRef& container : containers) {
        const PlistValue* cached = container->info()
                                       ? container->info()->find(kTarnInfoCachedCodeSigningInfoKey)
                                       : nullptr;
        if (!cached) continue;
        const std::string& identifier = container->identifier();
        TarnResult<TarnCodeSigningEntryRef> stored =
            _onQueue_codeSigningEntryForIdentifier(identifier);
        if (stored.ok() && !(*stored)->invalid()) {
            TarnLog(
                kLogNotice, kTag,
                "Deleting cached code signing info for %@ because we already have it in mapping",
                identifier);
        } else if (!cached->isDict()) {
            // Nothing importable; still cleared, so the pass is not repeated.
            TarnLog(kLogError, kTag, "Cached code signing info for %@ is not a dictionary",
                    identifier);
        } else {
            TarnLog(kLogNotice, kTag, "Migrating code signing info for %@", identifier);
            _onQueue_storeWillChange();
            if (TarnStatus added = codeSigningMappingDB_->addCodeSigningEntry(
                    _entryFromCachedCodeSigningInfo(*cached->asDict(), dataContainerClass),
                    identifier);
                !added.ok()) {
                TarnLog(kLogError, kTag,
                        "Failed to write migrated cached cs info from bundle container to DB for "
                        "%@ : %@",
                        identifier, added.error());
            }
        }
        toClear.push_back(container);
    }
    return toClear;
}

// ---- app-group identifiers in data containers ----

void TarnCodeSigningMapping::migrateAppGroupIdsFromDataContainersToFile() {
    static constexpr const char* kTag = "migrateAppGroupIdsFromDataContainersToFile";
    std::unique_ptr<TarnMigrationStatus> status = TarnMigrationStatus::initForSystemMigration();
    if (!status || status->hasMigrationOccurredForType(kTarnMigrationTypeGroupId)) return;
    TarnLog(kLogNotice, kTag, "Performing group ID migration");
    for (TarnContainerClass dataClass : {TarnContainerClassAppData, TarnContainerClassPluginData,
                                         TarnContainerClassVPNPluginData}) {
        const std::vector<TarnMetadataRef> holding =
            containersHolding(TarnUserIdentityCache::userIdentityForLegacyMobileUser(), dataClass,
                              kTarnInfoGroupContainerIDsKey, kTag,
                              "Failed to fetch list of containers for userId: 501, class %ld : %@");
        std::vector<TarnMetadataRef> toClear;
        runOnQueue([&] {
            toClear = _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(holding);
        });
        clearInfoValues(toClear, kTarnInfoGroupContainerIDsKey,
                        [](const TarnMetadataRef& container, uint64_t code) {
                            TarnLog(kLogError, kTag,
                                    "Failed to clear group id metadata for %@ : %llu",
                                    container->identifier(), code);
                        });
    }
    (void)status->setMigrationCompleteForType(kTarnMigrationTypeGroupId);  // logged there
}

std::vector<TarnMetadataRef>
TarnCodeSigningMapping::_onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
    const std::vector<TarnMetadataRef>& containers) {
    static constexpr const char* kTag =
        "_onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers";
    assertOnQueue();
    std::vector<TarnMetadataRef> toClear;
    for (const TarnMetadataRef& container : containers) {
        const PlistValue* groupIds =
            container->info() ? container->info()->find(kTarnInfoGroupContainerIDsKey) : nullptr;
        if (!groupIds) continue;
        const std::string& identifier = container->identifier();
        TarnLog(kLogDebug, kTag,
                "Data container for userId: %u, identifier %@ references container IDs: %@",
                kLegacyMobileUserId, identifier, *groupIds);
        TarnResult<TarnCodeSigningEntryRef> stored =
            _onQueue_codeSigningEntryForIdentifier(identifier);
        if (stored.ok()) {
            TarnLog(
                kLogNotice, kTag,
                "Deleting app group entitlements for %@ because we already have them in mapping",
                identifier);
        } else {
            TarnLog(kLogNotice, kTag, "Migrating app group entitlements for %@", identifier);
            PlistDict entitlements{{kTarnApplicationGroupsEntitlement, *groupIds}};
            auto entry = std::make_shared<const TarnCodeSigningEntry>(
                PlistDict{{kEntitlementsKey, std::move(entitlements)}},
                container->containerClass());
            _onQueue_storeWillChange();
            if (TarnStatus added = codeSigningMappingDB_->addCodeSigningEntry(entry, identifier);
                !added.ok()) {
                TarnLog(kLogError, kTag, "Failed to write migrated group id info to DB for %@ : %@",
                        identifier, added.error());
            }
        }
        toClear.push_back(container);
    }
    return toClear;
}

}  // namespace tarn
