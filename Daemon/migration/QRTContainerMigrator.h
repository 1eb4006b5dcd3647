// The one-time changes a new system build may need on an existing device:
// the build-upgrade migration run at the first start after an upgrade, and
// the data migration the platform's data-migration service asks for.
#pragma once

#include "Daemon/QRTError.h"

class QRTMigrationStatus;

class QRTContainerMigrator {
 public:
  static QRTContainerMigrator& sharedInstance();

  // status may be null (an unreadable status file): guarded steps then run.
  bool performSynchronousBuildUpgradeMigration(QRTMigrationStatus* status, QRTErrorRef* withError);
  bool performDataMigratorMigrationWithError(QRTErrorRef* error);

 private:
  QRTContainerMigrator() = default;
  bool _performWhitelistMigrationWithError(QRTErrorRef* error);
  void _checkIfDeviceMayNeedSystemContainerACLMigration(QRTMigrationStatus* status);
  bool _performInternalACLMigrationWithError(QRTErrorRef* error);
  bool _performBundleContainerOwnershipMigrationWithError(QRTErrorRef* error);
  bool _buildUpgradeSteps(QRTMigrationStatus* status, QRTErrorRef* withError);
  void _moveOldLogFiles();
};
