#include "Daemon/TarnMigrationStatus.h"

#include <cerrno>
#include <ctime>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"

namespace tarn {

namespace {

constexpr const char* kSystemStatusFile = "tarn_migration_status.plist";
constexpr const char* kUserStatusFile = "tarn_user_migration_status.plist";
constexpr const char* kLastBuildInfo = "LastBuildInfo";
constexpr const char* kVersionNumberKey = "TarnMigrationVersionNumber";
constexpr const char* kTimeKey = "TarnMigrationTime";
constexpr const char* kBuildVersionKey = "ProductBuildVersion";
constexpr const char* kReleaseTypeKey = "ReleaseType";

// The older scheme: one marker file per migration, in this order.
constexpr std::pair<const char*, const char*> kLegacyMarkers[] = {
    {"tarn_bundle_migration_complete.plist", kTarnMigrationTypeBundle},
    {"tarn_acl2_migration_complete.plist", kTarnMigrationTypeACL},
    {"tarn_group_id_migration_complete.plist", kTarnMigrationTypeGroupId},
    {"tarn_code_signing_migration_complete.plist", kTarnMigrationTypeCodeSigning},
};

bool isFileNotFound(const TarnErrorRef& error) { return error && error->posixCode() == ENOENT; }

std::string stringOr(const PlistValue* dict, const char* key, const char* fallback) {
    const PlistValue* value = dict ? dict->find(key) : nullptr;
    const std::string* text = value ? value->asString() : nullptr;
    return text ? *text : fallback;
}

const std::string* buildVersionIn(const PlistValue* info) {
    const PlistValue* value = info ? info->find(kBuildVersionKey) : nullptr;
    return value ? value->asString() : nullptr;
}

std::string currentDateText() {
    std::time_t now = std::time(nullptr);
    std::tm utc{};
    gmtime_r(&now, &utc);
    char text[40];
    std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &utc);
    return text;
}

}  // namespace

std::unique_ptr<TarnMigrationStatus> TarnMigrationStatus::loaded(FileURL url, const char* failure) {
    auto status = std::make_unique<TarnMigrationStatus>(std::move(url));
    if (!status->_readMigrationStatusFromDisk()) {
        TarnLog(kLogError, "-[TarnMigrationStatus init]", "%s", failure);
        return nullptr;
    }
    return status;
}

std::unique_ptr<TarnMigrationStatus> TarnMigrationStatus::initForSystemMigration() {
    auto status = loaded(
        PathJoin(TarnGlobalConfiguration::sharedInstance().libraryDirectory(), kSystemStatusFile),
        "Error reading system migration file from disk.  This is bad");
    if (status && status->migrationInfo_.empty()) status->_migrateFromManyMarkerFilesToOne();
    return status;
}

std::unique_ptr<TarnMigrationStatus> TarnMigrationStatus::initForMobileUserMigration() {
    auto config = TarnGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity());
    if (!config) {
        TarnLog(kLogError, "-[TarnMigrationStatus initForMobileUserMigration]",
                "Error reading user migration file from disk.  This is bad");
        return nullptr;
    }
    return loaded(PathJoin(config->libraryDirectory(), kUserStatusFile),
                  "Error reading user migration file from disk.  This is bad");
}

std::string TarnMigrationStatus::currentBuildVersion() {
    // The host configuration is itself read once per process.
    const std::string& build = HostConfiguration::shared().buildVersion;
    return build.empty() ? std::string("Unknown") : build;
}

bool TarnMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
    return migrationInfo_.count(type) != 0;
}

bool TarnMigrationStatus::setMigrationCompleteForType(const std::string& type) {
    PlistValue record;
    record.set(kVersionNumberKey, currentBuildVersion());
    record.set(kTimeKey, currentDateText());
    migrationInfo_[type] = std::move(record);
    if (!_writeMigrationStatusToDisk()) return false;
    TarnLog(kLogNotice, __func__, "Migration completed on %@ for %@", currentBuildVersion(), type);
    return true;
}

