// One program's code-signing record: the dictionary registered for it, its
// child bundles, three flags and the class of its data container. Carried
// between the database, the mapping service and the migrations.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/PlistValue.h"

class QRTCodeSigningEntry {
 public:
  QRTCodeSigningEntry() = default;
  explicit QRTCodeSigningEntry(std::optional<plist::Dictionary> codeSigningInfo, uint64_t dataContainerClass = 0)
      : codeSigningInfo(std::move(codeSigningInfo)), dataContainerClass(dataContainerClass) {}
  // The dictionary form; a missing or mistyped key leaves its field at the default.
  static QRTCodeSigningEntry fromSerializedDictionary(const plist::Dictionary& dictionary);

  plist::Dictionary serialize() const;
  bool operator==(const QRTCodeSigningEntry& other) const;
  size_t hash() const;
  std::string description() const;

  bool isInvalid() const { return invalid; }
  bool isPlaceholder() const { return placeholder; }
  bool isRegisteredByCaller() const { return registeredByCaller; }

  bool invalid = false;
  bool placeholder = false;
  bool registeredByCaller = false;
  std::optional<plist::Dictionary> codeSigningInfo;
  std::optional<std::vector<std::string>> childBundleIdentifiers;
  uint64_t dataContainerClass = 0;
};
