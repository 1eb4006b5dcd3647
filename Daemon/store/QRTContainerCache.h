// The in-memory index of the containers on disk: per user, class and
// transience, a map from identifier to the container's metadata. Each class
// directory is scanned once; later changes go through add and remove.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/QRTError.h"
#include "Daemon/store/QRTMetadata.h"

using QRTMetadataRef = std::shared_ptr<QRTMetadata>;

class QRTContainerCache {
 public:
  static QRTContainerCache& sharedInstance();

  QRTMetadataRef containerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                                  bool transient, QRTErrorRef* error);
  // By identifier and the upper-case UUID string, live map first; sets the
  // found container's transient flag.
  QRTMetadataRef containerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                                  const std::string& uuidString);
  std::optional<std::vector<QRTMetadataRef>> allContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                  bool transient, bool populateSandboxCache,
                                                                  QRTErrorRef* error);
  std::optional<std::vector<QRTMetadataRef>> allContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                  bool transient, QRTErrorRef* error) {
    return allContainersForUser(userId, contentClass, transient, true, error);
  }
  bool addContainerMetadata(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url, bool transient,
                            bool updateSandbox, QRTErrorRef* error);
  bool removeContainerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                              bool transient, QRTErrorRef* error);
  // Tells the sandbox where a container lies (no URL withdraws it).
  bool setSandboxContainerMappingForUser(uint32_t userId, const std::string& identifier, uint64_t containerClass,
                                         const std::optional<QRTURL>& url);

 private:
  using ClassMap = std::unordered_map<std::string, QRTMetadataRef>;

  QRTContainerCache() = default;
  ClassMap* _getCacheForUserId(uint32_t userId, uint64_t contentClass, bool transient, bool populateSandboxCache,
                               QRTErrorRef* error);
  // _getCacheForUserId with its failure wrapped in error 43 for the named operation.
  ClassMap* lockedClassMap(const char* function, uint32_t userId, uint64_t contentClass, bool transient,
                           bool populateSandboxCache, QRTErrorRef* error);
  // The metadata file is gone: forget the container. False with error 44
  // (or 47 when the entry has no usable URL).
  bool checkEntryOnDisk(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass, bool transient,
                        QRTErrorRef* error);

  std::unordered_map<std::string, ClassMap> liveContainerCache;
  std::unordered_map<std::string, ClassMap> transientContainerCache;
  std::mutex cacheLock;
};
