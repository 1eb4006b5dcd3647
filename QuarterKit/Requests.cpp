#include "QuarterKit/Requests.h"

#include <cstdint>

#include "base/QRTProtocol.h"

namespace quarterkit {

// The public enum keeps its own spelling for callers outside the tree; every
// value is the daemon's.
#define SAME_COMMAND(kit, daemon) \
  static_assert(static_cast<uint64_t>(Command::kit) == QRTCommand##daemon, #kit " is not the daemon's number")
SAME_COMMAND(createOrLookupContainer, CreateOrLookupContainer);
SAME_COMMAND(containersForUser, ContainersForUser);
SAME_COMMAND(replaceContainer, ReplaceContainer);
SAME_COMMAND(stageContainerForDelete, StageContainerForDelete);
SAME_COMMAND(deleteContainersOnDeathRow, DeleteContainersOnDeathRow);
SAME_COMMAND(setInfoValue, SetInfoValue);
SAME_COMMAND(infoValueForKey, InfoValueForKey);
SAME_COMMAND(metadataForContainer, MetadataForContainer);
SAME_COMMAND(recreateDefaultStructure, RecreateDefaultStructure);
SAME_COMMAND(regenerateDirectoryUUID, RegenerateDirectoryUUID);
SAME_COMMAND(deleteContainer, DeleteContainer);
SAME_COMMAND(wipeAddonDataContainer, WipeAddonDataContainer);
SAME_COMMAND(deleteDataContainerContent, DeleteDataContainerContent);
SAME_COMMAND(groupContainerPaths, GroupContainerPaths);
SAME_COMMAND(groupContainerIdentifiers, GroupContainerIdentifiers);
SAME_COMMAND(systemContainerPath, SystemContainerPath);
SAME_COMMAND(systemGroupContainerPaths, SystemGroupContainerPaths);
SAME_COMMAND(systemGroupContainerPath, SystemGroupContainerPath);
SAME_COMMAND(processCodeSigningInfo, ProcessCodeSigningInfo);
SAME_COMMAND(codeSigningInfoForIdentifier, CodeSigningInfoForIdentifier);
SAME_COMMAND(invalidateCodeSigningInfoForAppsWithoutBundleContainer,
             InvalidateCodeSigningInfoForAppsWithoutBundleContainer);
SAME_COMMAND(setDataProtection, SetDataProtection);
SAME_COMMAND(recreateContainerStructure, RecreateContainerStructure);
SAME_COMMAND(diskUsage, DiskUsage);
SAME_COMMAND(performDataMigration, PerformDataMigration);
SAME_COMMAND(retryTest, RetryTest);
SAME_COMMAND(stageSharedContent, StageSharedContent);
SAME_COMMAND(setNetworkExtension, SetNetworkExtension);
SAME_COMMAND(userManagedAssetsPath, UserManagedAssetsPath);
SAME_COMMAND(deleteUserManagedAsset, DeleteUserManagedAsset);
SAME_COMMAND(verify, Verify);
SAME_COMMAND(status, Status);
SAME_COMMAND(metrics, Metrics);
SAME_COMMAND(setLogLevel, SetLogLevel);
#undef SAME_COMMAND
static_assert(static_cast<uint64_t>(Command::deleteUserManagedAsset) + 1 == QRTCommandCount, "a command is missing");

Request::Request(Command command) { u64(QRTKeyCommand, static_cast<uint64_t>(command)); }

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
uint64_t Reply::error() const { return u64(QRTReplyKeyError); }

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
  return r.u64(QRTKeyUserID, c.userId)
      .u64(QRTKeyContainerClass, c.containerClass)
      .string(QRTKeyIdentifier, c.identifier)
      .uuid(QRTKeyUUID, c.uuid);
}

Result onContainer(Connection& c, Command command, const ContainerRef& container) {
  Request r(command);
  return perform(c, addContainer(r, container));
}

}  // namespace

