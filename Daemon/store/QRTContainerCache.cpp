#include "Daemon/store/QRTContainerCache.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <optional>
#include <set>

#include "Daemon/store/QRTContentClass.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/Log.h"
#include "platform/SandboxMappings.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

const char* suffix(bool transient) { return transient ? "(transient)" : ""; }

bool validClass(uint64_t contentClass) { return contentClass >= 1 && contentClass <= 13; }

// A class map's key: the user above, the class (1 to 13) below.
uint64_t cacheKey(uint32_t userId, uint64_t contentClass) { return uint64_t{userId} << 32 | contentClass; }
// A held class directory's key: a transient one has bit 16 set as well.
uint64_t heldKey(uint32_t userId, uint64_t contentClass, bool transient) {
  return cacheKey(userId, contentClass) | (transient ? 1u << 16 : 0u);
}
// The class map as the log names it.
std::string cacheName(uint32_t userId, uint64_t contentClass) {
  return std::to_string(userId) + "-" + QRTContentClassPathName(contentClass);
}

// Error 47 for a class outside 1 to 13 or a missing identifier.
bool validInput(uint64_t contentClass, const std::optional<std::string>& identifier, const char* identifierMessage,
                const char* function, int line, QRTErrorRef* error) {
  if (!validClass(contentClass)) {
    QRTSetError(error, QRTCreateError(function, line, QRTErrorDomain, QRTErrorCacheInvalidInput, nullptr, nullptr, true,
                                      "Invalid Content Class: %ld", static_cast<long>(contentClass)));
    return false;
  }
  if (!identifier) {
    QRTSetError(error, QRTCreateError(function, line, QRTErrorDomain, QRTErrorCacheInvalidInput, nullptr, nullptr, true,
                                      identifierMessage, identifier));
    return false;
  }
  return true;
}

}  // namespace

QRTContainerCache& QRTContainerCache::sharedInstance() {
  static QRTContainerCache* instance = new QRTContainerCache();
  return *instance;
}

std::optional<std::vector<QRTMetadataRef>> QRTContainerCache::builtContainersForUser(uint32_t userId,
                                                                                     uint64_t contentClass,
                                                                                     bool transient) {
  std::lock_guard<std::mutex> hold(cacheLock);
  const auto& caches = transient ? transientContainerCache : liveContainerCache;
  auto map = caches.find(cacheKey(userId, contentClass));
  if (map == caches.end()) return std::nullopt;
  std::vector<QRTMetadataRef> containers;
  containers.reserve(map->second.size());
  for (const auto& [identifier, metadata] : map->second) containers.push_back(metadata);
  return containers;
}

std::vector<uint32_t> QRTContainerCache::usersWithBuiltClassMaps() {
  std::set<uint32_t> users;
  std::lock_guard<std::mutex> hold(cacheLock);
  for (const auto* caches : {&liveContainerCache, &transientContainerCache})
    for (const auto& [key, map] : *caches) users.insert(static_cast<uint32_t>(key >> 32));
  return {users.begin(), users.end()};
}

std::optional<QRTContainerCache::ClassMap> QRTContainerCache::buildClassMap(uint32_t userId, uint64_t contentClass,
                                                                            bool transient, bool populateSandboxCache,
                                                                            QRTErrorRef* error) {
  QRTLog(kLogDebug, "Rebuilding container class cache: %@%@", cacheName(userId, contentClass), suffix(transient));
  std::optional<QRTURL> classDirectory =
      QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, contentClass, transient);
  if (!classDirectory) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Invalid cache get-userId %u for class %ld",
                                 userId, static_cast<long>(contentClass)));
    return std::nullopt;
  }
  auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*classDirectory, error);
  if (!items) return std::nullopt;

  ClassMap map;
  const bool pushMappings = populateSandboxCache && !transient &&
                            (contentClass == QRTClassInternalDaemonData || contentClass == QRTClassSystemData ||
                             contentClass == QRTClassSystemGroup);
  // Planted directories beyond a user's bound are not read: they could not
  // have been made through requests.
  const size_t limit = userId == 0 ? SIZE_MAX : QRTGlobalConfiguration::sharedInstance().maxContainersPerClass();
  for (const QRTURL& item : *items) {
    if (map.size() >= limit) {
      QRTLog(kLogError, "Cache: %@%@: more than %llu containers; the rest are left out",
             cacheName(userId, contentClass), suffix(transient), static_cast<unsigned long long>(limit));
      break;
    }
    QRTErrorRef readError;
    QRTMetadataRef metadata = QRTMetadata::readAndValidateMetadataAtUrl(item, userId, true, &readError);
    if (!metadata) continue;
    if (transient) metadata = metadata->withTransient(true);
    if (pushMappings &&
        !setSandboxContainerMappingForUser(userId, metadata->identifier(), contentClass, metadata->url())) {
      QRTLog(kLogError, "Failed to set container mapping during create/lookup operation of %@, %llu",
             platform::logIdentifier(metadata->identifier()), static_cast<unsigned long long>(contentClass));
    }
    map[metadata->identifier()] = std::move(metadata);
  }
  return map;
}

