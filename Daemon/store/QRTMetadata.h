// One container: the values of its metadata file (identifier, class, owner,
// internal UUID, info values, user-managed-assets directory name) plus its URL
// and two flags that are never written to disk.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/QRTError.h"
#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "base/QRTUUID.h"

inline constexpr const char* QRTMetadataFileName = ".com.norvane.quarter_kit.metadata.plist";

inline constexpr const char* QRTMetadataIdentifierKey = "QRTMetadataIdentifier";
inline constexpr const char* QRTMetadataUUIDKey = "QRTMetadataUUID";
inline constexpr const char* QRTMetadataContentClassKey = "QRTMetadataContentClass";
inline constexpr const char* QRTMetadataPersonaKey = "QRTMetadataPersona";
inline constexpr const char* QRTMetadataInfoKey = "QRTMetadataInfo";
inline constexpr const char* QRTMetadataUserManagedAssetsDirNameKey = "QRTMetadataUserManagedAssetsDirName";

class QRTMetadata {
 public:
  QRTMetadata(uint32_t uid, QRTUUID uuid, uint64_t containerClass, std::string identifier,
              std::optional<plist::Dictionary> info, QRTURL url, std::optional<std::string> userManagedAssetsDirName);

  bool transient() const { return transient_; }
  void setTransient(bool transient) { transient_ = transient; }
  bool existed() const { return existed_; }
  void setExisted(bool existed) { existed_ = existed; }
  uint32_t uid() const { return uid_; }
  uint32_t userId() const { return uid_; }
  void setUid(uint32_t uid) { uid_ = uid; }
  void setUserId(uint32_t userId) { uid_ = userId; }
  const std::string& identifier() const { return identifier_; }
  const QRTUUID& uuid() const { return uuid_; }
  void setUuid(const QRTUUID& uuid) { uuid_ = uuid; }
  const QRTURL& url() const { return url_; }
  void setUrl(const QRTURL& url) { url_ = url; }
  const std::optional<std::string>& userManagedAssetsDirName() const { return userManagedAssetsDirName_; }
  void setUserManagedAssetsDirName(std::optional<std::string> name) { userManagedAssetsDirName_ = std::move(name); }
  const std::optional<plist::Dictionary>& info() const { return info_; }
  void setInfo(std::optional<plist::Dictionary> info) { info_ = std::move(info); }
  uint64_t containerClass() const { return containerClass_; }

  // Writes the metadata file into the container directory, atomically.
  bool writeMetadataToDiskWithError(QRTErrorRef* error) const;
  // Reads the metadata file of the container at url and checks it belongs to
  // forUser and, with checkClassPath, that the container lies directly in the
  // class directory of its class.
  static std::shared_ptr<QRTMetadata> readAndValidateMetadataAtUrl(const QRTURL& url, uint32_t forUser,
                                                                   bool checkClassPath, QRTErrorRef* error);

  std::string description() const;

 private:
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
