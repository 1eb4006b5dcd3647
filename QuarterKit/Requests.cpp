#include "QuarterKit/Requests.h"

#include <cstdint>

namespace quarterkit {

Request::Request(Command command) { u64("Command", static_cast<uint64_t>(command)); }

Request& Request::u64(std::string_view key, uint64_t v) {
  // Unsigned on the wire only where a signed reader would get it wrong.
  return value(key, plist::Integer{v, v > static_cast<uint64_t>(INT64_MAX)});
}
Request& Request::i64(std::string_view key, int64_t v) {
  return value(key, plist::Integer{static_cast<uint64_t>(v), false});
}
Request& Request::boolean(std::string_view key, bool v) { return value(key, plist::Value(v)); }
Request& Request::string(std::string_view key, std::string v) { return value(key, plist::Value(std::move(v))); }
Request& Request::string(std::string_view key, const std::optional<std::string>& v) {
  return v ? string(key, *v) : *this;
}
Request& Request::uuid(std::string_view key, const UUID& v) { return value(key, uuidValue(v)); }
Request& Request::uuid(std::string_view key, const std::optional<UUID>& v) { return v ? uuid(key, *v) : *this; }
Request& Request::array(std::string_view key, plist::Array v) { return value(key, plist::Value(std::move(v))); }
Request& Request::dictionary(std::string_view key, plist::Dictionary v) {
  return value(key, plist::Value(std::move(v)));
}
Request& Request::value(std::string_view key, plist::Value v) {
  message_.insert_or_assign(std::string(key), std::move(v));
  return *this;
}

plist::Value uuidValue(const UUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

uint64_t Reply::u64(std::string_view key) const {
  const plist::Value* v = value(key);
  const plist::Integer* i = v ? v->integerIf() : nullptr;
  return i ? i->asUnsigned() : 0;
}
int64_t Reply::i64(std::string_view key) const { return static_cast<int64_t>(u64(key)); }
bool Reply::boolean(std::string_view key) const {
  const plist::Value* v = value(key);
  const bool* b = v ? v->booleanIf() : nullptr;
  return b && *b;
}
std::optional<std::string> Reply::string(std::string_view key) const {
  const plist::Value* v = value(key);
  const std::string* s = v ? v->stringIf() : nullptr;
  return s ? std::optional<std::string>(*s) : std::nullopt;
}
std::optional<UUID> Reply::uuid(std::string_view key) const {
  const plist::Value* v = value(key);
  const plist::Data* d = v ? v->dataIf() : nullptr;
  return d ? UUID::fromBytes(d->data(), d->size()) : std::nullopt;
}
const plist::Array* Reply::array(std::string_view key) const {
  const plist::Value* v = value(key);
  return v ? v->arrayIf() : nullptr;
}
const plist::Dictionary* Reply::dictionary(std::string_view key) const {
  const plist::Value* v = value(key);
  return v ? v->dictionaryIf() : nullptr;
}
const plist::Value* Reply::value(std::string_view key) const { return plist::find(reply_, key); }

std::vector<std::string> Reply::strings(std::string_view key) const {
  std::vector<std::string> out;
  if (const plist::Array* a = array(key))
    for (const plist::Value& v : *a)
      if (const std::string* s = v.stringIf()) out.push_back(*s);
  return out;
}
std::vector<UUID> Reply::uuids(std::string_view key) const {
  std::vector<UUID> out;
  if (const plist::Array* a = array(key))
    for (const plist::Value& v : *a)
      if (const plist::Data* d = v.dataIf())
        if (auto u = UUID::fromBytes(d->data(), d->size())) out.push_back(*u);
  return out;
}

std::optional<Reply> perform(Connection& connection, const Request& request) {
  auto reply = connection.call(request.message(), connection.replyTimeout());
  if (!reply) return std::nullopt;
  return Reply(std::move(*reply));
}

namespace {

// The keys that name one container in most container commands.
Request& addContainer(Request& r, const ContainerRef& c) {
  return r.u64("UserID", c.userId)
      .u64("ContainerClass", c.containerClass)
      .string("Identifier", c.identifier)
      .uuid("UUID", c.uuid);
}

Result onContainer(Connection& c, Command command, const ContainerRef& container) {
  Request r(command);
  return perform(c, addContainer(r, container));
}

}  // namespace

Result createOrLookupContainer(Connection& c, uint64_t userId, std::optional<std::string> identifier,
                               uint64_t containerClass, bool createIfNecessary, bool transient) {
  return perform(c, Request(Command::createOrLookupContainer)
                        .u64("UserID", userId)
                        .string("Identifier", identifier)
                        .u64("ContainerClass", containerClass)
                        .boolean("CreateIfNecessary", createIfNecessary)
                        .boolean("Transient", transient));
}

Result containersForUser(Connection& c, uint64_t userId, uint64_t containerClass, bool transient) {
  return perform(c, Request(Command::containersForUser)
                        .u64("UserID", userId)
                        .u64("ContainerClass", containerClass)
                        .boolean("Transient", transient));
}

Result replaceContainer(Connection& c, const std::optional<ContainerRef>& old, const ContainerRef& replacement) {
  Request r(Command::replaceContainer);
  if (old) {
    r.uuid("OldContainerUUID", old->uuid)
        .u64("OldContainerUserID", old->userId)
        .u64("OldContainerClass", old->containerClass)
        .string("OldIdentifier", old->identifier);
  }
  r.uuid("NewContainerUUID", replacement.uuid)
      .u64("NewContainerUserID", replacement.userId)
      .u64("NewContainerClass", replacement.containerClass)
      .string("NewIdentifier", replacement.identifier);
  return perform(c, r);
}

Result stageContainerForDelete(Connection& c, const std::vector<uint64_t>& userIds, const std::vector<UUID>& uuids,
                               const std::vector<std::string>& identifiers, const std::vector<uint64_t>& classes) {
  plist::Array users, uuidArray, ids, classArray;
  for (uint64_t u : userIds) users.emplace_back(u);
  for (const UUID& u : uuids) uuidArray.push_back(uuidValue(u));
  for (const std::string& s : identifiers) ids.emplace_back(s);
  for (uint64_t k : classes) classArray.emplace_back(k);
  return perform(c, Request(Command::stageContainerForDelete)
                        .array("UserIDsArray", std::move(users))
                        .array("UUIDsArray", std::move(uuidArray))
                        .array("IdentifiersArray", std::move(ids))
                        .array("ContainerClassesArray", std::move(classArray)));
}

Result deleteContainersOnDeathRow(Connection& c) { return perform(c, Request(Command::deleteContainersOnDeathRow)); }

Result setInfoValue(Connection& c, const ContainerRef& container, const std::string& key,
                    const std::optional<plist::Value>& value) {
  Request r(Command::setInfoValue);
  addContainer(r, container).string("Key", key);
  if (value) r.value("Value", *value);
  return perform(c, r);
}

Result infoValueForKey(Connection& c, const ContainerRef& container, const std::string& key) {
  Request r(Command::infoValueForKey);
  return perform(c, addContainer(r, container).string("Key", key));
}

Result metadataForContainer(Connection& c, const ContainerRef& container, bool infoDictRequested) {
  Request r(Command::metadataForContainer);
  return perform(c, addContainer(r, container).boolean("InfoDictRequested", infoDictRequested));
}

Result recreateDefaultStructure(Connection& c, const ContainerRef& container) {
  return onContainer(c, Command::recreateDefaultStructure, container);
}

Result regenerateDirectoryUUID(Connection& c, const ContainerRef& container) {
  return onContainer(c, Command::regenerateDirectoryUUID, container);
}

Result deleteContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                       uint64_t containerClass, bool transient) {
  return perform(c, Request(Command::deleteContainer)
                        .u64("UserID", userId)
                        .string("Identifier", identifier)
                        .u64("ContainerClass", containerClass)
                        .boolean("Transient", transient));
}

Result wipeAddonDataContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  // The daemon works on class 4 whatever is sent; sending it keeps the
  // message self-describing.
  return perform(c, Request(Command::wipeAddonDataContainer)
                        .u64("UserID", userId)
                        .string("Identifier", identifier)
                        .u64("ContainerClass", 4));
}

