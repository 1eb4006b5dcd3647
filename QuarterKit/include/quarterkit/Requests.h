// Typed requests and replies of quarterd: a builder that encodes each value
// the way the daemon reads it, a reply view with lenient typed getters, and
// one call per command of the command table.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include <quarterkit/Connection.h>
#include <quarterkit/Errors.h>
#include <quarterkit/PlistValue.h>
#include <quarterkit/UUID.h>

namespace quarterkit {

enum class Command : uint64_t {
  createOrLookupContainer = 0,
  containersForUser = 1,
  replaceContainer = 2,
  stageContainerForDelete = 3,
  deleteContainersOnDeathRow = 4,
  setInfoValue = 5,
  infoValueForKey = 6,
  metadataForContainer = 7,
  recreateDefaultStructure = 8,
  regenerateDirectoryUUID = 9,
  deleteContainer = 10,
  wipeAddonDataContainer = 11,
  deleteDataContainerContent = 12,
  groupContainerPaths = 13,
  groupContainerIdentifiers = 14,
  systemContainerPath = 15,
  systemGroupContainerPaths = 16,
  systemGroupContainerPath = 17,
  processCodeSigningInfo = 18,
  codeSigningInfoForIdentifier = 19,
  invalidateCodeSigningInfoForAppsWithoutBundleContainer = 20,
  setDataProtection = 21,
  recreateContainerStructure = 22,
  diskUsage = 23,
  performDataMigration = 24,
  retryTest = 25,
  stageSharedContent = 26,
  setNetworkExtension = 27,
  userManagedAssetsPath = 28,
  deleteUserManagedAsset = 29,
  // Administrative commands (the master entitlement).
  verify = 100,
  status = 101,
  metrics = 102,
  setLogLevel = 103,
};

// Builds one request message. Optional values that are absent leave their key
// out, which the daemon reads as "not given".
class Request {
 public:
  explicit Request(Command command);
  // Any message, as it is.
  explicit Request(plist::Dictionary message) : message_(std::move(message)) {}

  Request& u64(std::string_view key, uint64_t v);
  Request& i64(std::string_view key, int64_t v);
  Request& boolean(std::string_view key, bool v);
  Request& string(std::string_view key, std::string v);
  Request& string(std::string_view key, const char* v) { return string(key, std::string(v)); }
  Request& string(std::string_view key, const std::optional<std::string>& v);
  Request& uuid(std::string_view key, const UUID& v);
  Request& uuid(std::string_view key, const std::optional<UUID>& v);
  Request& array(std::string_view key, plist::Array v);
  Request& dictionary(std::string_view key, plist::Dictionary v);
  Request& value(std::string_view key, plist::Value v);

  const plist::Dictionary& message() const { return message_; }

 private:
  plist::Dictionary message_;
};

// 16-byte data, the wire form of a UUID.
plist::Value uuidValue(const UUID& uuid);

// A reply dictionary with getters that read a missing or mistyped key as 0,
// false or nothing, the way the daemon reads requests.
class Reply {
 public:
  explicit Reply(plist::Dictionary d) : reply_(std::move(d)) {}

  // "ReplyError"; 1 is success, 0 means the key was missing.
  uint64_t error() const;
  bool ok() const { return error() == 1; }
  Error result() const { return static_cast<Error>(error()); }

  uint64_t u64(std::string_view key) const;
  int64_t i64(std::string_view key) const;
  bool boolean(std::string_view key) const;
  std::optional<std::string> string(std::string_view key) const;
  std::optional<UUID> uuid(std::string_view key) const;
  const plist::Array* array(std::string_view key) const;
  const plist::Dictionary* dictionary(std::string_view key) const;
  const plist::Value* value(std::string_view key) const;
  // The strings / UUIDs of an array; elements of other types are skipped.
  std::vector<std::string> strings(std::string_view key) const;
  std::vector<UUID> uuids(std::string_view key) const;

  const plist::Dictionary& dictionary() const { return reply_; }

