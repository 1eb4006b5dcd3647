// The daemon's container classes and result codes, and what the codes mean
// for tools that show them to people.
#pragma once

#include <cstdint>
#include <string>

namespace quarterkit {

// The "ContainerClass" of a request. Bundle classes (1, 3, 5, 8) and 12, 13
// belong to fixed users; the others to the user who asks.
enum class ContainerClass : uint64_t {
  appBundle = 1,
  appData = 2,
  addonBundle = 3,
  addonData = 4,
  vpnBundle = 5,
  vpnData = 6,
  group = 7,
  frameworkBundle = 8,
  relayServiceData = 9,
  internalDaemonData = 10,
  tempDir = 11,
  system = 12,
  systemGroup = 13,
};

// "ReplyError" of a reply: 1 is success, every other value a failure.
enum class Error : uint64_t {
  none = 1,
  moveAsideFailed = 4,
  removeTransientFailed = 5,
  createSubdirectoryFailed = 6,
  createStagingFailed = 7,
  moveStagingToLiveFailed = 8,
  removeStagingFailed = 9,
  invalidPath = 10,
  invalidParameter = 11,
  readFailed = 12,
  moveToStagingFailed = 14,
  replaceFailed = 15,
  destroyFailed = 17,
  noIdentifier = 18,
  notFound = 21,
  replaceSameContainer = 22,
  replaceClassMismatch = 23,
  infoValueNotFound = 24,
  alreadyExists = 27,
  deleteFailed = 28,
  invalidMetadata = 29,
  invalidReplaceInfo = 33,
  writeFailed = 34,
  replaceJournalFailed = 35,
  removeItemFailed = 36,
  invalidArgument = 38,
  exception = 40,
  deathRowFailed = 41,
  cacheRebuildFailed = 43,
  cacheInconsistent = 44,
  cacheAddFailed = 45,
  cacheRemoveFailed = 46,
  cacheInvalidInput = 47,
  moveToNewUUIDFailed = 48,
  invalidRequest = 49,
  notEntitled = 55,
  replaceUserMismatch = 56,
  codeSigningInputMismatch = 60,
  protectionLockedNoRetry = 61,
  changeOwnerFailed = 62,
  aclFailed = 63,
  stageSharedMoveFailed = 64,
  database = 66,
  notInDatabase = 67,
  unexpectedChangeCount = 68,
  superseded = 69,
};

// A short lower-case text for a result code ("no such container" for 21);
// nullptr for a code the daemon does not send.
const char* errorText(uint64_t code);
inline const char* errorText(Error code) { return errorText(static_cast<uint64_t>(code)); }
// The code's name in the daemon's error table ("QRTErrorNotFound" for 21);
// nullptr for a code the daemon does not send.
const char* errorName(uint64_t code);
// "ok" for 1, "error 21 (no such container)", or "error N" for an unknown code.
std::string describeResult(uint64_t code);

}  // namespace quarterkit
