// The client of one request: who is asking and what they may name. Also the
// home of the container operations that the request handlers call.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

class QRTClientConnection {
 public:
  QRTClientConnection(std::optional<std::string> bundleId, uint32_t clientUserId, bool allowOtherIdLookup,
                      std::optional<std::vector<std::string>> entitledWipeIdentifiers);
  QRTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup);

  // The internal client through which start-up work runs: identifier
  // "com.norvane.quarterd.internal", user 0, other-identifier look-up allowed.
  static QRTClientConnection& sharedClientConnection();

  const std::optional<std::string>& clientBundleIdentifier() const { return clientBundleIdentifier_; }
  uint32_t clientUserId() const { return clientUserId_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
  const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const { return entitledWipeIdentifiers_; }

  // Start-up work of the container store, run through the internal client.
  void rebootQuarterSetup();
  void quarterSetup();
  void rebootQuarterCleanup();
  void quarterCleanup();

 private:
  std::optional<std::string> clientBundleIdentifier_;
  uint32_t clientUserId_ = 0;
  bool allowOtherIdLookup_ = false;
  bool allowGroupIdLookup_ = false;
  std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};
