// Error values of the daemon: a domain, a numeric code from one table, where
// the error arose, a formatted description and the error that caused it.
#pragma once

#include <cstdint>
#include <exception>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/PlistValue.h"
#include "base/QRTFormat.h"

inline constexpr const char* QRTErrorDomain = "QRTErrorDomain";
inline constexpr const char* QRTPOSIXErrorDomain = "QRTPOSIXErrorDomain";
inline constexpr const char* QRTPropertyListErrorDomain = "QRTPropertyListErrorDomain";
inline constexpr const char* QRTLocalizedDescriptionKey = "QRTLocalizedDescription";
inline constexpr const char* QRTUnderlyingErrorKey = "QRTUnderlyingError";

enum QRTErrorCode : uint64_t {
  QRTErrorNone = 1,
  QRTErrorMoveAsideFailed = 4,
  QRTErrorRemoveTransientFailed = 5,
  QRTErrorCreateSubdirectoryFailed = 6,
  QRTErrorCreateStagingFailed = 7,
  QRTErrorMoveStagingToLiveFailed = 8,
  QRTErrorRemoveStagingFailed = 9,
  QRTErrorInvalidPath = 10,
  QRTErrorInvalidParameter = 11,
  QRTErrorReadFailed = 12,
  QRTErrorMoveToStagingFailed = 14,
  QRTErrorReplaceFailed = 15,
  QRTErrorDestroyFailed = 17,
  QRTErrorNilIdentifier = 18,
  QRTErrorNotFound = 21,
  QRTErrorReplaceSameContainer = 22,
  QRTErrorReplaceClassMismatch = 23,
  QRTErrorInfoValueNotFound = 24,
  QRTErrorAlreadyExists = 27,
  QRTErrorDeleteFailed = 28,
  QRTErrorInvalidMetadata = 29,
  QRTErrorInvalidReplaceInfo = 33,
  QRTErrorWriteFailed = 34,
  QRTErrorReplaceJournalFailed = 35,
  QRTErrorRemoveItemFailed = 36,
  QRTErrorInvalidArgument = 38,
  QRTErrorException = 40,
  QRTErrorDeathRowFailed = 41,
  QRTErrorCacheRebuildFailed = 43,
  QRTErrorCacheInconsistent = 44,
  QRTErrorCacheAddFailed = 45,
  QRTErrorCacheRemoveFailed = 46,
  QRTErrorCacheInvalidInput = 47,
  QRTErrorMoveToNewUUIDFailed = 48,
  QRTErrorInvalidRequest = 49,
  QRTErrorNotEntitled = 55,
  QRTErrorReplaceUserMismatch = 56,
  QRTErrorCodeSigningInputMismatch = 60,
  QRTErrorProtectionLockedNoRetry = 61,
  QRTErrorChangeOwnerFailed = 62,
  QRTErrorACLFailed = 63,
  QRTErrorStageSharedMoveFailed = 64,
  QRTErrorDatabase = 66,
  QRTErrorNotInDatabase = 67,
  QRTErrorUnexpectedChangeCount = 68,
  QRTErrorSuperseded = 69,
};

class QRTError;
using QRTErrorRef = std::shared_ptr<const QRTError>;

class QRTError {
 public:
  QRTError(std::string domain, int32_t code, plist::Dictionary userInfo, QRTErrorRef underlying)
      : domain_(std::move(domain)), code_(code), userInfo_(std::move(userInfo)), underlying_(std::move(underlying)) {}

  const std::string& domain() const { return domain_; }
  int32_t code() const { return code_; }
  // The code as the request layer reports it (sign-extended).
  uint64_t resultCode() const { return static_cast<uint64_t>(static_cast<int64_t>(code_)); }
  // Description, "FunctionName" and "SourceFileLine" (and whatever the maker
  // started from); the underlying error is held apart.
  const plist::Dictionary& userInfo() const { return userInfo_; }
  const QRTErrorRef& underlying() const { return underlying_; }
  std::optional<std::string> localizedDescription() const;
  // "QRTErrorDomain 21: No Container with userId: 501" (no colon part without a description)
  std::string description() const;

 private:
  std::string domain_;
  int32_t code_;
  plist::Dictionary userInfo_;
  QRTErrorRef underlying_;
};

QRTErrorRef QRTCreateErrorArgs(const char* function, int line, const std::string& domain, int32_t code,
                               QRTErrorRef underlying, const plist::Dictionary* userInfo, bool log, const char* format,
                               std::initializer_list<QRTFormatArg> args);

template <typename... Args>
QRTErrorRef QRTCreateError(const char* function, int line, const std::string& domain, int32_t code,
                           QRTErrorRef underlying, const plist::Dictionary* userInfo, bool log, const char* format,
                           const Args&... args) {
  return QRTCreateErrorArgs(function, line, domain, code, std::move(underlying), userInfo, log, format,
                            {QRTFormatArg(args)...});
}

// POSIX-domain error: code = errno value; no log line, no causing error.
template <typename... Args>
QRTErrorRef QRTCreatePOSIXError(const char* function, int line, int errnum, const char* format, const Args&... args) {
  return QRTCreateErrorArgs(function, line, QRTPOSIXErrorDomain, errnum, nullptr, nullptr, false, format,
                            {QRTFormatArg(args)...});
}

// The usual forms, with the calling function and line filled in.
#define QRT_ERROR(code, underlying, log, ...) \
  QRTCreateError(__func__, __LINE__, QRTErrorDomain, (code), (underlying), nullptr, (log), __VA_ARGS__)
#define QRT_POSIX_ERROR(errnum, ...) QRTCreatePOSIXError(__func__, __LINE__, (errnum), __VA_ARGS__)

// Stores an error into an optional slot.
inline void QRTSetError(QRTErrorRef* slot, QRTErrorRef error) {
  if (slot) *slot = std::move(error);
}

// Writes the fatal report (log at level 3 and standard error) and aborts.
[[noreturn]] void QRTReportUncaughtException(const std::exception& e);
[[noreturn]] void QRTReportUncaughtException(const std::string& name, const std::string& reason);

// The exception guard of every public operation. Called inside a catch
// block: the exception in flight becomes error 40 ("Got exception: %@ : %@"),
// or on an internal build the fatal report.
QRTErrorRef QRTErrorForCurrentException(const char* function, int line);
#define QRT_EXCEPTION_ERROR() QRTErrorForCurrentException(__func__, __LINE__)

// Runs body under the guard; the error, or nullptr when body did not throw.
QRTErrorRef QRTGuardedCall(const char* function, int line, const std::function<void()>& body);
#define QRT_GUARD(body) QRTGuardedCall(__func__, __LINE__, (body))
