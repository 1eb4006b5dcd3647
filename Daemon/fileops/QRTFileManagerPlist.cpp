// Property-list files: a dictionary written whole (atomically or in place)
// and read back within size and shape limits, through the safe primitives.
#include <cerrno>
#include <new>
#include <string>
#include <utility>

#include "Daemon/fileops/QRTFileManager.h"
#include "base/PlistCodec.h"
#include "base/QRTFormat.h"
#include "platform/Dir.h"
#include "platform/SafePath.h"

namespace {

// Property-list files are small; anything beyond this is not one of ours.
constexpr size_t kMaxPropertyListFileSize = 64 << 20;

int writeEncoded(const plist::Data& bytes, const platform::Dir& directory, std::string_view name,
                 QRTWriteOptions withOptions) {
  // A fresh temporary carries no protection class, so an atomic write needs
  // nothing more for QRTWriteFileProtectionNone.
  if (withOptions & QRTWriteAtomic) return directory.replaceFile(name, bytes.data(), bytes.size(), 0644);
  return directory.writeFileInPlace(name, bytes.data(), bytes.size(), (withOptions & QRTWriteFileProtectionNone) != 0);
}

}  // namespace

bool QRT_writeToURL(const plist::Dictionary& dictionary, const QRTURL& url, QRTWriteOptions withOptions,
                    QRTErrorRef* error) {
  plist::Data bytes;
  int err = 0;
  try {
    bytes = plist::writeBinary(plist::Value(dictionary));
  } catch (const std::bad_alloc&) { err = ENOMEM; }
  platform::Dir parent;
  std::string name;
  if (!err) err = platform::Dir::openParent(url.path(), &parent, &name);
  if (!err) err = writeEncoded(bytes, parent, name, withOptions);
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to write property list to %@: %s", url, errorText(err)));
    return false;
  }
  return true;
}

bool QRT_writeToDirectory(const plist::Dictionary& dictionary, const platform::Dir& directory, std::string_view name,
                          const QRTURL& url, QRTWriteOptions withOptions, QRTErrorRef* error) {
  plist::Data bytes;
  int err = 0;
  try {
    bytes = plist::writeBinary(plist::Value(dictionary));
  } catch (const std::bad_alloc&) { err = ENOMEM; }
  if (!err) err = writeEncoded(bytes, directory, name, withOptions);
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to write property list to %@: %s", url, errorText(err)));
    return false;
  }
  return true;
}

std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, QRTErrorRef* error) {
  return QRT_dictionaryWithContentsOfURL(url, kMaxPropertyListFileSize, plist::Limits{}, error);
}

std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, size_t maxBytes,
                                                                 const plist::Limits& limits, QRTErrorRef* error) {
  std::string bytes;
  if (int err = platform::safeReadFile(url.path(), &bytes, maxBytes)) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to read property list at %@: %s", url, errorText(err)));
    return std::nullopt;
  }
  std::string reason;
  std::optional<plist::Value> value =
      plist::parse(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), &reason, limits);
  if (!value) {
    QRTSetError(error,
                QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTPropertyListReadCorruptError, nullptr,
                               nullptr, false, "Failed to parse property list at %@: %s", url, reason.c_str()));
    return std::nullopt;
  }
  if (!value->isDictionary()) {
    QRTSetError(error, QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTFormattingError, nullptr,
                                      nullptr, false, "Property list at %@ is not a dictionary", url));
    return std::nullopt;
  }
  return std::move(value->dictionary());
}
