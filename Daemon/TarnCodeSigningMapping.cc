#include "Daemon/TarnCodeSigningMapping.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <system_error>
#include <vector>

#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kQueueLabel = "com.ostrea.TarnKeeper.EntitlementQueue";
constexpr const char* kLegacyMappingFileName = "tarn_code_signing_info.plist";

FileURL libraryDirectoryURL() { return TarnGlobalConfiguration::sharedInstance().libraryDirectory(); }

std::mutex gSharedMutex;
// Never destroyed: the container cache holds the mapping by pointer, and its
// queued work (persona-list changes) may still run while the process exits.
std::unique_ptr<TarnCodeSigningMapping>& gSharedMapping =
    *new std::unique_ptr<TarnCodeSigningMapping>();

const std::optional<PlistDict> kNoInfo;

// The store's answer for an identifier it has no record of.
bool isNotFound(const TarnErrorRef& e) { return e && e->code() == TarnErrorDatabaseNotFound; }

// Distinct identifiers the registration memo keeps before it starts over: a
// device has far fewer clients, so this only bounds a misbehaving one.
constexpr size_t kRegistrationMemoCapacity = 4096;

// A group list as log lines print it; "(null)" when absent.
std::optional<PlistValue> describedIds(const std::optional<std::vector<std::string>>& ids) {
    if (!ids) return std::nullopt;
    return PlistValue(PlistArray(ids->begin(), ids->end()));
}

const PlistValue* optionValue(const PlistDict& options, const char* key) {
    auto it = options.find(key);
    return it == options.end() ? nullptr : &it->second;
}

bool optionIsTrue(const PlistDict& options, const char* key) {
    const PlistValue* value = optionValue(options, key);
    return value && value->truthy();
}

}  // namespace

// ---- counted set ----

void TarnCountedSet::removeObject(std::string_view object) {
    auto it = counts_.find(object);
    if (it == counts_.end()) return;
    if (--it->second == 0) counts_.erase(it);
}

size_t TarnCountedSet::countForObject(std::string_view object) const {
    auto it = counts_.find(object);
    return it == counts_.end() ? 0 : it->second;
}

// ---- life cycle ----

TarnCodeSigningMapping* TarnCodeSigningMapping::sharedInstance() {
    std::lock_guard<std::mutex> lock(gSharedMutex);
    if (gSharedMapping) return gSharedMapping.get();
    std::unique_ptr<TarnSQLiteDB> db = TarnSQLiteDB::initWithParentDirectoryURL(libraryDirectoryURL());
    if (!db) {
        TarnLog(kLogError, "sharedInstance", "Failed to initialize database.");
        return nullptr;
    }
    gSharedMapping = std::make_unique<TarnCodeSigningMapping>(&TarnUserIdentitySharedCache::sharedInstance(),
                                                              DispatchQueue::createSerial(kQueueLabel), std::move(db));
    return gSharedMapping.get();
}

void TarnCodeSigningMapping::TEST_setSharedInstance(std::unique_ptr<TarnCodeSigningMapping> mapping) {
    // Kept alive for the same reason as the shared one.
    static auto& retired = *new std::vector<std::unique_ptr<TarnCodeSigningMapping>>();
    std::lock_guard<std::mutex> lock(gSharedMutex);
    if (gSharedMapping) retired.push_back(std::move(gSharedMapping));
    gSharedMapping = std::move(mapping);
}

TarnCodeSigningMapping::TarnCodeSigningMapping(TarnUserIdentitySharedCache* userIdentityCache,
                                               DispatchQueueRef queue, std::unique_ptr<TarnSQLiteDB> mappingDB)
    : userIdentityCache_(userIdentityCache), queue_(std::move(queue)), codeSigningMappingDB_(std::move(mappingDB)) {
    runOnQueue([&] { _onQueue_migrateFromMappingFileToDBIfNecessary(); });
}

TarnCodeSigningMapping::~TarnCodeSigningMapping() = default;

// A programming error, caught in every build: a call on the wrong side of the
// queue either races on the store or never returns.
[[noreturn]] static void queueMisuse(const char* what) {
    PlatformLog("database", PlatformLogType::Fault, "TarnCodeSigningMapping: %s", what);
    std::fprintf(stderr, "TarnCodeSigningMapping: %s\n", what);  // also past a quiet log
    std::abort();
}

void TarnCodeSigningMapping::runOnQueue(const std::function<void()>& work) {
    // Entering our own serial queue from itself would never return.
    if (queue_->isCurrent()) queueMisuse("public operation called on the mapping's own queue");
    queue_->sync(work);
}

void TarnCodeSigningMapping::assertOnQueue() const {
    if (!queue_->isCurrent()) queueMisuse("_onQueue_ operation called off the mapping's queue");
}

// ---- entitlement helpers ----

