// The system and system group containers that other components find by a
// fixed directory name instead of a UUID, and the answers about them.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

class QRTWhitelist {
 public:
  // Identifier to directory name; lookups are exact and case-sensitive.
  using Mapping = std::map<std::string, std::string, std::less<>>;

  // Built on first use with the fixed lists.
  static const QRTWhitelist& sharedWhitelist();

  QRTWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping);

  // Class 12.
  std::optional<std::string> wellknownSystemContainerForId(std::string_view identifier) const;
  bool systemContainerIdIsWellknown(std::string_view identifier) const;
  std::vector<std::string> wellknownSystemContainers() const;

  // Class 13.
  std::optional<std::string> wellknownSystemGroupContainerForId(std::string_view identifier) const;
  bool systemGroupContainerIdIsWellknown(std::string_view identifier) const;
  std::vector<std::string> wellknownSystemGroupContainers() const;

  // The class's list for 12 and 13; no other class has well-known containers.
  bool containerIdIsWellknown(std::string_view identifier, uint64_t containerClass) const;
  std::optional<std::string> wellknownContainerForId(std::string_view identifier, uint64_t containerClass) const;

 private:
  const Mapping* mappingForClass(uint64_t containerClass) const;

  const Mapping systemWhitelist_;
  const Mapping systemGroupWhitelist_;
};
