#include "Daemon/QRTGlobalConfiguration.h"

#include "Daemon/QRTFileManager.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

QRTGlobalConfiguration& QRTGlobalConfiguration::sharedInstance() {
  static QRTGlobalConfiguration* instance = new QRTGlobalConfiguration();
  return *instance;
}

QRTGlobalConfiguration::QRTGlobalConfiguration()
    : homeDirectory_(QRTURL::fileURL(platform::hostPath("/private/var/root/"), true)),
      emplacerdHomeDirectory_(QRTURL::fileURL(platform::hostPath("/private/var/emplacerd/"), true)) {
  if (auto mobile = platform::userByName("mobile")) {
    currentMobileUserId_ = mobile->uid;
    QRTLog(platform::kLogError, "Current mobile user ID is %u", currentMobileUserId_);
  } else {
    QRTLog(platform::kLogError, "Failed to get mobile uid. This is bad");
  }
}

QRTURL QRTGlobalConfiguration::logDirectory() {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  QRTURL url = homeDirectory_.URLByAppendingPathComponent("Library/Logs/QuarterKit", true);
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(url, true, 0755, 0, 4, &error)) {
    QRTLog(platform::kLogError, "Failed to create log directory at \"%@\": %@", url, error);
  }
  return url;
}