std::optional<std::vector<std::string>> TarnCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(
    const std::string& identifier, const PlistDict* entitlements, const char* groupKey) {
    if (!entitlements) return std::nullopt;
    auto it = entitlements->find(groupKey);
    if (it == entitlements->end()) return std::nullopt;
    const PlistValue& value = it->second;
    if (const PlistArray* array = value.asArray()) {
        std::vector<std::string> ids;
        ids.reserve(array->size());
        for (const PlistValue& element : *array) {
            const std::string* s = element.asString();
            if (!s) {
                TarnLog(kLogError, "_copyApplicationGroupEntitlementForIdentifier",
                        "Entitlement %@ for %@ contains non-string values; ignoring.", groupKey, identifier);
                return std::nullopt;
            }
            ids.push_back(*s);
        }
        return ids;
    }
    if (const std::string* s = value.asString()) return std::vector<std::string>{*s};
    TarnLog(kLogError, "_copyApplicationGroupEntitlementForIdentifier",
            "Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey, identifier);
    return std::nullopt;
}

std::optional<std::vector<std::string>> TarnCodeSigningMapping::_appGroupIdentifiersForIdentifier(
    const std::string& identifier, const PlistDict* entitlements) {
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, kTarnApplicationGroupsEntitlement);
}

std::optional<std::vector<std::string>> TarnCodeSigningMapping::_systemGroupIdentifiersForIdentifier(
    const std::string& identifier, const PlistDict* entitlements) {
    auto ids = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, kTarnSystemGroupsEntitlement);
    if (!ids || ids->empty()) {
        ids = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                            kTarnSystemGroupContainersEntitlement);
    }
    if (!ids) return std::nullopt;
    std::vector<std::string> kept;
    kept.reserve(ids->size());
    for (std::string& id : *ids) {
        if (id.starts_with(kTarnSystemGroupPrefix)) {
            kept.push_back(std::move(id));
        } else {
            TarnLog(kLogError, "_systemGroupIdentifiersForIdentifier",
                    "System group ID %@ does not have proper prefix, ignoring.", id);
        }
    }
    return kept;
}

bool TarnCodeSigningMapping::_entitlementsHasSystemContainer(const PlistDict* entitlements) {
    if (!entitlements) return false;
    auto it = entitlements->find(kTarnSystemContainerEntitlement);
    return it != entitlements->end() && it->second.truthy();
}

const PlistDict* TarnCodeSigningMapping::_entitlementsFromCodeSigningEntry(const TarnCodeSigningEntryRef& entry) {
    return entry ? entry->entitlements() : nullptr;
}

const std::optional<PlistDict>& TarnCodeSigningMapping::_codeSigningInfoForCodeSigningEntry(
    const TarnCodeSigningEntryRef& entry, bool externalRequest) {
    if (!entry) return kNoInfo;
    // Clients must not act on information the installer has not committed to
    // or that belongs to a bundle that is gone.
    if (externalRequest && (entry->placeholder() || entry->advanceCopy() || entry->invalid())) return kNoInfo;
    return entry->codeSigningInfo();
}

// ---- on the queue ----

TarnResult<TarnCodeSigningEntryRef> TarnCodeSigningMapping::_onQueue_codeSigningEntryForIdentifier(
    const std::string& identifier) {
    assertOnQueue();
    TarnResult<TarnCodeSigningEntryRef> entry = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier);
    if (!entry.ok() && !isNotFound(entry.error())) {
        TarnLog(kLogError, "_onQueue_codeSigningEntryForIdentifier",
                "Error retrieving entry from DB with identifier %@ : %@", identifier, entry.error());
    }
    return entry;
}

std::optional<PlistDict> TarnCodeSigningMapping::_onQueue_codeSigningInfoForIdentifier(const std::string& identifier,
                                                                                      bool externalRequest) {
    assertOnQueue();
    TarnResult<TarnCodeSigningEntryRef> entry = _onQueue_codeSigningEntryForIdentifier(identifier);
    if (!entry.ok()) return std::nullopt;
    return _codeSigningInfoForCodeSigningEntry(*entry, externalRequest);
}

std::optional<PlistDict> TarnCodeSigningMapping::_onQueue_entitlementsForIdentifier(const std::string& identifier) {
    assertOnQueue();
    TarnResult<TarnCodeSigningEntryRef> entry = _onQueue_codeSigningEntryForIdentifier(identifier);
    if (!entry.ok()) return std::nullopt;
    if (const PlistDict* entitlements = _entitlementsFromCodeSigningEntry(*entry)) return *entitlements;
    return std::nullopt;
}

uint64_t TarnCodeSigningMapping::_onQueue_dataContainerTypeForIdentifier(const std::string& identifier) {
    assertOnQueue();
    TarnResult<TarnCodeSigningEntryRef> entry = _onQueue_codeSigningEntryForIdentifier(identifier);
    return entry.ok() ? (*entry)->dataContainerClass() : 0;
}

bool TarnCodeSigningMapping::_onQueue_identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
    assertOnQueue();
    TarnResult<TarnCodeSigningEntryRef> entry = _onQueue_codeSigningEntryForIdentifier(identifier);
    return entry.ok() && (*entry)->registeredByCaller();
}

std::string TarnCodeSigningMapping::_onQueue_parentIdentifierForChildIdentifier(const std::string& identifier) {
    assertOnQueue();
    TarnResult<std::string> parent = codeSigningMappingDB_->parentIdentifierForChildIdentifier(identifier);
    if (parent.ok()) return std::move(*parent);
    if (!isNotFound(parent.error())) {
        TarnLog(kLogError, "_onQueue_parentIdentifierForChildIdentifier",
                "Error retrieving entry from DB with identifier %@ : %@", identifier, parent.error());
    }
    return std::string();
}