Result createOrLookupContainer(Connection& c, uint64_t userId, std::optional<std::string> identifier,
                               uint64_t containerClass, bool createIfNecessary, bool transient) {
  return perform(c, Request(Command::createOrLookupContainer)
                        .u64(QRTKeyUserID, userId)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, containerClass)
                        .boolean(QRTKeyCreateIfNecessary, createIfNecessary)
                        .boolean(QRTKeyTransient, transient));
}

Result containersForUser(Connection& c, uint64_t userId, uint64_t containerClass, bool transient) {
  return perform(c, Request(Command::containersForUser)
                        .u64(QRTKeyUserID, userId)
                        .u64(QRTKeyContainerClass, containerClass)
                        .boolean(QRTKeyTransient, transient));
}

Result replaceContainer(Connection& c, const std::optional<ContainerRef>& old, const ContainerRef& replacement) {
  Request r(Command::replaceContainer);
  if (old) {
    r.uuid(QRTKeyOldContainerUUID, old->uuid)
        .u64(QRTKeyOldContainerUserID, old->userId)
        .u64(QRTKeyOldContainerClass, old->containerClass)
        .string(QRTKeyOldIdentifier, old->identifier);
  }
  r.uuid(QRTKeyNewContainerUUID, replacement.uuid)
      .u64(QRTKeyNewContainerUserID, replacement.userId)
      .u64(QRTKeyNewContainerClass, replacement.containerClass)
      .string(QRTKeyNewIdentifier, replacement.identifier);
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
                        .array(QRTKeyUserIDsArray, std::move(users))
                        .array(QRTKeyUUIDsArray, std::move(uuidArray))
                        .array(QRTKeyIdentifiersArray, std::move(ids))
                        .array(QRTKeyContainerClassesArray, std::move(classArray)));
}

Result deleteContainersOnDeathRow(Connection& c) { return perform(c, Request(Command::deleteContainersOnDeathRow)); }

Result setInfoValue(Connection& c, const ContainerRef& container, const std::string& key,
                    const std::optional<plist::Value>& value) {
  Request r(Command::setInfoValue);
  addContainer(r, container).string(QRTKeyKey, key);
  if (value) r.value(QRTKeyValue, *value);
  return perform(c, r);
}

Result infoValueForKey(Connection& c, const ContainerRef& container, const std::string& key) {
  Request r(Command::infoValueForKey);
  return perform(c, addContainer(r, container).string(QRTKeyKey, key));
}

Result metadataForContainer(Connection& c, const ContainerRef& container, bool infoDictRequested) {
  Request r(Command::metadataForContainer);
  return perform(c, addContainer(r, container).boolean(QRTKeyInfoDictRequested, infoDictRequested));
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
                        .u64(QRTKeyUserID, userId)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, containerClass)
                        .boolean(QRTKeyTransient, transient));
}

Result wipeAddonDataContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  // The daemon works on class 4 whatever is sent; sending it keeps the
  // message self-describing.
  return perform(c, Request(Command::wipeAddonDataContainer)
                        .u64(QRTKeyUserID, userId)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, 4));
}

Result deleteDataContainerContent(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                                  uint64_t containerClass) {
  return perform(c, Request(Command::deleteDataContainerContent)
                        .u64(QRTKeyUserID, userId)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, containerClass));
}

Result groupContainerPaths(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  return perform(c,
                 Request(Command::groupContainerPaths).u64(QRTKeyUserID, userId).string(QRTKeyIdentifier, identifier));
}

Result groupContainerIdentifiers(Connection& c, uint64_t userId, const std::optional<std::string>& identifier) {
  return perform(
      c, Request(Command::groupContainerIdentifiers).u64(QRTKeyUserID, userId).string(QRTKeyIdentifier, identifier));
}

Result systemContainerPath(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemContainerPath).string(QRTKeyIdentifier, identifier));
}

Result systemGroupContainerPaths(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemGroupContainerPaths).string(QRTKeyIdentifier, identifier));
}

