#include "Daemon/store/QRTMetadata.h"

#include <cerrno>

#include "Daemon/store/QRTContentClass.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "base/PlistCodec.h"

namespace {

// The value found under a key as a message shows it; "(null)" when missing.
std::string describeValue(const plist::Value* value) { return value ? plist::describe(*value) : "(null)"; }

// The directory in which a container of the class must lie, derived from the
// container's own path: the store root three levels up plus the class's path name.
QRTURL expectedClassDirectory(const QRTURL& containerURL, uint64_t containerClass) {
  QRTURL storeRoot =
      containerURL.URLByDeletingLastPathComponent().URLByDeletingLastPathComponent().URLByDeletingLastPathComponent();
  return storeRoot.URLByAppendingPathComponent(QRTContentClassPathName(containerClass), true);
}

}  // namespace

QRTMetadata::QRTMetadata(uint32_t uid, QRTUUID uuid, uint64_t containerClass, std::string identifier,
                         std::optional<plist::Dictionary> info, QRTURL url,
                         std::optional<std::string> userManagedAssetsDirName, bool transient)
    : transient_(transient),
      uid_(uid),
      identifier_(std::move(identifier)),
      uuid_(uuid),
      url_(std::move(url)),
      userManagedAssetsDirName_(std::move(userManagedAssetsDirName)),
      info_(std::move(info)),
      containerClass_(containerClass) {}

#define QRT_METADATA_WITH(field, value)             \
  auto copy = std::make_shared<QRTMetadata>(*this); \
  copy->field = (value);                            \
  return copy

QRTMetadataRef QRTMetadata::withTransient(bool transient) const { QRT_METADATA_WITH(transient_, transient); }
QRTMetadataRef QRTMetadata::withExisted(bool existed) const { QRT_METADATA_WITH(existed_, existed); }
QRTMetadataRef QRTMetadata::withUuid(const QRTUUID& uuid) const { QRT_METADATA_WITH(uuid_, uuid); }
QRTMetadataRef QRTMetadata::withUrl(const QRTURL& url) const { QRT_METADATA_WITH(url_, url); }
QRTMetadataRef QRTMetadata::withInfo(std::optional<plist::Dictionary> info) const {
  QRT_METADATA_WITH(info_, std::move(info));
}
QRTMetadataRef QRTMetadata::withUserManagedAssetsDirName(std::optional<std::string> name) const {
  QRT_METADATA_WITH(userManagedAssetsDirName_, std::move(name));
}

#undef QRT_METADATA_WITH

QRTMetadataRef QRTMetadata::withUrl(const QRTURL& url, bool transient) const {
  auto copy = std::make_shared<QRTMetadata>(*this);
  copy->url_ = url;
  copy->transient_ = transient;
  return copy;
}

plist::Dictionary QRTMetadata::dictionaryRepresentation() const {
  plist::Dictionary dictionary;
  if (info_) dictionary[QRTMetadataInfoKey] = *info_;
  dictionary[QRTMetadataContentClassKey] = plist::Value(containerClass_);
  dictionary[QRTMetadataPersonaKey] = plist::Value(uid_);
  dictionary[QRTMetadataIdentifierKey] = identifier_;
  dictionary[QRTMetadataUUIDKey] = uuid_.UUIDString();
  if (userManagedAssetsDirName_) dictionary[QRTMetadataUserManagedAssetsDirNameKey] = *userManagedAssetsDirName_;
  return dictionary;
}

