// TarnMigrationStatus: which migrations have completed, on which build, and
// which build the daemon last ran on. One property-list file per scope: the
// system file in the daemon's library directory, the per-user file in the
// default user's library directory. The system scope also folds the older
// one-marker-file-per-migration scheme into its file.
//
// Not thread-safe: each user makes its own object for one pass. A status file
// that exists but cannot be read gives no object, so that no migration runs
// on a guess and the file is left as it is for inspection.
#pragma once

#include <memory>
#include <string>

#include "Platform/Path.h"
#include "Platform/PropertyList.h"

namespace tarn {

// Migration type names recorded in the status files.
inline constexpr const char* kTarnMigrationTypeBundle = "BundleMigration";
inline constexpr const char* kTarnMigrationTypeACL = "ACLMigration";
inline constexpr const char* kTarnMigrationTypeGroupId = "GroupIdMigration";
inline constexpr const char* kTarnMigrationTypeCodeSigning = "CodeSigningMigration";
inline constexpr const char* kTarnMigrationTypeSubdirectory = "SubdirectoryMigration";

class TarnMigrationStatus {
  public:
    // Null when the file exists but cannot be read; a missing file reads as
    // an empty status.
    static std::unique_ptr<TarnMigrationStatus> initForSystemMigration();
    static std::unique_ptr<TarnMigrationStatus> init() { return initForSystemMigration(); }
    static std::unique_ptr<TarnMigrationStatus> initForMobileUserMigration();

    // The running build's version; "Unknown" when unreadable.
    static std::string currentBuildVersion();

    bool hasMigrationOccurredForType(const std::string& type) const;
    // Records `type` as completed now on the current build and writes the
    // file; false when the write failed (the record stays in memory).
    bool setMigrationCompleteForType(const std::string& type);
    bool isBuildUpgrade() const;
    bool writeCurrentBuildInfoToDisk();

    const PlistDict& migrationInfo() const { return migrationInfo_; }
    const FileURL& migrationFileURL() const { return migrationFileURL_; }

    explicit TarnMigrationStatus(FileURL fileURL) : migrationFileURL_(std::move(fileURL)) {}

  private:
    static std::unique_ptr<TarnMigrationStatus> loaded(FileURL url, const char* failure);
    bool _readMigrationStatusFromDisk();
    bool _writeMigrationStatusToDisk();
    void _migrateFromManyMarkerFilesToOne();
    void _readStatusFromMarkerFileWithName(const std::string& name, const std::string& type);
    void _removeMarkerFileWithName(const std::string& name);

    PlistDict migrationInfo_;
    FileURL migrationFileURL_;
};

}  // namespace tarn