Result deleteDataContainerContent(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                                  uint64_t containerClass) {
  return perform(c, Request(Command::deleteDataContainerContent)
                        .u64("UserID", userId)
                        .string("Identifier", identifier)
                        .u64("ContainerClass", containerClass));
}

Result groupContainerPaths(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::groupContainerPaths).u64("UserID", userId).string("Identifier", identifier));
}

Result groupContainerIdentifiers(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::groupContainerIdentifiers).u64("UserID", userId).string("Identifier", identifier));
}

Result systemContainerPath(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemContainerPath).string("Identifier", identifier));
}

Result systemGroupContainerPaths(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemGroupContainerPaths).string("Identifier", identifier));
}

Result systemGroupContainerPath(Connection& c, const std::string& groupIdentifier,
                                const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemGroupContainerPath)
                        .string("GroupIdentifier", groupIdentifier)
                        .string("Identifier", identifier));
}

Result processCodeSigningInfo(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<plist::Value>& codeSigningInfo,
                              const std::optional<plist::Value>& options) {
  Request r(Command::processCodeSigningInfo);
  r.string("Identifier", identifier);
  if (codeSigningInfo) r.value("CodeSigningInfo", *codeSigningInfo);
  if (options) r.value("OptionsDictionary", *options);
  return perform(c, r);
}

