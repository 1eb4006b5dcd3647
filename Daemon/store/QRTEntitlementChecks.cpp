#include "Daemon/store/QRTEntitlementChecks.h"

namespace {

// Written only before main, read only after.
constinit QRTEntitlementChecks gChecks{};

}  // namespace

void QRTInstallEntitlementChecks(const QRTEntitlementChecks& checks) { gChecks = checks; }

bool QRTEntitlementsGrantSystemContainer(const std::string& identifier) {
  return gChecks.grantsSystemContainer && gChecks.grantsSystemContainer(identifier);
}

std::optional<std::vector<std::string>> QRTEntitledSystemGroups(const std::string& identifier) {
  if (!gChecks.systemGroups) return std::nullopt;
  return gChecks.systemGroups(identifier);
}
