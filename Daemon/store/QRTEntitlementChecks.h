// What the store asks about a program's entitlements. The answers come from
// the code-signing mapping, which stands above the store and installs them
// when the program starts, so that the store never calls up into it.
#pragma once

#include <optional>
#include <string>
#include <vector>

struct QRTEntitlementChecks {
  // Whether the program's entitlements grant it a system container.
  bool (*grantsSystemContainer)(const std::string& identifier) = nullptr;
  // The system groups the program's entitlements name; nothing when none.
  std::optional<std::vector<std::string>> (*systemGroups)(const std::string& identifier) = nullptr;
};

// Installed once, during static initialisation, before any thread runs.
void QRTInstallEntitlementChecks(const QRTEntitlementChecks& checks);

// Without installed checks no program is entitled to anything.
bool QRTEntitlementsGrantSystemContainer(const std::string& identifier);
std::optional<std::vector<std::string>> QRTEntitledSystemGroups(const std::string& identifier);
