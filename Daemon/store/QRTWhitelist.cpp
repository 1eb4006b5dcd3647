#include "Daemon/store/QRTWhitelist.h"

#include <utility>

#include "Daemon/store/QRTContentClass.h"

namespace {

std::optional<std::string> lookup(const QRTWhitelist::Mapping& mapping, std::string_view identifier) {
  auto it = mapping.find(identifier);
  if (it == mapping.end()) return std::nullopt;
  return it->second;
}

std::vector<std::string> identifiers(const QRTWhitelist::Mapping& mapping) {
  std::vector<std::string> result;
  result.reserve(mapping.size());
  for (const auto& [identifier, name] : mapping) result.push_back(identifier);
  return result;
}

// Each well-known container's directory is named after its identifier.
QRTWhitelist::Mapping identityMapping(std::initializer_list<const char*> identifiers) {
  QRTWhitelist::Mapping mapping;
  for (const char* identifier : identifiers) mapping.emplace(identifier, identifier);
  return mapping;
}

}  // namespace

const QRTWhitelist& QRTWhitelist::sharedWhitelist() {
  static const QRTWhitelist instance(identityMapping({
                                         "com.norvane.lazyloadd",
                                         "com.norvane.mapsd",
                                     }),
                                     identityMapping({
                                         "systemgroup.com.norvane.policysets",
                                         "systemgroup.com.norvane.updater.info",
                                         "systemgroup.com.norvane.appregistry.iconscache",
                                         "systemgroup.com.norvane.locator.managed",
                                         "systemgroup.com.norvane.assetpacks",
                                     }));
  return instance;
}

QRTWhitelist::QRTWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping)
    : systemWhitelist_(std::move(systemContainerMapping)),
      systemGroupWhitelist_(std::move(systemGroupContainerMapping)) {}

std::optional<std::string> QRTWhitelist::wellknownSystemContainerForId(std::string_view identifier) const {
  return lookup(systemWhitelist_, identifier);
}

bool QRTWhitelist::systemContainerIdIsWellknown(std::string_view identifier) const {
  return systemWhitelist_.contains(identifier);
}

std::vector<std::string> QRTWhitelist::wellknownSystemContainers() const { return identifiers(systemWhitelist_); }

std::optional<std::string> QRTWhitelist::wellknownSystemGroupContainerForId(std::string_view identifier) const {
  return lookup(systemGroupWhitelist_, identifier);
}

bool QRTWhitelist::systemGroupContainerIdIsWellknown(std::string_view identifier) const {
  return systemGroupWhitelist_.contains(identifier);
}

std::vector<std::string> QRTWhitelist::wellknownSystemGroupContainers() const {
  return identifiers(systemGroupWhitelist_);
}

const QRTWhitelist::Mapping* QRTWhitelist::mappingForClass(uint64_t containerClass) const {
  if (containerClass == QRTClassSystemData) return &systemWhitelist_;
  if (containerClass == QRTClassSystemGroup) return &systemGroupWhitelist_;
  return nullptr;
}

bool QRTWhitelist::containerIdIsWellknown(std::string_view identifier, uint64_t containerClass) const {
  const Mapping* mapping = mappingForClass(containerClass);
  return mapping && mapping->contains(identifier);
}

std::optional<std::string> QRTWhitelist::wellknownContainerForId(std::string_view identifier,
                                                                 uint64_t containerClass) const {
  const Mapping* mapping = mappingForClass(containerClass);
  if (!mapping) return std::nullopt;
  return lookup(*mapping, identifier);
}
