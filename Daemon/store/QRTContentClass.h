// Content classes: the kinds of container, their path names and which user
// may own which class.
#pragma once

#include <cstdint>

#include "platform/UserDatabase.h"

enum QRTContentClass : uint64_t {
  QRTClassUndefined = 0,
  QRTClassAppBundle = 1,
  QRTClassAppData = 2,
  QRTClassAddonBundle = 3,
  QRTClassAddonData = 4,
  QRTClassVPNBundle = 5,
  QRTClassVPNData = 6,
  QRTClassAppGroup = 7,
  QRTClassFrameworkBundle = 8,
  QRTClassRelayServiceData = 9,
  QRTClassInternalDaemonData = 10,
  QRTClassTempDirData = 11,
  QRTClassSystemData = 12,
  QRTClassSystemGroup = 13,
};

inline constexpr uint32_t QRTInstallerUserId = platform::kInstallerUserId;
inline constexpr uint32_t QRTSystemContainerUserId = platform::kSystemContainerUserId;
inline constexpr uint32_t QRTDefaultMobileUserId = 501;

inline bool QRTIsBundleClass(uint64_t c) {
  return c == QRTClassAppBundle || c == QRTClassAddonBundle || c == QRTClassVPNBundle || c == QRTClassFrameworkBundle;
}
inline bool QRTIsSystemClass(uint64_t c) { return c == QRTClassSystemData || c == QRTClassSystemGroup; }
inline bool QRTIsGlobalClass(uint64_t c) { return QRTIsBundleClass(c) || QRTIsSystemClass(c); }
inline bool QRTIsPerUserClass(uint64_t c) {
  return c == QRTClassAppData || c == QRTClassAddonData || c == QRTClassVPNData || c == QRTClassAppGroup ||
         c == QRTClassRelayServiceData || c == QRTClassInternalDaemonData || c == QRTClassTempDirData;
}

// The class's two-component path name ("Data/Application"); "Undefined" for
// 0 and for numbers above 13.
const char* QRTContentClassPathName(uint64_t containerClass);

// Bundle classes belong to user 33, system classes to 499, per-user classes
// to anyone; class 0 and numbers above 13 to nobody.
inline bool user_id_valid_for_class(uint64_t containerClass, uint32_t userId) {
  if (QRTIsBundleClass(containerClass)) return userId == QRTInstallerUserId;
  if (QRTIsSystemClass(containerClass)) return userId == QRTSystemContainerUserId;
  return QRTIsPerUserClass(containerClass);
}
