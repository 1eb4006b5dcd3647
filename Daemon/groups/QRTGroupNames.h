// What the group manager needs of the code-signing mapping: the groups that a
// stored program's entitlements name. The mapping implements it and callers
// hand it to the group manager's look-ups, so that the group manager never
// calls into the mapping itself (the mapping calls the group manager when
// the groups a program names change).
#pragma once

#include <optional>
#include <string>
#include <vector>

// The groups a program names; nothing when it names none or cannot be read.
using QRTGroupList = std::optional<std::vector<std::string>>;

class QRTGroupNames {
 public:
  // The application groups the program's entitlements name.
  virtual QRTGroupList appGroupIdentifiersForIdentifier(const std::string& identifier) = 0;
  // The system groups it names, each with the "systemgroup." prefix.
  virtual QRTGroupList systemGroupIdentifiersForIdentifier(const std::string& identifier) = 0;

 protected:
  ~QRTGroupNames() = default;
};