Result codeSigningInfoForIdentifier(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::codeSigningInfoForIdentifier).string("Identifier", identifier));
}

Result invalidateCodeSigningInfoForAppsWithoutBundleContainer(Connection& c) {
  return perform(c, Request(Command::invalidateCodeSigningInfoForAppsWithoutBundleContainer));
}

Result setDataProtection(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                         uint64_t containerClass, int64_t dataProtectionClass, bool isThirdParty, bool retryIfLocked) {
  return perform(c, Request(Command::setDataProtection)
                        .u64("UserID", userId)
                        .string("Identifier", identifier)
                        .u64("ContainerClass", containerClass)
                        .i64("DataProtectionClass", dataProtectionClass)
                        .boolean("IsThirdParty", isThirdParty)
                        .boolean("RetryIfLocked", retryIfLocked));
}

Result recreateContainerStructure(Connection& c, const ContainerRef& container) {
  return onContainer(c, Command::recreateContainerStructure, container);
}

Result diskUsage(Connection& c, const ContainerRef& container) { return onContainer(c, Command::diskUsage, container); }

Result performDataMigration(Connection& c) { return perform(c, Request(Command::performDataMigration)); }

Result retryTest(Connection& c, uint64_t userId, uint64_t numRetryCrashes) {
  return perform(c, Request(Command::retryTest).u64("UserID", userId).u64("NumRetryCrashes", numRetryCrashes));
}

Result stageSharedContent(Connection& c, const std::optional<std::string>& identifier,
                          const std::optional<std::string>& sourcePath, const std::optional<std::string>& destPath) {
  return perform(c, Request(Command::stageSharedContent)
                        .string("Identifier", identifier)
                        .string("SourcePath", sourcePath)
                        .string("DestPath", destPath));
}

Result setNetworkExtension(Connection& c, const std::optional<std::string>& identifier, uint64_t containerClass) {
  return perform(
      c, Request(Command::setNetworkExtension).string("Identifier", identifier).u64("ContainerClass", containerClass));
}

Result userManagedAssetsPath(Connection& c, const std::optional<std::string>& identifier, bool isRelative) {
  return perform(
      c, Request(Command::userManagedAssetsPath).string("Identifier", identifier).boolean("IsRelative", isRelative));
}

Result deleteUserManagedAsset(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<std::string>& relativePath) {
  return perform(
      c, Request(Command::deleteUserManagedAsset).string("Identifier", identifier).string("SourcePath", relativePath));
}

}  // namespace quarterkit