std::vector<std::string> TarnCodeSigningMapping::_onQueue_childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
    assertOnQueue();
    TarnResult<std::vector<std::string>> children =
        codeSigningMappingDB_->childIdentifiersForParentIdentifier(identifier);
    if (children.ok()) return std::move(*children);
    if (!isNotFound(children.error())) {
        TarnLog(kLogError, "_onQueue_childBundleIdentifiersForParentIdentifier",
                "Error retrieving entry from DB with identifier %@ : %@", identifier, children.error());
    }
    return {};
}

TarnResult<std::set<std::string>> TarnCodeSigningMapping::_onQueue_identifiersWithError() {
    assertOnQueue();
    return codeSigningMappingDB_->identifiersWithError();
}

TarnStatus TarnCodeSigningMapping::_onQueue_invalidateCodeSigningInfoForIdentifier(
    const std::string& identifier) {
    assertOnQueue();
    _onQueue_storeWillChange();
    return codeSigningMappingDB_->invalidateCodeSigningWithIdentifier(identifier);
}

TarnStatus TarnCodeSigningMapping::_onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier) {
    assertOnQueue();
    _onQueue_storeWillChange();
    return codeSigningMappingDB_->invalidateCodeSigningForIdentifierAndAllChildren(identifier);
}

TarnStatus TarnCodeSigningMapping::_onQueue_removeAllAdvanceCopiesWithError() {
    assertOnQueue();
    _onQueue_storeWillChange();
    return codeSigningMappingDB_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError();
}

void TarnCodeSigningMapping::_onQueue_iterateGroupIdsWithKey(const char* key, const char* fallBackKey,
                                                             const GroupIdsBlock& forAllIdentifiersUsingBlock) {
    assertOnQueue();
    TarnStatus enumerated = codeSigningMappingDB_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const TarnCodeSigningEntryRef& entry) {
            const PlistDict* entitlements = _entitlementsFromCodeSigningEntry(entry);
            const PlistValue* value = nullptr;
            if (entitlements) {
                if (auto it = entitlements->find(key); it != entitlements->end()) value = &it->second;
                if (fallBackKey) {
                    auto primary = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, key);
                    if (!primary || primary->empty()) {
                        if (auto it = entitlements->find(fallBackKey); it != entitlements->end()) value = &it->second;
                    }
                }
            }
            forAllIdentifiersUsingBlock(identifier, value);
        });
    if (!enumerated.ok()) {
        TarnLog(kLogError, "_onQueue_iterateGroupIdsWithKey", "Failed to enumerate code signing info: %@",
                enumerated.error());
    }
}

TarnCountedSet TarnCodeSigningMapping::_onQueue_copyReferenceCountSetOfType(TarnGroupType type) {
    assertOnQueue();
    TarnCountedSet counts;
    const char* key = type == TarnGroupTypeSystem ? kTarnSystemGroupsEntitlement : kTarnApplicationGroupsEntitlement;
    const char* fallBackKey = type == TarnGroupTypeSystem ? kTarnSystemGroupContainersEntitlement : nullptr;
    _onQueue_iterateGroupIdsWithKey(key, fallBackKey, [&](const std::string& identifier, const PlistValue* groupIds) {
        if (!groupIds) return;
        if (!groupIds->isArray() && !groupIds->isString()) {
            TarnLog(kLogError, "_onQueue_copyReferenceCountSetOfType",
                    "identifier: %@ has non-array type of group container IDs: %@", identifier, *groupIds);
            return;
        }
        // The prefix rule of system groups is not applied: a container made
        // under any name must still be counted before it can be removed.
        PlistDict holder{{key, *groupIds}};
        auto ids = _copyApplicationGroupEntitlementForIdentifier(identifier, &holder, key);
        if (!ids) return;
        TarnLog(kLogDebug, "_onQueue_copyReferenceCountSetOfType",
                "Entitlements for identifier %@ references container IDs: %@", identifier, *groupIds);
        for (const std::string& id : *ids) counts.addObject(id);
    });
    return counts;
}

