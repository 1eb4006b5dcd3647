#include "platform/DeviceProperties.h"

#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"

namespace platform {

namespace {

std::optional<plist::Dictionary> readDictionary(std::string_view devicePath) {
  std::optional<std::string> bytes = readHostFile(hostPath(devicePath));
  if (!bytes) return std::nullopt;
  std::optional<plist::Value> value = plist::parse(bytes->data(), bytes->size());
  if (!value || !value->isDictionary()) return std::nullopt;
  return std::move(value->dictionary());
}

const plist::Value* deviceProperty(const std::optional<plist::Dictionary>& properties, std::string_view key) {
  return properties ? plist::find(*properties, key) : nullptr;
}

bool booleanProperty(std::string_view key) {
  std::optional<plist::Dictionary> properties = readDictionary("/etc/device-properties.plist");
  const plist::Value* value = deviceProperty(properties, key);
  const bool* flag = value ? value->booleanIf() : nullptr;
  return flag && *flag;
}

}  // namespace

bool deviceIsInternalBuild() {
  if (std::optional<bool> configured = hostConfiguration().internalBuild) return *configured;
  return booleanProperty("InternalBuild");
}

uint64_t deviceMultiUserFlags() {
  std::optional<plist::Dictionary> properties = readDictionary("/etc/device-properties.plist");
  const plist::Value* value = deviceProperty(properties, "MultiUserFlags");
  const plist::Integer* flags = value ? value->integerIf() : nullptr;
  return flags ? flags->asUnsigned() : 0;
}

bool deviceRefusesTerminationAssertions() { return booleanProperty("RefuseTerminationAssertions"); }

std::optional<plist::Dictionary> systemVersionRecord() { return readDictionary("/etc/system-version.plist"); }

}  // namespace platform
