#include "Daemon/TarnMigrationStatus.h"

namespace tarn {

// Placeholder until the status files are read and written: every build counts
// as an upgrade and nothing is recorded.
std::unique_ptr<TarnMigrationStatus> TarnMigrationStatus::initForSystemMigration() {
    return std::make_unique<TarnMigrationStatus>(FileURL{});
}
std::unique_ptr<TarnMigrationStatus> TarnMigrationStatus::initForMobileUserMigration() {
    return std::make_unique<TarnMigrationStatus>(FileURL{});
}
const std::string& TarnMigrationStatus::currentBuildVersion() {
    static const std::string unknown = "Unknown";
    return unknown;
}
bool TarnMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
    return migrationInfo_.count(type) != 0;
}
bool TarnMigrationStatus::setMigrationCompleteForType(const std::string&) { return false; }
bool TarnMigrationStatus::isBuildUpgrade() const { return true; }
bool TarnMigrationStatus::writeCurrentBuildInfoToDisk() { return false; }

}  // namespace tarn