namespace {

// Counts objects as the reader does (every value and every dictionary key,
// shared ones once per use) and the bytes of strings and data, and stops
// early once over the budget.
bool withinBudget(const plist::Value& value, size_t depth, size_t* objects, size_t* bytes) {
  if (++*objects > QRTMetadataMaxObjects || depth > QRTMetadataMaxDepth) return false;
  if (const std::string* s = value.stringIf()) *bytes += s->size();
  if (value.isData()) *bytes += value.data().size();
  if (*bytes > QRTMetadataMaxEncodedBytes) return false;
  if (value.isArray()) {
    for (const plist::Value& element : value.array()) {
      if (!withinBudget(element, depth + 1, objects, bytes)) return false;
    }
  } else if (value.isDictionary()) {
    for (const auto& [key, element] : value.dictionary()) {
      *bytes += key.size();
      if (++*objects > QRTMetadataMaxObjects || !withinBudget(element, depth + 1, objects, bytes)) return false;
    }
  }
  return true;
}

bool withinBudget(const plist::Value& whole) {
  size_t objects = 0, bytes = 0;
  return withinBudget(whole, 1, &objects, &bytes);
}

// The metadata file, read with the bounds it is written with.
std::optional<plist::Dictionary> readMetadataFile(const QRTURL& file, QRTErrorRef* error) {
  const plist::Limits limits{QRTMetadataMaxDepth, QRTMetadataMaxObjects, plist::kMaxFootprint,
                             QRTMetadataMaxEncodedBytes};
  auto dictionary = QRT_dictionaryWithContentsOfURL(file, QRTMetadataMaxEncodedBytes, limits, error);
  if (dictionary && !withinBudget(plist::Value(*dictionary))) {
    QRTSetError(error, QRT_POSIX_ERROR(EFBIG, "Metadata at %@ expands past its bounds", file));
    return std::nullopt;
  }
  return dictionary;
}

}  // namespace

bool QRTMetadata::writeMetadataToDiskWithError(QRTErrorRef* error, const platform::Dir* container) const {
  plist::Dictionary dictionary = dictionaryRepresentation();
  const plist::Value whole(dictionary);
  if (!withinBudget(whole) || plist::writeBinary(whole).size() > QRTMetadataMaxEncodedBytes) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, true,
                                 "Metadata for %@ at %@ would exceed %llu bytes, %llu objects or %llu levels",
                                 identifier_, url_, static_cast<unsigned long long>(QRTMetadataMaxEncodedBytes),
                                 static_cast<unsigned long long>(QRTMetadataMaxObjects),
                                 static_cast<unsigned long long>(QRTMetadataMaxDepth)));
    return false;
  }
  QRTErrorRef writeError;
  const QRTURL file = url_.URLByAppendingPathComponent(QRTMetadataFileName);
  const QRTWriteOptions options = QRTWriteAtomic | QRTWriteFileProtectionNone;
  if (container ? !QRT_writeToDirectory(dictionary, *container, QRTMetadataFileName, file, options, &writeError)
                : !QRT_writeToURL(dictionary, file, options, &writeError)) {
    QRTSetError(
        error, QRT_ERROR(QRTErrorWriteFailed, writeError, true, "Failed to write metadata dictionary to URL %@", url_));
    return false;
  }
  return true;
}

bool QRTMetadata::rewriteUUIDAtUrl(const QRTURL& url, const QRTUUID& uuid, QRTErrorRef* error) {
  const QRTURL file = url.URLByAppendingPathComponent(QRTMetadataFileName);
  QRTErrorRef underlying;
  std::optional<plist::Dictionary> dictionary = readMetadataFile(file, &underlying);
  if (!dictionary) {
    QRTSetError(error, QRT_ERROR(QRTErrorReadFailed, underlying, true, "Failed to read metadata at URL %@", url));
    return false;
  }
  const plist::Value* current = plist::find(*dictionary, QRTMetadataUUIDKey);
  if (current && current->isString() && current->string() == uuid.UUIDString()) return true;
  (*dictionary)[QRTMetadataUUIDKey] = uuid.UUIDString();
  if (!QRT_writeToURL(*dictionary, file, QRTWriteAtomic | QRTWriteFileProtectionNone, &underlying)) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorWriteFailed, underlying, true, "Failed to write metadata dictionary to URL %@", url));
    return false;
  }
  return true;
}

#define QRT_INVALID_METADATA(...)                                                       \
  do {                                                                                  \
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidMetadata, nullptr, true, __VA_ARGS__)); \
    return nullptr;                                                                     \
  } while (0)