TarnStatus TarnCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(
    const std::vector<TarnCodeSigningEntryRef>& values, const std::vector<std::string>& forIdentifiers) {
    assertOnQueue();
    if (values.size() != forIdentifiers.size()) {
        return TARN_ERROR(TarnErrorMismatchedInput, nullptr,
                          "Can't act on an invalid input: values count: %ld, IDs count: %ld", values.size(),
                          forIdentifiers.size());
    }
    for (size_t i = 0; i < values.size(); ++i) {
        const std::string& identifier = forIdentifiers[i];
        const TarnCodeSigningEntryRef& entry = values[i];
        TarnResult<TarnCodeSigningEntryRef> read =
            codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier);
        if (!read.ok() && !isNotFound(read.error())) {
            TarnLog(kLogError, "_onQueue_setCodeSigningDictionaryValues",
                    "Error retrieving entry from DB with identifier %@ : %@", identifier, read.error());
            break;
        }
        const TarnCodeSigningEntryRef stored = read.ok() ? std::move(*read) : nullptr;
        if (!entry || !entry->codeSigningInfo()) {
            if (!stored) continue;
            _onQueue_storeWillChange();
            TarnStatus deleted = codeSigningMappingDB_->deleteCodeSigningEntryWithIdentifier(identifier);
            if (!deleted.ok()) {
                TarnLog(kLogError, "_onQueue_setCodeSigningDictionaryValues",
                        "Failed to delete code signing info from DB for %@ : %@", identifier, deleted.error());
            } else {
                PlatformLog("codesignmapping", PlatformLogType::Debug, "Deleted Code Signing Mapping for ID: %@",
                            identifier);
            }
            continue;
        }
        if (TarnCodeSigningEntriesEqual(stored, entry)) continue;
        _onQueue_storeWillChange();
        TarnStatus written = codeSigningMappingDB_->addCodeSigningEntry(entry, identifier);
        if (!written.ok()) {
            TarnLog(kLogError, "_onQueue_setCodeSigningDictionaryValues",
                    "Failed to write code signing info to DB for %@ : %@", identifier, written.error());
        } else {
            PlatformLog("codesignmapping", PlatformLogType::Default, "Set Code Signing Mapping for ID: %@ : %@",
                        identifier, entry);
        }
    }
    return {};
}

// ---- legacy mapping file ----

TarnResult<PlistDict> TarnCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(const FileURL& url) {
    std::error_code ec;
    const uintmax_t size = std::filesystem::file_size(url, ec);
    if (ec) return TARN_POSIX_ERROR(ec.value(), "%@: %s", url, ec.message());
    if (size > kMaxPlistBytes) return TARN_POSIX_ERROR(EFBIG, "%@ is too large to read (%llu bytes)", url, size);
    std::ifstream in(url, std::ios::binary);
    std::vector<char> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (!in.good() && !in.eof()) return TARN_POSIX_ERROR(EIO, "%@: read failed", url);
    std::string why;
    std::optional<PlistValue> parsed = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
    if (!parsed || !parsed->isDict()) {
        return TARN_ERROR_SILENT(TarnErrorReadFailed, nullptr, "%@ is not a dictionary: %@", url,
                                 parsed ? std::string("wrong root type") : why);
    }
    return std::move(*parsed->asDict());
}

void TarnCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
    assertOnQueue();
    const FileURL url = PathJoin(libraryDirectoryURL(), kLegacyMappingFileName);
    TarnResult<PlistDict> mapping = _readCodeSigningMappingFromDiskAtURL(url);
    if (!mapping.ok()) {
        if (!(mapping.error() && mapping.error()->posixCode() == ENOENT)) {
            TarnLog(kLogError, "_onQueue_migrateFromMappingFileToDBIfNecessary",
                    "Failed to read code signing mapping file at %@ : %@", url, mapping.error());
        }
        return;
    }
    TarnLog(kLogNotice, "_onQueue_migrateFromMappingFileToDBIfNecessary", "Migrating code signing info from file to DB");
    int migrated = 0;
    int failed = 0;
    for (const auto& [identifier, serialized] : *mapping) {
        // An entry that cannot be decoded goes to the store as nothing, which
        // refuses it with its own error.
        TarnCodeSigningEntryRef entry = TarnCodeSigningEntry::initWithSerializedDictionary(serialized);
        _onQueue_storeWillChange();
        TarnStatus added = codeSigningMappingDB_->addCodeSigningEntry(entry, identifier);
        if (added.ok()) {
            ++migrated;
        } else {
            ++failed;
            TarnLog(kLogError, "_onQueue_migrateFromMappingFileToDBIfNecessary",
                    "Failed to migrate code signing entry for %@ : %@", identifier, added.error());
        }
    }
    TarnLog(kLogNotice, "_onQueue_migrateFromMappingFileToDBIfNecessary",
            "Successfully migrated %d entries, failed to migrate %d", migrated, failed);
    // Keep a file none of whose entries made it, so the next start tries again.
    if (migrated > 0) {
        std::error_code ec;
        if (!std::filesystem::remove(url, ec) && ec) {
            TarnLog(kLogError, "_onQueue_migrateFromMappingFileToDBIfNecessary",
                    "Failed to remove legacy code signing mapping file: %@",
                    TARN_POSIX_ERROR(ec.value(), "%@: %s", url, ec.message()));
        }
    }
}

// ---- public operations ----

std::optional<PlistDict> TarnCodeSigningMapping::entitlementsForIdentifier(const std::string& identifier) {
    if (identifier.empty()) return std::nullopt;
    std::optional<PlistDict> entitlements;
    runOnQueue([&] { entitlements = _onQueue_entitlementsForIdentifier(identifier); });
    if (entitlements) return entitlements;
    return importCachedCodeSigningInfo(identifier);
}