Result systemGroupContainerPath(Connection& c, const std::string& groupIdentifier,
                                const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::systemGroupContainerPath)
                        .string(QRTKeyGroupIdentifier, groupIdentifier)
                        .string(QRTKeyIdentifier, identifier));
}

Result processCodeSigningInfo(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<plist::Value>& codeSigningInfo,
                              const std::optional<plist::Value>& options) {
  Request r(Command::processCodeSigningInfo);
  r.string(QRTKeyIdentifier, identifier);
  if (codeSigningInfo) r.value("CodeSigningInfo", *codeSigningInfo);
  if (options) r.value("OptionsDictionary", *options);
  return perform(c, r);
}

Result codeSigningInfoForIdentifier(Connection& c, const std::optional<std::string>& identifier) {
  return perform(c, Request(Command::codeSigningInfoForIdentifier).string(QRTKeyIdentifier, identifier));
}

Result invalidateCodeSigningInfoForAppsWithoutBundleContainer(Connection& c) {
  return perform(c, Request(Command::invalidateCodeSigningInfoForAppsWithoutBundleContainer));
}

Result setDataProtection(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                         uint64_t containerClass, int64_t dataProtectionClass, bool isThirdParty, bool retryIfLocked) {
  return perform(c, Request(Command::setDataProtection)
                        .u64(QRTKeyUserID, userId)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, containerClass)
                        .i64(QRTKeyDataProtectionClass, dataProtectionClass)
                        .boolean(QRTKeyIsThirdParty, isThirdParty)
                        .boolean(QRTKeyRetryIfLocked, retryIfLocked));
}

Result recreateContainerStructure(Connection& c, const ContainerRef& container) {
  return onContainer(c, Command::recreateContainerStructure, container);
}

Result diskUsage(Connection& c, const ContainerRef& container) { return onContainer(c, Command::diskUsage, container); }

Result performDataMigration(Connection& c) { return perform(c, Request(Command::performDataMigration)); }

Result retryTest(Connection& c, uint64_t userId, uint64_t numRetryCrashes) {
  return perform(c, Request(Command::retryTest).u64(QRTKeyUserID, userId).u64(QRTKeyNumRetryCrashes, numRetryCrashes));
}

Result stageSharedContent(Connection& c, const std::optional<std::string>& identifier,
                          const std::optional<std::string>& sourcePath, const std::optional<std::string>& destPath) {
  return perform(c, Request(Command::stageSharedContent)
                        .string(QRTKeyIdentifier, identifier)
                        .string(QRTKeySourcePath, sourcePath)
                        .string(QRTKeyDestPath, destPath));
}

Result setNetworkExtension(Connection& c, const std::optional<std::string>& identifier, uint64_t containerClass) {
  return perform(c, Request(Command::setNetworkExtension)
                        .string(QRTKeyIdentifier, identifier)
                        .u64(QRTKeyContainerClass, containerClass));
}

Result userManagedAssetsPath(Connection& c, const std::optional<std::string>& identifier, bool isRelative) {
  return perform(c, Request(Command::userManagedAssetsPath)
                        .string(QRTKeyIdentifier, identifier)
                        .boolean(QRTKeyIsRelative, isRelative));
}

Result deleteUserManagedAsset(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<std::string>& relativePath) {
  return perform(c, Request(Command::deleteUserManagedAsset)
                        .string(QRTKeyIdentifier, identifier)
                        .string(QRTKeySourcePath, relativePath));
}

Result status(Connection& c) { return perform(c, Request(Command::status)); }

Result metrics(Connection& c) { return perform(c, Request(Command::metrics)); }

Result setLogLevel(Connection& c, uint64_t level) {
  return perform(c, Request(Command::setLogLevel).u64(QRTKeyLogLevel, level));
}

Result verify(Connection& c, bool repair) {
  Request request(Command::verify);
  if (repair) request.boolean(QRTKeyRepair, true);
  return perform(c, request);
}

}  // namespace quarterkit
