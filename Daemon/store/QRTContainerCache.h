// The in-memory index of the containers on disk: per user, class and
// transience, a map from identifier to the container's metadata. Each class
// directory is scanned once; later changes go through add and remove.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/QRTError.h"
#include "Daemon/store/QRTContainerKey.h"
#include "Daemon/store/QRTMetadata.h"
#include "platform/Dir.h"

class QRTContainerCache {
 public:
  static QRTContainerCache& sharedInstance();

  QRTMetadataRef containerForUser(const QRTContainerKey& key, QRTErrorRef* error);
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
  // Creation holds one of the user's slots of the class from before it
  // builds until its container is added (addCreatedContainer) or given up
  // (abandonCreation), so that concurrent creators together stay within
  // limit. False when the live and transient containers and the creations
  // in progress already reach it (*held: how many), or with the error of a
  // failed cache build.
  bool reserveCreation(uint32_t userId, uint64_t contentClass, size_t limit, size_t* held, QRTErrorRef* error);
  void abandonCreation(uint32_t userId, uint64_t contentClass);
  // addContainerMetadata with the sandbox told, giving back the creation's
  // slot in the same step.
  bool addCreatedContainer(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url, bool transient,
                           QRTErrorRef* error, QRTMetadataRef* stored);
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

  // What the cache holds now: containers per class (index 1 to 13, live and
  // transient together) and the approximate memory of its entries, info
  // values left out.
  struct Stats {
    std::array<uint64_t, 14> containersPerClass{};
    uint64_t containers = 0;
    uint64_t approximateBytes = 0;
  };
  Stats stats();

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
  // usable URL). learn as for metadataMissing.
  bool checkEntryOnDisk(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass, bool transient,
                        bool learn, QRTErrorRef* error);

  // The class directory held open with its host path, so that a container's
  // metadata file is checked with two components resolved beneath it rather
  // than its whole path from the device root.
  //
  // seen keeps, per container directory name, the directory's stamp as it
  // was when its metadata file was last found: while the name still gives
  // the same stamp, the file is still there. Only a settled stamp is kept.
  // Guarded by cacheLock; dropped with the held directory.
  struct HeldClassDirectory {
    platform::Dir directory;
    std::string path;
    mutable std::unordered_map<std::string, platform::ChangeStamp> seen;
  };
  using HeldClassDirectoryRef = std::shared_ptr<const HeldClassDirectory>;
  // The held directory (opened when missing or when reopen is set), or null
  // when it cannot be opened. Takes cacheLock.
  HeldClassDirectoryRef classDirectory(uint32_t userId, uint64_t contentClass, bool transient, bool reopen);
  // Whether the container's metadata file is missing: its directory unchanged
  // since the file was seen (one look at one name beneath the held class
  // directory), else ENOENT beneath the held class directory, confirmed from
  // the device root (the held directory may have been replaced, and is then
  // opened afresh). Only with learn is a directory not yet in seen looked at
  // to be kept there: look-ups, which repeat at every program start, learn;
  // a listing, which looks at each container once, does not.
  bool metadataMissing(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass, bool transient,
                       bool learn);
  // Drops what seen holds for the container directory at url. With cacheLock held.
  void forgetSeen(uint32_t userId, uint64_t contentClass, bool transient, const QRTURL& url);
  // addContainerMetadata, also giving back a creation's slot when releaseSlot.
  bool addEntry(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url, bool transient, bool updateSandbox,
                bool releaseSlot, QRTErrorRef* error, QRTMetadataRef* stored);

  // Keyed by user and class together (see cacheKey).
  std::unordered_map<uint64_t, ClassMap> liveContainerCache;
  std::unordered_map<uint64_t, ClassMap> transientContainerCache;
  std::unordered_map<uint64_t, HeldClassDirectoryRef> heldClassDirectories;
  std::unordered_map<uint64_t, size_t> creationsInProgress;
  std::mutex cacheLock;
};