std::optional<PlistDict> TarnCodeSigningMapping::importCachedCodeSigningInfo(
    const std::string& identifier) {
    // Bundle containers are global: they belong to the default user identity.
    TarnResult<TarnContainerIdentityRef> bundle =
        TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), identifier, TarnContainerClass{1});
    if (!bundle.ok()) return std::nullopt;
    TarnResult<TarnMetadataRef> container =
        TarnContainerCache::sharedInstance().containerForContainerIdentity(
            *bundle, /*transient=*/false, /*updateSandbox=*/false);
    if (!container.ok()) return std::nullopt;
    const std::optional<PlistValue>& metadataInfo = (*container)->info();
    const PlistValue* cached =
        metadataInfo ? metadataInfo->find(kTarnInfoCachedCodeSigningInfoKey) : nullptr;
    if (!cached || !cached->isDict()) return std::nullopt;

    TarnLog(kLogNotice, "entitlementsForIdentifier",
            "Migrating code signing info from bundle container upon request for %@", identifier);
    TarnCodeSigningEntryRef entry = _entryFromCachedCodeSigningInfo(*cached->asDict(), 2);
    TarnStatus stored;
    runOnQueue([&] {
        _onQueue_storeWillChange();
        stored = codeSigningMappingDB_->addCodeSigningEntry(entry, identifier);
    });
    if (!stored.ok()) {
        TarnLog(kLogError, "entitlementsForIdentifier",
                "Failed to write code signing info to DB for %@ : %@", identifier, stored.error());
    }
    if (const PlistDict* entitlements = entry->entitlements()) return *entitlements;
    return std::nullopt;
}

std::optional<PlistDict> TarnCodeSigningMapping::getCodeSigningInfoForIdentifier(const std::string& identifier) {
    if (identifier.empty()) return std::nullopt;
    // First through the internal read, which is where information still kept
    // in a bundle container gets imported.
    (void)entitlementsForIdentifier(identifier);
    std::optional<PlistDict> info;
    runOnQueue([&] { info = _onQueue_codeSigningInfoForIdentifier(identifier, /*externalRequest=*/true); });
    return info;
}

TarnResult<TarnCodeSigningEntryRef> TarnCodeSigningMapping::codeSigningEntryForIdentifier(
    const std::string& identifier) {
    TarnResult<TarnCodeSigningEntryRef> entry = TarnCodeSigningEntryRef();
    runOnQueue([&] { entry = _onQueue_codeSigningEntryForIdentifier(identifier); });
    return entry;
}

std::optional<std::vector<std::string>> TarnCodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    std::optional<PlistDict> entitlements = entitlementsForIdentifier(identifier);
    return _appGroupIdentifiersForIdentifier(identifier, entitlements ? &*entitlements : nullptr);
}

std::optional<std::vector<std::string>> TarnCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    std::optional<PlistDict> entitlements = entitlementsForIdentifier(identifier);
    return _systemGroupIdentifiersForIdentifier(identifier, entitlements ? &*entitlements : nullptr);
}

bool TarnCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
    std::optional<PlistDict> entitlements = entitlementsForIdentifier(identifier);
    return _entitlementsHasSystemContainer(entitlements ? &*entitlements : nullptr);
}

bool TarnCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
    bool registered = false;
    runOnQueue([&] { registered = _onQueue_identifierHasCallerRegisteredEntitlements(identifier); });
    return registered;
}

uint64_t TarnCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
    uint64_t type = 0;
    runOnQueue([&] { type = _onQueue_dataContainerTypeForIdentifier(identifier); });
    return type;
}

std::string TarnCodeSigningMapping::parentIdentifierForChildIdentifier(const std::string& identifier) {
    std::string parent;
    runOnQueue([&] { parent = _onQueue_parentIdentifierForChildIdentifier(identifier); });
    return parent;
}

std::vector<std::string> TarnCodeSigningMapping::childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
    std::vector<std::string> children;
    runOnQueue([&] { children = _onQueue_childBundleIdentifiersForParentIdentifier(identifier); });
    return children;
}

TarnResult<std::set<std::string>> TarnCodeSigningMapping::identifiersWithError() {
    TarnResult<std::set<std::string>> identifiers = std::set<std::string>();
    runOnQueue([&] { identifiers = _onQueue_identifiersWithError(); });
    return identifiers;
}

TarnCountedSet TarnCodeSigningMapping::copyReferenceCountSetOfType(TarnGroupType type) {
    TarnCountedSet counts;
    runOnQueue([&] { counts = _onQueue_copyReferenceCountSetOfType(type); });
    return counts;
}

TarnStatus TarnCodeSigningMapping::invalidateCodeSigningInfoForIdentifier(const std::string& identifier) {
    TarnStatus status;
    runOnQueue([&] { status = _onQueue_invalidateCodeSigningInfoForIdentifier(identifier); });
    return status;
}

void TarnCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, TarnCommandQueue* commandQueue) {
    // Children first: each is processed as a removal of its own, so that the
    // groups and system container it alone claimed go with it.
    std::vector<std::string> identifiers = childBundleIdentifiersForParentIdentifier(identifier);
    identifiers.push_back(identifier);
    for (const std::string& each : identifiers) {
        TarnStatus cleared = processCodeSigningInfo(std::nullopt, each, PlistDict{}, commandQueue);
        if (!cleared.ok()) {
            TarnLog(kLogError, "removeCodeSigningDictionariesForIdentifierAndItsChildren",
                    "Failed to clear entitlements for %@ : %llu", each,
                    cleared.code(TarnErrorDatabase));
        }
    }
}

