#include "Daemon/requests/QRTSpecialCommands.h"

#include "Daemon/migration/QRTContainerMigrator.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"

using platform::kLogError;

namespace {

// Commands 27 to 29 act for the current mobile user whatever "UserID" says.
uint32_t mobileUser() { return QRTGlobalConfiguration::sharedInstance().currentMobileUserId(); }

}  // namespace

void QRTHandlePerformDataMigration(const plist::Dictionary&, const QRTReplyRef&, QRTClientConnection&,
                                   uint64_t* result) {
  QRTErrorRef error;
  if (!QRTContainerMigrator::sharedInstance().performDataMigratorMigrationWithError(&error)) {
    QRTLogAs(kLogError, "performDataMigration", "Failed to perform data migration : %@", error);
    *result = error ? error->resultCode() : static_cast<uint64_t>(QRTErrorException);
  }
}

void QRTHandleRetryTest(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                        uint64_t* result) {
  if (!platform::deviceIsInternalBuild()) {
    QRTLogAs(kLogError, "retryTest", "People really shouldn't be calling this on non-internal installs!");
    return;
  }
  uint32_t userId = 0;
  if (!validateUserId(static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID)), QRTClassAppData, client, &userId,
                      result))
    return;
  client.retryTestForUser(userId, QRTMessageU64(request, QRTKeyNumRetryCrashes), result);
}

void QRTHandleStageSharedContent(const plist::Dictionary& request, const QRTReplyRef& reply,
                                 QRTClientConnection& client, uint64_t* result) {
  auto url = client.stageSharedContentForIdentifier(QRTMessageString(request, QRTKeyIdentifier),
                                                    QRTMessageString(request, QRTKeySourcePath),
                                                    QRTMessageString(request, QRTKeyDestPath), result);
  if (url) reply->dictionary[QRTReplyKeyPath] = url->path();
}

void QRTHandleSetNetworkExtension(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                                  uint64_t* result) {
  client.setNetworkExtensionForUser(mobileUser(), QRTMessageString(request, QRTKeyIdentifier),
                                    QRTMessageU64(request, QRTKeyContainerClass), result);
}

void QRTHandleUserManagedAssetsPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                    QRTClientConnection& client, uint64_t* result) {
  auto url = client.userManagedAssetsPathForUser(mobileUser(), QRTMessageString(request, QRTKeyIdentifier),
                                                 QRTMessageBool(request, QRTKeyIsRelative), result);
  if (url) reply->dictionary[QRTReplyKeyPath] = url->path();
}

void QRTHandleDeleteUserManagedAsset(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                                     uint64_t* result) {
  client.deleteUserManagedAssetForUser(mobileUser(), QRTMessageString(request, QRTKeyIdentifier),
                                       QRTMessageString(request, QRTKeySourcePath), result);
}
