// The request protocol of quarterd, in one place: the command numbers, the
// keys of a request and of its reply, and the entitlements a command asks
// for. The daemon, QuarterKit, quarterctl and the tests all name them from
// here; the numbers and strings are what travels on the socket and never
// change.
#pragma once

#include <cstdint>

// "Command" of a request: the row of the daemon's command table.
enum QRTCommand : uint64_t {
  QRTCommandCreateOrLookupContainer = 0,
  QRTCommandContainersForUser = 1,
  QRTCommandReplaceContainer = 2,
  QRTCommandStageContainerForDelete = 3,
  QRTCommandDeleteContainersOnDeathRow = 4,
  QRTCommandSetInfoValue = 5,
  QRTCommandInfoValueForKey = 6,
  QRTCommandMetadataForContainer = 7,
  QRTCommandRecreateDefaultStructure = 8,
  QRTCommandRegenerateDirectoryUUID = 9,
  QRTCommandDeleteContainer = 10,
  QRTCommandWipeAddonDataContainer = 11,
  QRTCommandDeleteDataContainerContent = 12,
  QRTCommandGroupContainerPaths = 13,
  QRTCommandGroupContainerIdentifiers = 14,
  QRTCommandSystemContainerPath = 15,
  QRTCommandSystemGroupContainerPaths = 16,
  QRTCommandSystemGroupContainerPath = 17,
  QRTCommandProcessCodeSigningInfo = 18,
  QRTCommandCodeSigningInfoForIdentifier = 19,
  QRTCommandInvalidateCodeSigningInfoForAppsWithoutBundleContainer = 20,
  QRTCommandSetDataProtection = 21,
  QRTCommandRecreateContainerStructure = 22,
  QRTCommandDiskUsage = 23,
  QRTCommandPerformDataMigration = 24,
  QRTCommandRetryTest = 25,
  QRTCommandStageSharedContent = 26,
  QRTCommandSetNetworkExtension = 27,
  QRTCommandUserManagedAssetsPath = 28,
  QRTCommandDeleteUserManagedAsset = 29,
  // Administrative commands, numbered from 100 upward so that the table above
  // can grow without meeting them.
  QRTCommandVerify = 100,
  QRTCommandStatus = 101,
  QRTCommandMetrics = 102,
  QRTCommandSetLogLevel = 103,
};
// One past the last command of the main table; from there up to the first
// administrative command a request is invalid.
inline constexpr uint64_t QRTCommandCount = 30;
inline constexpr uint64_t QRTCommandFirstExtension = 100;

// Keys of a request.
inline constexpr const char* QRTKeyCommand = "Command";
inline constexpr const char* QRTKeyUserID = "UserID";
inline constexpr const char* QRTKeyContainerClass = "ContainerClass";
inline constexpr const char* QRTKeyIdentifier = "Identifier";
inline constexpr const char* QRTKeyUUID = "UUID";
inline constexpr const char* QRTKeyTransient = "Transient";
inline constexpr const char* QRTKeyCreateIfNecessary = "CreateIfNecessary";
inline constexpr const char* QRTKeyOldContainerUUID = "OldContainerUUID";
inline constexpr const char* QRTKeyOldContainerUserID = "OldContainerUserID";
inline constexpr const char* QRTKeyOldContainerClass = "OldContainerClass";
inline constexpr const char* QRTKeyOldIdentifier = "OldIdentifier";
inline constexpr const char* QRTKeyNewContainerUUID = "NewContainerUUID";
inline constexpr const char* QRTKeyNewContainerUserID = "NewContainerUserID";
inline constexpr const char* QRTKeyNewContainerClass = "NewContainerClass";
inline constexpr const char* QRTKeyNewIdentifier = "NewIdentifier";
inline constexpr const char* QRTKeyUserIDsArray = "UserIDsArray";
inline constexpr const char* QRTKeyUUIDsArray = "UUIDsArray";
inline constexpr const char* QRTKeyIdentifiersArray = "IdentifiersArray";
inline constexpr const char* QRTKeyContainerClassesArray = "ContainerClassesArray";
inline constexpr const char* QRTKeyKey = "Key";
inline constexpr const char* QRTKeyValue = "Value";
inline constexpr const char* QRTKeyInfoDictRequested = "InfoDictRequested";
inline constexpr const char* QRTKeyGroupIdentifier = "GroupIdentifier";
inline constexpr const char* QRTKeyDataProtectionClass = "DataProtectionClass";
inline constexpr const char* QRTKeyIsThirdParty = "IsThirdParty";
inline constexpr const char* QRTKeyRetryIfLocked = "RetryIfLocked";
inline constexpr const char* QRTKeyNumRetryCrashes = "NumRetryCrashes";
inline constexpr const char* QRTKeySourcePath = "SourcePath";
inline constexpr const char* QRTKeyDestPath = "DestPath";
inline constexpr const char* QRTKeyIsRelative = "IsRelative";
inline constexpr const char* QRTKeyLogLevel = "LogLevel";
inline constexpr const char* QRTKeyRepair = "Repair";