TarnStatus TarnCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier) {
    TarnStatus status;
    runOnQueue([&] { status = _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier); });
    return status;
}

TarnStatus TarnCodeSigningMapping::removeAllAdvanceCopiesWithError() {
    TarnStatus status;
    runOnQueue([&] { status = _onQueue_removeAllAdvanceCopiesWithError(); });
    return status;
}

TarnStatus TarnCodeSigningMapping::processCallerRegisteredEntitlements(const PlistDict& entitlements,
                                                                       const std::string& forIdentifier,
                                                                       TarnCommandQueue* commandQueue) {
    if (forIdentifier.empty()) return TARN_ERROR_CODE(TarnErrorMissingIdentifier, nullptr);
    // Every admitted request comes here: the common case must not touch the
    // store or wait for the queue.
    if (registrationIsCurrent(forIdentifier, entitlements)) return {};

    TarnResult<TarnCodeSigningEntryRef> read = TarnCodeSigningEntryRef();
    uint64_t generation = 0;
    runOnQueue([&] {
        read = _onQueue_codeSigningEntryForIdentifier(forIdentifier);
        // Taken with the read, on the queue: a change after the read bumps it.
        generation = storeGeneration();
    });
    if (!read.ok() && !isNotFound(read.error())) return read.error();
    const TarnCodeSigningEntryRef stored = read.ok() ? std::move(*read) : nullptr;

    if (stored && stored->codeSigningInfo() && !stored->registeredByCaller()) {
        // The installer's info is never replaced by what a caller says of itself.
        rememberRegistration(forIdentifier, entitlements, generation);
        return {};
    }
    if (stored && stored->registeredByCaller()) {
        const PlistDict* registered = stored->entitlements();
        if (registered && *registered == entitlements) {
            rememberRegistration(forIdentifier, entitlements, generation);
            return {};
        }
        TarnLog(kLogNotice, "processCallerRegisteredEntitlements",
                "%@ has changed entitlements. Re-registering.", forIdentifier);
    }
    // Not remembered here: the next request finds the registration in the
    // store and remembers it then, so that a failed write is retried.
    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    return processCodeSigningInfo(PlistDict{{kEntitlementsKey, entitlements}}, forIdentifier,
                                  PlistDict{{kOptionRegisteredByCaller, true}}, commandQueue);
}

// ---- registration memo ----

bool TarnCodeSigningMapping::registrationIsCurrent(const std::string& identifier,
                                                   const PlistDict& entitlements) {
    std::shared_ptr<const PlistDict> remembered;
    {
        MutexLock lock(memoMutex_);
        auto it = registrationMemo_.find(identifier);
        if (it == registrationMemo_.end() || it->second.generation != storeGeneration_)
            return false;
        remembered = it->second.entitlements;
    }
    // Compared outside the lock: concurrent requests of other clients need not
    // wait for it. A change made meanwhile is ordered after this request.
    return *remembered == entitlements;
}

void TarnCodeSigningMapping::rememberRegistration(const std::string& identifier,
                                                  const PlistDict& entitlements,
                                                  uint64_t generation) {
    auto copy = std::make_shared<const PlistDict>(entitlements);
    MutexLock lock(memoMutex_);
    // Learnt before a change that has happened since: it may no longer hold.
    if (generation != storeGeneration_) return;
    if (registrationMemo_.size() >= kRegistrationMemoCapacity &&
        !registrationMemo_.contains(identifier)) {
        registrationMemo_.clear();
    }
    registrationMemo_.insert_or_assign(identifier, RegistrationMemo{std::move(copy), generation});
}

uint64_t TarnCodeSigningMapping::storeGeneration() {
    MutexLock lock(memoMutex_);
    return storeGeneration_;
}

void TarnCodeSigningMapping::_onQueue_storeWillChange() {
    assertOnQueue();
    MutexLock lock(memoMutex_);
    ++storeGeneration_;
}

// ---- command 19 ----

// What this handler throws is fenced by the request processor, as for every
// other handler.
void TarnHandleGetCodeSigningInfoCommand(const TarnRequestContext& context,
                                         const PlistValue& request, PlistValue& reply,
                                         TarnClientConnection* connection, uint64_t* error) {
    std::string identifier;
    if (const PlistValue* value = request.find("Identifier")) {
        if (const std::string* s = value->asString()) identifier = *s;
    }
    std::optional<PlistDict> info;
    if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance()) {
        info = mapping->getCodeSigningInfoForIdentifier(identifier);
    }
    if (!info) {
        TarnSetError(error, TarnErrorNotFound);
        return;
    }
    reply.set("ReplyInfoDictionary", std::move(*info));
}

// ---- processing of code-signing info ----

TarnStatus TarnCodeSigningMapping::processCodeSigningInfo(
    const std::optional<PlistDict>& codeSigningInfo, const std::string& forIdentifier,
    const PlistDict& withOptions, TarnCommandQueue* commandQueue) {
    // Off the queue: a miss may import from the bundle container, and the
    // container cache must not be called on the queue.
    std::optional<PlistDict> oldEntitlements = entitlementsForIdentifier(forIdentifier);
    TarnStatus status;
    runOnQueue([&] {
        status = _onQueue_processCodeSigningInfo(codeSigningInfo, forIdentifier, withOptions,
                                                 oldEntitlements, commandQueue);
    });
    return status;
}