QRTContainerCache::ClassMap* QRTContainerCache::_getCacheForUserId(std::unique_lock<std::mutex>& hold, uint32_t userId,
                                                                   uint64_t contentClass, bool transient,
                                                                   bool populateSandboxCache, QRTErrorRef* error) {
  if (!user_id_valid_for_class(contentClass, userId)) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Invalid cache get-userId %u for class %ld",
                                 userId, static_cast<long>(contentClass)));
    return nullptr;
  }
  const uint64_t key = cacheKey(userId, contentClass);
  auto& caches = transient ? transientContainerCache : liveContainerCache;
  if (auto it = caches.find(key); it != caches.end()) return &it->second;

  hold.unlock();
  std::optional<ClassMap> built;
  try {
    built = buildClassMap(userId, contentClass, transient, populateSandboxCache, error);
  } catch (...) {
    hold.lock();
    throw;
  }
  hold.lock();
  // A racing build may have installed its map, and changes may have gone into it since.
  if (auto it = caches.find(key); it != caches.end()) return &it->second;
  if (!built) return nullptr;
  return &(caches[key] = std::move(*built));
}

QRTContainerCache::ClassMap* QRTContainerCache::lockedClassMap(std::unique_lock<std::mutex>& hold, const char* function,
                                                               uint32_t userId, uint64_t contentClass, bool transient,
                                                               bool populateSandboxCache, QRTErrorRef* error) {
  QRTErrorRef buildError;
  ClassMap* map = _getCacheForUserId(hold, userId, contentClass, transient, populateSandboxCache, &buildError);
  if (!map) {
    QRTSetError(error, QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorCacheRebuildFailed, buildError,
                                      nullptr, true, "Cache: %u-%@%@: Failed to rebuild", userId,
                                      QRTContentClassPathName(contentClass), suffix(transient)));
  }
  return map;
}

bool QRTContainerCache::checkEntryOnDisk(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass,
                                         bool transient, bool learn, QRTErrorRef* error) {
  const char* className = QRTContentClassPathName(contentClass);
  if (metadata->url().empty()) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Cache: %@%@: nil URL from %@", className,
                                 suffix(transient), metadata));
    return false;
  }
  if (!metadataMissing(metadata, userId, contentClass, transient, learn)) return true;
  QRTURL file = metadata->url().URLByAppendingPathComponent(QRTMetadataFileName);
  QRTSetError(
      error, QRT_ERROR(QRTErrorCacheInconsistent, nullptr, true,
                       "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", className,
                       suffix(transient), file, metadata->identifier(), static_cast<unsigned long long>(contentClass)));
  // Only this very entry: a container made again under the identifier since
  // the look-up stays.
  bool removed = false;
  {
    std::lock_guard<std::mutex> hold(cacheLock);
    auto& caches = transient ? transientContainerCache : liveContainerCache;
    if (auto map = caches.find(cacheKey(userId, contentClass)); map != caches.end()) {
      if (auto entry = map->second.find(metadata->identifier());
          entry != map->second.end() && entry->second == metadata) {
        map->second.erase(entry);
        removed = true;
      }
    }
    forgetSeen(userId, contentClass, transient, metadata->url());
  }
  if (removed && !transient &&
      !setSandboxContainerMappingForUser(userId, metadata->identifier(), contentClass, std::nullopt)) {
    QRTLog(kLogError, "Failed to remove container mapping of %@, %llu", platform::logIdentifier(metadata->identifier()),
           static_cast<unsigned long long>(contentClass));
  }
  return false;
}

QRTContainerCache::HeldClassDirectoryRef QRTContainerCache::classDirectory(uint32_t userId, uint64_t contentClass,
                                                                           bool transient, bool reopen) {
  const uint64_t key = heldKey(userId, contentClass, transient);
  if (!reopen) {
    std::lock_guard<std::mutex> hold(cacheLock);
    if (auto found = heldClassDirectories.find(key); found != heldClassDirectories.end()) return found->second;
  }
  std::optional<QRTURL> url =
      QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, contentClass, transient);
  if (!url) return nullptr;
  auto held = std::make_shared<HeldClassDirectory>();
  held->path = url->path();
  if (int err = platform::Dir::open(held->path, &held->directory)) {
    QRTLog(kLogError, "Cache: %@%@: cannot open the class directory %@: %s", cacheName(userId, contentClass),
           suffix(transient), held->path, strerror(err));
    return nullptr;
  }
  std::lock_guard<std::mutex> hold(cacheLock);
  return heldClassDirectories[key] = std::move(held);
}