// Keys of a reply. "ReplyError" is in every reply: 1 is success.
inline constexpr const char* QRTReplyKeyError = "ReplyError";
inline constexpr const char* QRTReplyKeyPath = "ReplyPath";
inline constexpr const char* QRTReplyKeyIdentifier = "ReplyIdentifier";
inline constexpr const char* QRTReplyKeyUUID = "ReplyUUID";
inline constexpr const char* QRTReplyKeyExisted = "ReplyExisted";
inline constexpr const char* QRTReplyKeyTransient = "ReplyTransient";
inline constexpr const char* QRTReplyKeyUUIDsArray = "ReplyUUIDsArray";
inline constexpr const char* QRTReplyKeyIdsArray = "ReplyIdsArray";
inline constexpr const char* QRTReplyKeyInfoValue = "ReplyInfoValue";
inline constexpr const char* QRTReplyKeyInfoDictionary = "ReplyInfoDictionary";
inline constexpr const char* QRTReplyKeyGroupContainerDict = "ReplyGroupContainerDict";
inline constexpr const char* QRTReplyKeyGroupIdentifiersArray = "ReplyGroupIdentifiersArray";
inline constexpr const char* QRTReplyKeyDiskUsage = "ReplyDiskUsage";
inline constexpr const char* QRTReplyKeyStatus = "ReplyStatus";
inline constexpr const char* QRTReplyKeyLogLevel = "ReplyLogLevel";

// Keys inside "ReplyStatus" (commands 101 and 102). Latencies are in
// microseconds; "Buckets" (102 only) counts what took under 1 µs, then under
// 2, 4, 8 ... µs, the last everything longer.
inline constexpr const char* QRTStatusKeyUptime = "UptimeSeconds";
inline constexpr const char* QRTStatusKeyContainersPerClass = "ContainersPerClass";  // index: class
inline constexpr const char* QRTStatusKeyCachedContainers = "CachedContainers";
inline constexpr const char* QRTStatusKeyCacheBytes = "CacheBytes";
inline constexpr const char* QRTStatusKeyDeathRowItems = "DeathRowItems";
inline constexpr const char* QRTStatusKeyDeathRowBytes = "DeathRowBytes";
inline constexpr const char* QRTStatusKeyPendingProtection = "PendingProtectionUpdates";
inline constexpr const char* QRTStatusKeyIdentities = "IdentityEntries";
inline constexpr const char* QRTStatusKeyIdentitiesRefused = "IdentityFilesRefused";
inline constexpr const char* QRTStatusKeyLogLevel = "LogLevel";
inline constexpr const char* QRTStatusKeyRequests = "Requests";  // array of latency dictionaries
inline constexpr const char* QRTStatusKeyUpcalls = "Upcalls";    // one latency dictionary
inline constexpr const char* QRTStatusKeyCommand = "Command";
inline constexpr const char* QRTStatusKeyName = "Name";
inline constexpr const char* QRTStatusKeyServed = "Served";
inline constexpr const char* QRTStatusKeyFailed = "Failed";
inline constexpr const char* QRTStatusKeyP50 = "P50";
inline constexpr const char* QRTStatusKeyP99 = "P99";
inline constexpr const char* QRTStatusKeySum = "SumMicros";
inline constexpr const char* QRTStatusKeyBuckets = "Buckets";
// Command 100: the containers looked at, and one dictionary per finding with
// the keys below.
inline constexpr const char* QRTReplyKeyVerifiedContainers = "ReplyVerifiedContainers";
inline constexpr const char* QRTReplyKeyFindings = "ReplyFindings";
inline constexpr const char* QRTFindingKeyKind = "Kind";
inline constexpr const char* QRTFindingKeySeverity = "Severity";  // "error", "warning" or "notice"
inline constexpr const char* QRTFindingKeySubject = "Subject";
inline constexpr const char* QRTFindingKeyDetail = "Detail";
inline constexpr const char* QRTFindingKeyAction = "Action";
inline constexpr const char* QRTFindingKeyRepaired = "Repaired";

// Entitlements a command asks of its caller.
inline constexpr const char* QRTEntitlementNone = "com.norvane.private.QuarterKit.none";
inline constexpr const char* QRTEntitlementAllowed = "com.norvane.private.QuarterKit.allowed";
inline constexpr const char* QRTEntitlementOtherIdLookup = "com.norvane.private.QuarterKit.otherIdLookup";
inline constexpr const char* QRTEntitlementWipeContainer = "com.norvane.private.QuarterKit.wipeContainer";
inline constexpr const char* QRTEntitlementDataMigration = "com.norvane.private.QuarterKit.dataMigration";
inline constexpr const char* QRTEntitlementStageSharedContent = "com.norvane.private.QuarterKit.stageSharedContent";
inline constexpr const char* QRTEntitlementNetworkExtension = "com.norvane.private.QuarterKit.networkExtension";
inline constexpr const char* QRTEntitlementUserManagedAssets = "com.norvane.private.QuarterKit.userManagedAssets";
