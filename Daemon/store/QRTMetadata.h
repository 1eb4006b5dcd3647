// One container: the values of its metadata file (identifier, class, owner,
// internal UUID, info values, user-managed-assets directory name) plus its URL
// and two flags that are never written to disk.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/QRTError.h"
#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "base/QRTUUID.h"

namespace platform {
class Dir;
}

inline constexpr const char* QRTMetadataFileName = ".com.norvane.quarter_kit.metadata.plist";

inline constexpr const char* QRTMetadataIdentifierKey = "QRTMetadataIdentifier";
inline constexpr const char* QRTMetadataUUIDKey = "QRTMetadataUUID";
inline constexpr const char* QRTMetadataContentClassKey = "QRTMetadataContentClass";
inline constexpr const char* QRTMetadataPersonaKey = "QRTMetadataPersona";
inline constexpr const char* QRTMetadataInfoKey = "QRTMetadataInfo";
inline constexpr const char* QRTMetadataUserManagedAssetsDirNameKey = "QRTMetadataUserManagedAssetsDirName";

class QRTMetadata;
// Metadata is shared between requests only as immutable snapshots: a change
// makes a new object that replaces the cached one.
using QRTMetadataRef = std::shared_ptr<const QRTMetadata>;

// What a metadata file may hold, written and read alike: 1 MiB encoded, 1 MiB
// of strings and data counted as often as they are reached, 100,000 objects
// and 32 levels of nesting. A larger file is unreadable, so planted metadata
// costs no more memory than metadata made through requests.
inline constexpr size_t QRTMetadataMaxEncodedBytes = 1u << 20;
inline constexpr size_t QRTMetadataMaxObjects = 100'000;
inline constexpr size_t QRTMetadataMaxDepth = 32;

class QRTMetadata {
 public:
  QRTMetadata(uint32_t uid, QRTUUID uuid, uint64_t containerClass, std::string identifier,
              std::optional<plist::Dictionary> info, QRTURL url, std::optional<std::string> userManagedAssetsDirName,
              bool transient = false);

  bool transient() const { return transient_; }
  // Set only on the per-call copy that create-or-look-up hands out.
  bool existed() const { return existed_; }
  uint32_t uid() const { return uid_; }
  uint32_t userId() const { return uid_; }
  const std::string& identifier() const { return identifier_; }
  const QRTUUID& uuid() const { return uuid_; }
  const QRTURL& url() const { return url_; }
  const std::optional<std::string>& userManagedAssetsDirName() const { return userManagedAssetsDirName_; }
  const std::optional<plist::Dictionary>& info() const { return info_; }
  uint64_t containerClass() const { return containerClass_; }

  // Copies with one field changed; this object stays as it is.
  QRTMetadataRef withTransient(bool transient) const;
  QRTMetadataRef withExisted(bool existed) const;
  QRTMetadataRef withUuid(const QRTUUID& uuid) const;
  QRTMetadataRef withUrl(const QRTURL& url) const;
  QRTMetadataRef withUrl(const QRTURL& url, bool transient) const;
  QRTMetadataRef withInfo(std::optional<plist::Dictionary> info) const;
  QRTMetadataRef withUserManagedAssetsDirName(std::optional<std::string> name) const;

  // Writes the metadata file into the container directory, atomically.
  // Metadata over the size budget is refused with error 38 and not written.
  // container, when given, is the container directory already held.
  bool writeMetadataToDiskWithError(QRTErrorRef* error, const platform::Dir* container = nullptr) const;
  // Reads the metadata file of the container at url and checks it belongs to
  // forUser and, with checkClassPath, that the container lies directly in the
  // class directory of its class.
  static std::shared_ptr<QRTMetadata> readAndValidateMetadataAtUrl(const QRTURL& url, uint32_t forUser,
                                                                   bool checkClassPath, QRTErrorRef* error);
  // Puts uuid into the metadata file of the container at url, leaving the
  // rest of the file as it is; nothing is written when it is already there.
  static bool rewriteUUIDAtUrl(const QRTURL& url, const QRTUUID& uuid, QRTErrorRef* error);

  std::string description() const;

 private:
  plist::Dictionary dictionaryRepresentation() const;

  bool transient_ = false;
  bool existed_ = false;
  uint32_t uid_;
  std::string identifier_;
  QRTUUID uuid_;
  QRTURL url_;
  std::optional<std::string> userManagedAssetsDirName_;
  std::optional<plist::Dictionary> info_;
  uint64_t containerClass_;
};