bool QRTContainerCache::metadataMissing(const QRTMetadataRef& metadata, uint32_t userId, uint64_t contentClass,
                                        bool transient, bool learn) {
  const std::string& path = metadata->url().path();
  const size_t slash = path.rfind('/');
  const std::string_view parent = std::string_view(path).substr(0, slash == 0 ? 1 : slash);
  const std::string leaf = path.substr(slash + 1);
  // A miss or a path that differs may come from a stale held directory: it
  // is opened afresh once, and a miss is confirmed from the device root.
  for (bool reopen : {false, true}) {
    HeldClassDirectoryRef held = classDirectory(userId, contentClass, transient, reopen);
    if (!held) break;
    if (held->path != parent) continue;
    std::optional<platform::ChangeStamp> seen;
    {
      std::lock_guard<std::mutex> hold(cacheLock);
      if (auto found = held->seen.find(leaf); found != held->seen.end()) seen = found->second;
    }
    struct timespec now {};
    struct stat st {};
    std::optional<platform::ChangeStamp> looked;
    if (seen || learn) {
      clock_gettime(CLOCK_REALTIME, &now);
      if (!leaf.empty() && held->directory.lstat(leaf, &st) == 0 && S_ISDIR(st.st_mode))
        looked = platform::ChangeStamp::of(st);
      if (looked && looked == seen) return false;
    }
    const int err = held->directory.exists(leaf + "/" + QRTMetadataFileName);
    if (err == 0) {
      if (looked && looked->settledBefore(now)) {
        std::lock_guard<std::mutex> hold(cacheLock);
        held->seen[leaf] = *looked;
      }
      return false;
    }
    if (err != ENOENT) {
      QRTLog(kLogError, "Failed to determine if %@/%s exists: %s", path, QRTMetadataFileName, strerror(err));
      return false;
    }
  }
  return QRTFileManager::defaultManager().itemDoesNotExistAtURL(
      metadata->url().URLByAppendingPathComponent(QRTMetadataFileName));
}

void QRTContainerCache::forgetSeen(uint32_t userId, uint64_t contentClass, bool transient, const QRTURL& url) {
  auto held = heldClassDirectories.find(heldKey(userId, contentClass, transient));
  if (held == heldClassDirectories.end()) return;
  const std::string& path = url.path();
  held->second->seen.erase(path.substr(path.rfind('/') + 1));
}

QRTMetadataRef QRTContainerCache::containerForUser(const QRTContainerKey& key, QRTErrorRef* error) {
  const uint32_t userId = key.userId;
  const uint64_t contentClass = key.containerClass;
  const std::optional<std::string>& identifier = key.identifier;
  const bool transient = key.transient;
  if (!validInput(contentClass, identifier, "Invalid identifier: %@", __func__, __LINE__, error)) return nullptr;
  try {
    QRTMetadataRef found;
    {
      std::unique_lock<std::mutex> hold(cacheLock);
      ClassMap* map = lockedClassMap(hold, __func__, userId, contentClass, transient, true, error);
      if (!map) return nullptr;
      auto it = map->find(*identifier);
      if (it == map->end()) {
        QRTSetError(error, QRT_ERROR(QRTErrorNotFound, nullptr, false, "Cache: %@%@: Container Not Found with ID: %@",
                                     QRTContentClassPathName(contentClass), suffix(transient), identifier));
        return nullptr;
      }
      found = it->second;
    }
    if (!checkEntryOnDisk(found, userId, contentClass, transient, true, error)) return nullptr;
    QRTLog(kLogDebug, "Cache: %@%@: Found Identifier: %@", QRTContentClassPathName(contentClass), suffix(transient),
           platform::logIdentifier(identifier));
    return found;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return nullptr;
  }
}

std::optional<size_t> QRTContainerCache::countOfContainersForUser(uint32_t userId, uint64_t contentClass,
                                                                  QRTErrorRef* error) {
  try {
    size_t count = 0;
    std::unique_lock<std::mutex> hold(cacheLock);
    for (bool transient : {false, true}) {
      ClassMap* map = lockedClassMap(hold, __func__, userId, contentClass, transient, true, error);
      if (!map) return std::nullopt;
      count += map->size();
    }
    return count;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return std::nullopt;
  }
}