bool TarnMigrationStatus::isBuildUpgrade() const {
    auto last = migrationInfo_.find(kLastBuildInfo);
    if (last == migrationInfo_.end()) {
        TarnLog(kLogNotice, __func__,
                "No last build info found; upgrading from an old release or an erase install");
        return true;
    }
    const std::string* lastBuild = buildVersionIn(&last->second);
    if (!lastBuild) {
        TarnLog(kLogError, __func__,
                "Could not get build version from last build info dictionary; assuming this is an "
                "upgrade");
        return true;
    }
    const PlistValue current = HostConfiguration::shared().systemVersionDictionary();
    if (!current.isDict()) {
        TarnLog(kLogError, __func__,
                "Could not get current build info; assuming this is an upgrade");
        return true;
    }
    const std::string* currentBuild = buildVersionIn(&current);
    if (!currentBuild || currentBuild->empty()) {
        TarnLog(kLogError, __func__,
                "Could not get current build string; assuming this is an upgrade");
        return true;
    }
    const std::string currentType = stringOr(&current, kReleaseTypeKey, "");
    const std::string lastType = stringOr(&last->second, kReleaseTypeKey, "");
    if (*currentBuild == *lastBuild) {
        TarnLog(kLogNotice, __func__,
                "Current build version (%@ / %@) equal to last version recorded (%@ / %@); "
                "skipping upgrade",
                *currentBuild, currentType, *lastBuild, lastType);
        return false;
    }
    TarnLog(kLogNotice, __func__, "Detected upgrade from %@ (%@) to %@ (%@)", *lastBuild, lastType,
            *currentBuild, currentType);
    return true;
}

bool TarnMigrationStatus::writeCurrentBuildInfoToDisk() {
    const PlistValue current = HostConfiguration::shared().systemVersionDictionary();
    migrationInfo_[kLastBuildInfo] = current;
    if (!_writeMigrationStatusToDisk()) return false;
    TarnLog(kLogNotice, __func__, "Saved last build version of %@",
            stringOr(&current, kBuildVersionKey, "Unknown"));
    return true;
}

bool TarnMigrationStatus::_readMigrationStatusFromDisk() {
    TarnResult<PlistValue> read = Tarn_dictionaryWithContentsOfURL(migrationFileURL_, 0);
    if (!read.ok()) {
        if (isFileNotFound(read.error())) {
            migrationInfo_.clear();
            return true;
        }
        TarnLog(kLogError, __func__, "Failed to read migration status file at %@ : %@",
                migrationFileURL_, read.error());
        return false;
    }
    migrationInfo_ = std::move(*read->asDict());
    return true;
}

bool TarnMigrationStatus::_writeMigrationStatusToDisk() {
    PlistValue contents{migrationInfo_};
    TarnStatus written =
        Tarn_writeToURL(contents, migrationFileURL_, kTarnWriteAtomic | kTarnWriteNoFileProtection);
    if (!written) {
        TarnLog(kLogError, __func__, "Failed to write migration status on %@ for %@ : %@",
                currentBuildVersion(), migrationFileURL_, written.error());
        return false;
    }
    return true;
}

void TarnMigrationStatus::_migrateFromManyMarkerFilesToOne() {
    TarnLog(kLogNotice, __func__, "Migrating from many marker files down to one");
    for (const auto& [file, type] : kLegacyMarkers) _readStatusFromMarkerFileWithName(file, type);
    // The markers go only once the single file holds what they said.
    if (!_writeMigrationStatusToDisk()) return;
    for (const auto& [file, type] : kLegacyMarkers) _removeMarkerFileWithName(file);
}

void TarnMigrationStatus::_readStatusFromMarkerFileWithName(const std::string& name,
                                                            const std::string& type) {
    const FileURL url = PathJoin(PathParent(migrationFileURL_), name);
    TarnResult<PlistValue> read = Tarn_dictionaryWithContentsOfURL(url, 0);
    if (read.ok()) {
        migrationInfo_[type] = std::move(*read);
    } else if (!isFileNotFound(read.error())) {
        TarnLog(kLogError, __func__, "Failed to read migration marker file at %@ : %@", url,
                read.error());
    }
}

void TarnMigrationStatus::_removeMarkerFileWithName(const std::string& name) {
    const FileURL url = PathJoin(PathParent(migrationFileURL_), name);
    TarnStatus removed = TarnFileManager::defaultManager().removeItemAtURL(url);
    if (!removed && !isFileNotFound(removed.error()))
        TarnLog(kLogError, __func__, "Failed to remove marker file at %@: %@", url,
                removed.error());
}

}  // namespace tarn