TarnStatus TarnCodeSigningMapping::_onQueue_processCodeSigningInfo(
    const std::optional<PlistDict>& codeSigningInfo, const std::string& forIdentifier,
    const PlistDict& withOptions, const std::optional<PlistDict>& oldEntitlements,
    TarnCommandQueue* commandQueue) {
    assertOnQueue();
    constexpr const char* kTag = "_onQueue_processCodeSigningInfo";
    return TarnFenceExceptions(kTag, [&]() -> TarnStatus {
        if (forIdentifier.empty())
            return TARN_ERROR_CODE_IN(kTag, TarnErrorMissingIdentifier, nullptr);

        TarnResult<TarnCodeSigningEntryRef> read =
            _onQueue_codeSigningEntryForIdentifier(forIdentifier);
        if (!read.ok() && !isNotFound(read.error())) return read.error();
        const TarnCodeSigningEntryRef existing = read.ok() ? std::move(*read) : nullptr;

        auto entry = std::make_shared<TarnCodeSigningEntry>();
        if (const PlistValue* dataClass = optionValue(withOptions, kOptionDataContainerClass)) {
            entry->setDataContainerClass(dataClass->asUInt64().value_or(0));
        }

        // Written in this order: the parent before the identifier.
        std::vector<TarnCodeSigningEntryRef> values;
        std::vector<std::string> identifiers;

        const PlistValue* parentOption = optionValue(withOptions, kOptionParentBundleID);
        const std::string* parentIdentifier = parentOption ? parentOption->asString() : nullptr;
        if (parentIdentifier && !parentIdentifier->empty()) {
            TarnResult<TarnCodeSigningEntryRef> parentRead =
                _onQueue_codeSigningEntryForIdentifier(*parentIdentifier);
            if (!parentRead.ok() && !isNotFound(parentRead.error())) return parentRead.error();
            // A parent without a record gets an empty one, which the batch
            // does not store: the child is recorded once the parent is.
            auto parent = parentRead.ok() ? std::make_shared<TarnCodeSigningEntry>(**parentRead)
                                          : std::make_shared<TarnCodeSigningEntry>();
            std::vector<std::string> children = parent->childBundleIdentifiers();
            if (std::find(children.begin(), children.end(), forIdentifier) == children.end()) {
                children.push_back(forIdentifier);
                TarnLog(kLogDebug, kTag,
                        "Staging Child Bundles: %@ for parent ID: %@ by appending: %@",
                        PlistValue(PlistArray(children.begin(), children.end())), *parentIdentifier,
                        forIdentifier);
                parent->setChildBundleIdentifiers(std::move(children));
                values.push_back(std::move(parent));
                identifiers.push_back(*parentIdentifier);
            }
        }

        entry->setRegisteredByCaller(optionIsTrue(withOptions, kOptionRegisteredByCaller));
        entry->setPlaceholder(optionIsTrue(withOptions, kOptionPlaceholder));
        entry->setAdvanceCopy(optionIsTrue(withOptions, kOptionAdvanceCopy));
        entry->setCodeSigningInfo(codeSigningInfo);

        if (!existing || !existing->isEqual(*entry)) {
            const PlistDict* newEntitlements = entry->entitlements();
            const PlistDict* previous = oldEntitlements ? &*oldEntitlements : nullptr;

            if (_entitlementsHasSystemContainer(previous) &&
                !_entitlementsHasSystemContainer(newEntitlements)) {
                _onQueue_stageSystemContainerForDelete(forIdentifier, commandQueue);
            }

            auto handOver = [&](const std::optional<std::vector<std::string>>& oldIds,
                                const std::optional<std::vector<std::string>>& newIds,
                                TarnGroupType type) {
                if (!oldIds && !newIds) return;
                if (TEST_groupChangeHook) TEST_groupChangeHook(oldIds, newIds, type);
                _onQueue_handleChangeFromOldGroupContainerIds(oldIds, newIds, type, commandQueue);
            };
            const auto newAppGroups =
                _appGroupIdentifiersForIdentifier(forIdentifier, newEntitlements);
            const auto oldAppGroups = _appGroupIdentifiersForIdentifier(forIdentifier, previous);
            handOver(oldAppGroups, newAppGroups, TarnGroupTypeApplication);

            // The new list is read as the entitlement stands (the older key
            // when the current one names none); the old one through the
            // system-group rules.
            auto newSystemGroups = _copyApplicationGroupEntitlementForIdentifier(
                forIdentifier, newEntitlements, kTarnSystemGroupsEntitlement);
            if (!newSystemGroups || newSystemGroups->empty()) {
                newSystemGroups = _copyApplicationGroupEntitlementForIdentifier(
                    forIdentifier, newEntitlements, kTarnSystemGroupContainersEntitlement);
            }
            const auto oldSystemGroups =
                _systemGroupIdentifiersForIdentifier(forIdentifier, previous);
            handOver(oldSystemGroups, newSystemGroups, TarnGroupTypeSystem);
            PlatformLog("codesignmapping", PlatformLogType::Default,
                        "Reconciled; old app groups: %@, new app groups: %@, "
                        "old system groups: %@, new system groups: %@",
                        describedIds(oldAppGroups), describedIds(newAppGroups),
                        describedIds(oldSystemGroups), describedIds(newSystemGroups));

            values.push_back(codeSigningInfo ? entry : std::make_shared<TarnCodeSigningEntry>());
            identifiers.push_back(forIdentifier);
        }

        if (!values.empty()) {
            // Write failures are logged by the batch and do not fail the
            // processing; the arrays are built in pairs, so counts match.
            (void)_onQueue_setCodeSigningDictionaryValues(values, identifiers);
        }
        return {};
    });
}