QRTMetadataRef QRTContainerCache::containerForUser(uint32_t userId, uint64_t contentClass,
                                                   const std::optional<std::string>& identifier,
                                                   const std::string& uuidString) {
  for (bool transient : {false, true}) {
    QRTMetadataRef metadata = containerForUser({userId, contentClass, identifier, transient}, nullptr);
    if (metadata && metadata->uuid().UUIDString() == uuidString) return metadata;
  }
  return nullptr;
}

std::optional<std::vector<QRTMetadataRef>> QRTContainerCache::allContainersForUser(
    uint32_t userId, uint64_t contentClass, bool transient, bool populateSandboxCache, QRTErrorRef* error) {
  if (!validClass(contentClass)) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Invalid Content Class: %ld",
                                 static_cast<long>(contentClass)));
    return std::nullopt;
  }
  try {
    std::vector<QRTMetadataRef> snapshot;
    {
      std::unique_lock<std::mutex> hold(cacheLock);
      ClassMap* map = lockedClassMap(hold, __func__, userId, contentClass, transient, populateSandboxCache, error);
      if (!map) return std::nullopt;
      snapshot.reserve(map->size());
      for (const auto& entry : *map) snapshot.push_back(entry.second);
    }
    std::vector<QRTMetadataRef> live;
    live.reserve(snapshot.size());
    for (QRTMetadataRef& metadata : snapshot) {
      QRTErrorRef entryError;
      if (!checkEntryOnDisk(metadata, userId, contentClass, transient, false, &entryError)) continue;
      QRTLog(kLogDebug, "Cache: %@%@: ALL Found Identifier: %@", QRTContentClassPathName(contentClass),
             suffix(transient), platform::logIdentifier(metadata->identifier()));
      live.push_back(std::move(metadata));
    }
    return live;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return std::nullopt;
  }
}

bool QRTContainerCache::reserveCreation(uint32_t userId, uint64_t contentClass, size_t limit, size_t* held,
                                        QRTErrorRef* error) {
  try {
    std::unique_lock<std::mutex> hold(cacheLock);
    size_t count = 0;
    for (bool transient : {false, true}) {
      ClassMap* map = lockedClassMap(hold, "countOfContainersForUser", userId, contentClass, transient, true, error);
      if (!map) return false;
      count += map->size();
    }
    size_t& inProgress = creationsInProgress[cacheKey(userId, contentClass)];
    *held = count + inProgress;
    if (*held >= limit) {
      if (inProgress == 0) creationsInProgress.erase(cacheKey(userId, contentClass));
      return false;
    }
    ++inProgress;
    return true;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return false;
  }
}

void QRTContainerCache::abandonCreation(uint32_t userId, uint64_t contentClass) {
  std::lock_guard<std::mutex> hold(cacheLock);
  auto found = creationsInProgress.find(cacheKey(userId, contentClass));
  if (found != creationsInProgress.end() && --found->second == 0) creationsInProgress.erase(found);
}

bool QRTContainerCache::addContainerMetadata(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url,
                                             bool transient, bool updateSandbox, QRTErrorRef* error,
                                             QRTMetadataRef* stored) {
  return addEntry(metadata, forUser, url, transient, updateSandbox, false, error, stored);
}

bool QRTContainerCache::addCreatedContainer(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url,
                                            bool transient, QRTErrorRef* error, QRTMetadataRef* stored) {
  return addEntry(metadata, forUser, url, transient, true, true, error, stored);
}

bool QRTContainerCache::addEntry(const QRTMetadataRef& metadata, uint32_t forUser, const QRTURL& url, bool transient,
                                 bool updateSandbox, bool releaseSlot, QRTErrorRef* error, QRTMetadataRef* stored) {
  if (!metadata || !validClass(metadata->containerClass())) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Invalid Metadata Content Class: %lld",
                                 metadata ? static_cast<long long>(metadata->containerClass()) : 0LL));
    return false;
  }
  if (url.empty()) {
    QRTSetError(error, QRT_ERROR(QRTErrorCacheInvalidInput, nullptr, true, "Invalid input: URL: %@", nullptr));
    return false;
  }
  const uint64_t contentClass = metadata->containerClass();
  try {
    // The entry must agree with the map it is in and the place it names.
    QRTMetadataRef entry =
        metadata->url() == url && metadata->transient() == transient ? metadata : metadata->withUrl(url, transient);
    {
      std::unique_lock<std::mutex> hold(cacheLock);
      ClassMap* map = lockedClassMap(hold, "addContainerMetadata", forUser, contentClass, transient, true, error);
      if (!map) return false;
      (*map)[entry->identifier()] = entry;
      if (releaseSlot) {
        auto slot = creationsInProgress.find(cacheKey(forUser, contentClass));
        if (slot != creationsInProgress.end() && --slot->second == 0) creationsInProgress.erase(slot);
      }
    }
    if (stored) *stored = entry;
    if (!transient && updateSandbox &&
        !setSandboxContainerMappingForUser(forUser, metadata->identifier(), contentClass, url)) {
      QRTLog(kLogError, "Failed to set container mapping of %@, %llu", platform::logIdentifier(metadata->identifier()),
             static_cast<unsigned long long>(contentClass));
    }
    QRTLog(kLogDebug, "Cache: %@%@: Added Identifier: %@", QRTContentClassPathName(contentClass), suffix(transient),
           platform::logIdentifier(metadata->identifier()));
    return true;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return false;
  }
}

