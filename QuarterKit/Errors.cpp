#include "QuarterKit/Errors.h"

namespace qk {

namespace {

struct ErrorRow {
  uint64_t code;
  const char* name;
  const char* text;
};

const ErrorRow kErrors[] = {
    {1, "QRTErrorNone", "success"},
    {4, "QRTErrorMoveAsideFailed", "could not move the item aside"},
    {5, "QRTErrorRemoveTransientFailed", "could not remove the transient container"},
    {6, "QRTErrorCreateSubdirectoryFailed", "could not create a sub-directory"},
    {7, "QRTErrorCreateStagingFailed", "could not create the staging directory"},
    {8, "QRTErrorMoveStagingToLiveFailed", "could not move the new container into place"},
    {9, "QRTErrorRemoveStagingFailed", "could not remove the staging directory"},
    {10, "QRTErrorInvalidPath", "invalid path"},
    {11, "QRTErrorInvalidParameter", "invalid parameter"},
    {12, "QRTErrorReadFailed", "could not read the file"},
    {14, "QRTErrorMoveToStagingFailed", "could not move the old container to staging"},
    {15, "QRTErrorReplaceFailed", "replace failed"},
    {17, "QRTErrorDestroyFailed", "could not destroy the item"},
    {18, "QRTErrorNilIdentifier", "no identifier given"},
    {21, "QRTErrorNotFound", "no such container"},
    {22, "QRTErrorReplaceSameContainer", "old and new are the same container"},
    {23, "QRTErrorReplaceClassMismatch", "containers of different classes"},
    {24, "QRTErrorInfoValueNotFound", "no such info value"},
    {27, "QRTErrorAlreadyExists", "already exists"},
    {28, "QRTErrorDeleteFailed", "delete failed"},
    {29, "QRTErrorInvalidMetadata", "invalid metadata"},
    {33, "QRTErrorInvalidReplaceInfo", "invalid replace information"},
    {34, "QRTErrorWriteFailed", "could not write the file"},
    {35, "QRTErrorReplaceJournalFailed", "replace journal failed"},
    {36, "QRTErrorRemoveItemFailed", "could not remove the item"},
    {38, "QRTErrorInvalidArgument", "invalid argument"},
    {40, "QRTErrorException", "exception inside the daemon"},
    {41, "QRTErrorDeathRowFailed", "could not move to death row"},
    {43, "QRTErrorCacheRebuildFailed", "container cache rebuild failed"},
    {44, "QRTErrorCacheInconsistent", "container cache inconsistent"},
    {45, "QRTErrorCacheAddFailed", "could not add to the container cache"},
    {46, "QRTErrorCacheRemoveFailed", "could not remove from the container cache"},
    {47, "QRTErrorCacheInvalidInput", "invalid input to the container cache"},
    {48, "QRTErrorMoveToNewUUIDFailed", "could not move to the new UUID"},
    {49, "QRTErrorInvalidRequest", "invalid request"},
    {55, "QRTErrorNotEntitled", "not entitled"},
    {56, "QRTErrorReplaceUserMismatch", "containers of different users"},
    {60, "QRTErrorCodeSigningInputMismatch", "code-signing values and identifiers differ in number"},
    {61, "QRTErrorProtectionLockedNoRetry", "device locked, change not retried"},
    {62, "QRTErrorChangeOwnerFailed", "could not change the owner"},
    {63, "QRTErrorACLFailed", "ACL failed"},
    {64, "QRTErrorStageSharedMoveFailed", "could not move the shared content"},
    {66, "QRTErrorDatabase", "code-signing database error"},
    {67, "QRTErrorNotInDatabase", "not in the code-signing database"},
    {68, "QRTErrorUnexpectedChangeCount", "unexpected change count in the code-signing database"},
    {69, "QRTErrorSuperseded", "superseded by a newer protection change"},
};

const ErrorRow* find(uint64_t code) {
  for (const ErrorRow& row : kErrors)
    if (row.code == code) return &row;
  return nullptr;
}

}  // namespace

const char* errorText(uint64_t code) {
  const ErrorRow* row = find(code);
  return row ? row->text : nullptr;
}

const char* errorName(uint64_t code) {
  const ErrorRow* row = find(code);
  return row ? row->name : nullptr;
}

std::string describeResult(uint64_t code) {
  if (code == 1) return "ok";
  const char* text = errorText(code);
  std::string out = "error " + std::to_string(code);
  return text ? out + " (" + text + ")" : out;
}

}  // namespace qk