void TarnCodeSigningMapping::_onQueue_stageSystemContainerForDelete(
    const std::string& identifier, TarnCommandQueue* commandQueue) {
    assertOnQueue();
    TarnResult<TarnContainerIdentityRef> identity =
        TarnContainerIdentity::containerIdentityWithIdentifier(identifier, TarnContainerClass{12});
    if (!identity.ok()) {
        TarnLog(kLogError, "_onQueue_processCodeSigningInfo",
                "Failed to create system container identity for %@: %@", identifier,
                identity.error());
        return;
    }
    TarnLog(kLogError, "_onQueue_processCodeSigningInfo",
            "Deleting system container for ID: %@ because it is no longer in the entitlements",
            identifier);
    // Without a command queue (tools, tests) there is nowhere to stage it.
    if (!commandQueue) return;
    commandQueue->insertCommand(
        TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {std::move(*identity)}, /*useLocking=*/true, [identifier](uint64_t error) {
                TarnLog(kLogError, "_onQueue_processCodeSigningInfo",
                        "Failed to destroy system container with identifier %@: %llu", identifier,
                        error);
            }));
}

// ---- invalidation of apps without a bundle container ----

TarnStatus TarnCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    constexpr const char* kTag = "invalidateCodeSigningInfoForAppsWithoutBundleContainer";
    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    TarnResult<std::set<std::string>> identifiers = identifiersWithError();
    if (!identifiers.ok()) {
        TarnLog(kLogError, kTag,
                "Failed to enumerate containers when invalidating code signing info: %@",
                identifiers.error());
        return identifiers.error();
    }
    const TarnUserIdentityRef bundleOwner = TarnUserIdentityCache::defaultUserIdentity();
    TarnContainerCache& cache = TarnContainerCache::sharedInstance();
    for (const std::string& identifier : *identifiers) {
        TarnResult<TarnCodeSigningEntryRef> entry = TarnCodeSigningEntryRef();
        bool isPlugIn = false;
        bool hasParent = false;
        runOnQueue([&] {
            entry = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier);
            if (!entry.ok()) return;
            const uint64_t dataClass = (*entry)->dataContainerClass();
            isPlugIn = dataClass >= 3 && dataClass <= 6;
            hasParent =
                isPlugIn && !_onQueue_parentIdentifierForChildIdentifier(identifier).empty();
        });
        if (!entry.ok()) {
            TarnLog(kLogError, kTag,
                    "Error fetching code sign info for %@ to check for invalidation: %@",
                    identifier, entry.error());
            continue;
        }
        PlatformLog("codesignmapping", PlatformLogType::Info,
                    "Checking for invalidation: identifier = %@, codeSigningEntry = <%p>, "
                    "isRegisteredByCaller = %d, isPlugIn = %d, hasParent = %d",
                    identifier, static_cast<const void*>(entry->get()),
                    (*entry)->registeredByCaller(), isPlugIn, hasParent);
        // A caller-registered entry has no bundle of its own; a plug-in with a
        // parent goes with its parent.
        if ((*entry)->registeredByCaller() || hasParent) continue;

        bool hasBundle = false;
        for (TarnContainerClass bundleClass :
             {TarnContainerClass{1}, TarnContainerClass{3}, TarnContainerClass{5}}) {
            TarnResult<TarnContainerIdentityRef> identity =
                TarnContainerIdentity::containerIdentityWithUserIdentity(bundleOwner, identifier,
                                                                         bundleClass);
            if (!identity.ok()) continue;
            // Only a container found counts: a class directory that does not
            // exist (no VPN plug-in ever installed) fails the look-up too.
            if (cache
                    .containerForContainerIdentity(*identity, /*transient=*/false,
                                                   /*updateSandbox=*/false)
                    .ok()) {
                hasBundle = true;
                break;
            }
        }
        if (hasBundle) continue;

        PlatformLog("codesignmapping", PlatformLogType::Default,
                    "Invalidating: identifier = %@, isPlugin = %d", identifier, isPlugIn);
        TarnStatus invalidated = invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier);
        if (!invalidated.ok()) {
            // Recorded for this identifier only; the others are still checked.
            (void)TARN_ERROR_IN(kTag, TarnErrorDatabase, invalidated.error(),
                                "Failed to invalidate code signing info for %@ : %@", identifier,
                                invalidated.error());
        }
    }
    return {};
}

}  // namespace tarn