bool QRTContainerCache::removeContainerForUser(uint32_t userId, uint64_t contentClass,
                                               const std::optional<std::string>& identifier, bool transient,
                                               QRTErrorRef* error) {
  if (!validInput(contentClass, identifier, "Invalid Identifier: %@", __func__, __LINE__, error)) return false;
  try {
    {
      std::unique_lock<std::mutex> hold(cacheLock);
      ClassMap* map = lockedClassMap(hold, __func__, userId, contentClass, transient, true, error);
      if (!map) return false;
      if (auto entry = map->find(*identifier); entry != map->end()) {
        if (entry->second) forgetSeen(userId, contentClass, transient, entry->second->url());
        map->erase(entry);
      }
    }
    if (!transient && !setSandboxContainerMappingForUser(userId, *identifier, contentClass, std::nullopt)) {
      QRTLog(kLogError, "Failed to remove container mapping of %@, %llu", platform::logIdentifier(identifier),
             static_cast<unsigned long long>(contentClass));
    }
    QRTLog(kLogDebug, "Cache: %@%@: Removed Identifier: %@", QRTContentClassPathName(contentClass), suffix(transient),
           platform::logIdentifier(identifier));
    return true;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return false;
  }
}

bool QRTContainerCache::setSandboxContainerMappingForUser(uint32_t userId, const std::string& identifier,
                                                          uint64_t containerClass, const std::optional<QRTURL>& url) {
  if (QRTIsBundleClass(containerClass)) return true;
  uint64_t itemType;
  uint32_t mappingUser = userId;
  switch (containerClass) {
    case 2:
    case 4:
    case 6:
    case 9:
    case 10:
    case 11: itemType = 1; break;
    case 7: itemType = 2; break;
    case 12:
      itemType = 4;
      mappingUser = 0;
      break;
    case 13:
      itemType = 8;
      mappingUser = 0;
      break;
    default:
      QRTLog(kLogError, "Unsupported class for setting sandbox container mapping: %llu",
             static_cast<unsigned long long>(containerClass));
      return false;
  }
  const unsigned long long cls = containerClass;
  const unsigned long long type = itemType;
  if (int status = platform::sandboxSetStateItem(mappingUser, itemType, identifier, nullptr)) {
    QRTLog(
        kLogError, "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d",
        mappingUser, type, platform::logIdentifier(identifier).c_str(), cls, static_cast<const char*>(nullptr), status);
    return false;
  }
  if (!url) return true;
  if (int status = platform::sandboxSetStateItem(mappingUser, itemType, identifier, url->fileSystemRepresentation())) {
    QRTLog(kLogError, "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d",
           mappingUser, type, platform::logIdentifier(identifier).c_str(), cls, url->fileSystemRepresentation(),
           status);
    return false;
  }
  return true;
}

QRTContainerCache::Stats QRTContainerCache::stats() {
  Stats stats;
  std::lock_guard<std::mutex> hold(cacheLock);
  for (const auto* caches : {&liveContainerCache, &transientContainerCache}) {
    for (const auto& [key, map] : *caches) {
      stats.approximateBytes += sizeof(key) + sizeof(ClassMap) + map.bucket_count() * sizeof(void*);
      for (const auto& [identifier, metadata] : map) {
        stats.approximateBytes += sizeof(ClassMap::value_type) + identifier.capacity() + 2 * sizeof(void*);
        if (!metadata) continue;
        stats.approximateBytes +=
            sizeof(QRTMetadata) + metadata->identifier().capacity() + metadata->url().path().capacity();
        const uint64_t contentClass = metadata->containerClass();
        if (contentClass < stats.containersPerClass.size()) ++stats.containersPerClass[contentClass];
        ++stats.containers;
      }
    }
  }
  return stats;
}
