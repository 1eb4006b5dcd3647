// Which one-time migrations have completed and on which system build the
// daemon last ran: one property-list file in the library directory, read
// afresh by every status object, so the file is the only shared state.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/PlistValue.h"
#include "base/QRTURL.h"

inline constexpr const char* QRTMigrationStatusFileName = "qrt_migration_status.plist";
inline constexpr const char* QRTLastBuildInfoKey = "LastBuildInfo";
inline constexpr const char* QRTMigrationTypeBundle = "BundleMigration";
inline constexpr const char* QRTMigrationTypeACL = "ACLMigration";
inline constexpr const char* QRTMigrationTypeGroupId = "GroupIdMigration";
inline constexpr const char* QRTMigrationTypeCodeSigning = "CodeSigningMigration";

class QRTMigrationStatus {
 public:
  // Nothing when the file exists but can't be read (both lines logged).
  // Callers without an object treat every migration as not yet run and
  // record nothing.
  static std::unique_ptr<QRTMigrationStatus> init();

  bool hasMigrationOccurredForType(const std::string& type) const;
  void setMigrationCompleteForType(const std::string& type);
  void writeCurrentBuildInfoToDisk();
  bool isBuildUpgrade() const;
  // The build of the running system, read once for the process.
  static std::optional<std::string> currentBuildVersion();

  const plist::Dictionary& migrationInfo() const { return migrationInfo_; }

 private:
  QRTMigrationStatus() = default;
  bool _readMigrationStatusFromDisk();
  void _migrateFromManyMarkerFilesToOne();
  bool _writeMigrationStatusToDisk();

  QRTURL fileURL_;
  plist::Dictionary migrationInfo_;
};