 private:
  plist::Dictionary reply_;
};

// Sends a request and waits for its reply, at most the connection's reply
// timeout; nothing when the connection closed or the time passed.
std::optional<Reply> perform(Connection& connection, const Request& request);

// Names one container: user, class, and identifier and/or UUID.
struct ContainerRef {
  uint64_t userId = 0;
  uint64_t containerClass = 0;
  std::optional<std::string> identifier;
  std::optional<UUID> uuid;
};

using Result = std::optional<Reply>;

// One call per command; an absent identifier leaves "Identifier" out, which
// most commands read as the caller's own identifier.
Result createOrLookupContainer(Connection& c, uint64_t userId, std::optional<std::string> identifier,
                               uint64_t containerClass, bool createIfNecessary, bool transient);
Result containersForUser(Connection& c, uint64_t userId, uint64_t containerClass, bool transient);
// No old container when `old` is absent.
Result replaceContainer(Connection& c, const std::optional<ContainerRef>& old, const ContainerRef& replacement);
Result stageContainerForDelete(Connection& c, const std::vector<uint64_t>& userIds, const std::vector<UUID>& uuids,
                               const std::vector<std::string>& identifiers, const std::vector<uint64_t>& classes);
Result deleteContainersOnDeathRow(Connection& c);
// An absent value leaves "Value" out, which removes the key.
Result setInfoValue(Connection& c, const ContainerRef& container, const std::string& key,
                    const std::optional<plist::Value>& value);
Result infoValueForKey(Connection& c, const ContainerRef& container, const std::string& key);
Result metadataForContainer(Connection& c, const ContainerRef& container, bool infoDictRequested);
Result recreateDefaultStructure(Connection& c, const ContainerRef& container);
Result regenerateDirectoryUUID(Connection& c, const ContainerRef& container);
Result deleteContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                       uint64_t containerClass, bool transient);
Result wipeAddonDataContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier);
Result deleteDataContainerContent(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                                  uint64_t containerClass);
Result groupContainerPaths(Connection& c, uint64_t userId, const std::optional<std::string>& identifier);
Result groupContainerIdentifiers(Connection& c, uint64_t userId, const std::optional<std::string>& identifier);
Result systemContainerPath(Connection& c, const std::optional<std::string>& identifier);
Result systemGroupContainerPaths(Connection& c, const std::optional<std::string>& identifier);
Result systemGroupContainerPath(Connection& c, const std::string& groupIdentifier,
                                const std::optional<std::string>& identifier);
Result processCodeSigningInfo(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<plist::Value>& codeSigningInfo,
                              const std::optional<plist::Value>& options);
Result codeSigningInfoForIdentifier(Connection& c, const std::optional<std::string>& identifier);
Result invalidateCodeSigningInfoForAppsWithoutBundleContainer(Connection& c);
Result setDataProtection(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                         uint64_t containerClass, int64_t dataProtectionClass, bool isThirdParty, bool retryIfLocked);
Result recreateContainerStructure(Connection& c, const ContainerRef& container);
Result diskUsage(Connection& c, const ContainerRef& container);
inline Result createOrLookupContainer(Connection& c, uint64_t userId, std::optional<std::string> identifier,
                                      ContainerClass containerClass, bool createIfNecessary, bool transient) {
  return createOrLookupContainer(c, userId, std::move(identifier), static_cast<uint64_t>(containerClass),
                                 createIfNecessary, transient);
}
inline Result containersForUser(Connection& c, uint64_t userId, ContainerClass containerClass, bool transient) {
  return containersForUser(c, userId, static_cast<uint64_t>(containerClass), transient);
}
inline Result deleteContainer(Connection& c, uint64_t userId, const std::optional<std::string>& identifier,
                              ContainerClass containerClass, bool transient) {
  return deleteContainer(c, userId, identifier, static_cast<uint64_t>(containerClass), transient);
}
Result performDataMigration(Connection& c);
Result retryTest(Connection& c, uint64_t userId, uint64_t numRetryCrashes);
Result stageSharedContent(Connection& c, const std::optional<std::string>& identifier,
                          const std::optional<std::string>& sourcePath, const std::optional<std::string>& destPath);
Result setNetworkExtension(Connection& c, const std::optional<std::string>& identifier, uint64_t containerClass);
Result userManagedAssetsPath(Connection& c, const std::optional<std::string>& identifier, bool isRelative);
Result deleteUserManagedAsset(Connection& c, const std::optional<std::string>& identifier,
                              const std::optional<std::string>& relativePath);
// The daemon's figures under "ReplyStatus"; metrics adds the latency buckets.
Result status(Connection& c);
Result metrics(Connection& c);
// Sets the daemon's log level (0 to 7; 7 logs every request); the reply's
// "ReplyLogLevel" is the level before.
Result setLogLevel(Connection& c, uint64_t level);
// Checks the store and, with repair, fixes what is safe to fix; the reply
// lists the findings.
Result verify(Connection& c, bool repair);

}  // namespace quarterkit
