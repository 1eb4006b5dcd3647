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

class QRTContainerCache {
 public:
  static QRTContainerCache& sharedInstance();

  QRTMetadataRef containerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                                  bool transient, QRTErrorRef* error);
  // By identifier and the upper-case UUID string, live map first; the found
  // metadata's transient flag names the map it came from.
  QRTMetadataRef containerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                                  const std::string& uuidString);
  std::optional<std::vector<QRTMetadataRef>> allContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                  bool transient, bool populateSandboxCache,
                                                                  QRTErrorRef* error);
  std::optional<std::vector<QRTMetadataRef>> allContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                  bool transient, QRTErrorRef* error) {
    return allContainersForUser(userId, contentClass, transient, true, error);
  }
  // Live and transient containers of the user and class together.
  std::optional<size_t> countOfContainersForUser(uint32_t userId, uint64_t contentClass, QRTErrorRef* error);
  // Stores the metadata under its identifier, replacing any entry; the stored
  // object (a copy when the metadata's own URL or transient flag differ from
  // the given ones) goes to *stored when asked for.
  bool addContainerMetadata(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url, bool transient,
                            bool updateSandbox, QRTErrorRef* error, QRTMetadataRef* stored = nullptr);
  bool removeContainerForUser(uint32_t userId, uint64_t contentClass, const std::optional<std::string>& identifier,
                              bool transient, QRTErrorRef* error);
  // What a built class map holds, copied under the lock; nothing when the
  // map has not been built.
  std::optional<std::vector<QRTMetadataRef>> builtContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                    bool transient);
  // The users with at least one built class map.
  std::vector<uint32_t> usersWithBuiltClassMaps();
  // Tells the sandbox where a container lies (no URL withdraws it).
  bool setSandboxContainerMappingForUser(uint32_t userId, const std::string& identifier, uint64_t containerClass,
                                         const std::optional<QRTURL>& url);

 private:
  using ClassMap = std::unordered_map<std::string, QRTMetadataRef>;

  QRTContainerCache() = default;
  // The class map, built if needed. Called with cacheLock held through hold;
  // a build runs with the lock released (it reads the disk and may create the
  // class directory) and installs its map unless a racing build did first.
  ClassMap* _getCacheForUserId(std::unique_lock<std::mutex>& hold, uint32_t userId, uint64_t contentClass,
                               bool transient, bool populateSandboxCache, QRTErrorRef* error);
  std::optional<ClassMap> buildClassMap(uint32_t userId, uint64_t contentClass, bool transient,
                                        bool populateSandboxCache, QRTErrorRef* error);
  // _getCacheForUserId with its failure wrapped in error 43 for the named operation.
  ClassMap* lockedClassMap(std::unique_lock<std::mutex>& hold, const char* function, uint32_t userId,
                           uint64_t contentClass, bool transient, bool populateSandboxCache, QRTErrorRef* error);
  // The metadata file is gone: forget the container, unless its entry has
  // been replaced meanwhile. False with error 44 (or 47 when the entry has no
  // usable URL).
  bool checkEntryOnDisk(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass, bool transient,
                        QRTErrorRef* error);

  std::unordered_map<std::string, ClassMap> liveContainerCache;
  std::unordered_map<std::string, ClassMap> transientContainerCache;
  std::mutex cacheLock;
};