std::shared_ptr<QRTMetadata> QRTMetadata::readAndValidateMetadataAtUrl(const QRTURL& url, uint32_t forUser,
                                                                       bool checkClassPath, QRTErrorRef* error) {
  QRTErrorRef readError;
  std::optional<plist::Dictionary> dictionary =
      readMetadataFile(url.URLByAppendingPathComponent(QRTMetadataFileName), &readError);
  if (!dictionary) {
    QRTSetError(error, QRT_ERROR(QRTErrorReadFailed, readError, true, "Failed to read metadata at URL %@", url));
    return nullptr;
  }

  const plist::Value* identifier = plist::find(*dictionary, QRTMetadataIdentifierKey);
  if (!identifier || !identifier->isString())
    QRT_INVALID_METADATA("Invalid metadata Identifier: %@ at %@", describeValue(identifier), url);

  const plist::Value* uuidString = plist::find(*dictionary, QRTMetadataUUIDKey);
  if (!uuidString || !uuidString->isString())
    QRT_INVALID_METADATA("Invalid metadata UUID String: %@ at %@", describeValue(uuidString), url);
  std::optional<QRTUUID> uuid = QRTUUID::fromString(uuidString->string());
  if (!uuid) QRT_INVALID_METADATA("Invalid metadata UUID: %@ at %@", uuid, url);

  const plist::Value* classValue = plist::find(*dictionary, QRTMetadataContentClassKey);
  if (!classValue || !classValue->isInteger())
    QRT_INVALID_METADATA("Invalid metadata Class: %@ at %@", describeValue(classValue), url);
  const uint64_t containerClass = classValue->integer().asUnsigned();
  if (containerClass < QRTClassAppBundle || containerClass > QRTClassSystemGroup)
    QRT_INVALID_METADATA("Invalid metadata Content Class: %ld at %@", static_cast<long>(containerClass), url);

  // Older files carry no owner. Their owner defaults to the expected user
  // (501 for a per-user class, 33 for a bundle class) or stays unknown; either
  // way nothing is left to compare, so only a recorded owner is checked.
  const plist::Value* persona = plist::find(*dictionary, QRTMetadataPersonaKey);
  if (persona && (!persona->isInteger() || persona->integer().asUnsigned() != forUser))
    QRT_INVALID_METADATA("Incorrect UserId: %@, expecting: %u for %@ at %@", describeValue(persona), forUser,
                         identifier->string(), url);

  const plist::Value* info = plist::find(*dictionary, QRTMetadataInfoKey);
  if (info && !info->isDictionary()) QRT_INVALID_METADATA("Invalid metadata Info: %@ at %@", describeValue(info), url);

  const plist::Value* assetsDirName = plist::find(*dictionary, QRTMetadataUserManagedAssetsDirNameKey);
  if (assetsDirName && !assetsDirName->isString())
    QRT_INVALID_METADATA("Invalid metadata User Managed Dir Name String: %@ at %@", describeValue(assetsDirName), url);

  if (checkClassPath) {
    QRTURL expected = expectedClassDirectory(url, containerClass);
    if (expected.path() != url.URLByDeletingLastPathComponent().path())
      QRT_INVALID_METADATA("Invalid metadata-URLs should match: %@ : %@", url, expected);
  }

  return std::make_shared<QRTMetadata>(
      forUser, *uuid, containerClass, identifier->string(),
      info ? std::optional<plist::Dictionary>(info->dictionary()) : std::nullopt, url,
      assetsDirName ? std::optional<std::string>(assetsDirName->string()) : std::nullopt);
}

#undef QRT_INVALID_METADATA

std::string QRTMetadata::description() const {
  return QRTFormat("<QRTMetadata identifier: %@, class: %llu, uid: %u, uuid: %@, url: %@, transient: %d, existed: %d>",
                   identifier_, static_cast<unsigned long long>(containerClass_), uid_, uuid_, url_, transient_,
                   existed_);
}
