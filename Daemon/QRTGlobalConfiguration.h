// The paths of the daemon that do not depend on a user, and the current
// mobile user. Getters create their directory on every call, so a directory
// removed from under the daemon comes back at its next use.
#pragma once

#include <cstdint>
#include <mutex>

#include "base/QRTURL.h"

class QRTGlobalConfiguration {
 public:
  static QRTGlobalConfiguration& sharedInstance();

  // "/private/var/root/" under the device root.
  const QRTURL& homeDirectory() const { return homeDirectory_; }
  const QRTURL& emplacerdHomeDirectory() const { return emplacerdHomeDirectory_; }
  // home + "Library/Logs/QuarterKit", created (protection class 4).
  QRTURL logDirectory();
  uint32_t currentMobileUserId() const { return currentMobileUserId_; }

 private:
  QRTGlobalConfiguration();

  std::recursive_mutex lock_;
  QRTURL homeDirectory_;
  QRTURL emplacerdHomeDirectory_;
  uint32_t currentMobileUserId_ = 0;
};
