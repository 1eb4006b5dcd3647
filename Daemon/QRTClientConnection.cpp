#include "Daemon/QRTClientConnection.h"

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, uint32_t clientUserId,
                                         bool allowOtherIdLookup,
                                         std::optional<std::vector<std::string>> entitledWipeIdentifiers)
    : clientBundleIdentifier_(std::move(bundleId)),
      clientUserId_(clientUserId),
      allowOtherIdLookup_(allowOtherIdLookup),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)) {}

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup)
    : QRTClientConnection(std::move(bundleId), 0, allowOtherIdLookup, std::nullopt) {}

QRTClientConnection& QRTClientConnection::sharedClientConnection() {
  static QRTClientConnection* shared = new QRTClientConnection("com.norvane.quarterd.internal", true);
  return *shared;
}

// The start-up work of the container store (replace recovery, pending
// protection changes, system container installation, staging and transient
// clean-up) lands with the store itself; until then there is nothing to do.
void QRTClientConnection::rebootQuarterSetup() {}
void QRTClientConnection::quarterSetup() {}
void QRTClientConnection::rebootQuarterCleanup() {}
void QRTClientConnection::quarterCleanup() {}
