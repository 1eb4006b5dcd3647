#include "Daemon/requests/QRTOperationsCommands.h"

#include "Daemon/QRTError.h"
#include "Daemon/QRTMetrics.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/requests/QRTRequestDispatcher.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/Identity.h"
#include "platform/Log.h"

namespace {

plist::Dictionary latencyDictionary(const QRTLatencyHistogram::Snapshot& s, bool withBuckets) {
  plist::Dictionary d{{QRTStatusKeyServed, s.served},
                      {QRTStatusKeyFailed, s.failed},
                      {QRTStatusKeyP50, s.quantileMicros(0.5)},
                      {QRTStatusKeyP99, s.quantileMicros(0.99)},
                      {QRTStatusKeySum, s.sumMicros}};
  if (withBuckets) {
    plist::Array buckets;
    for (uint64_t n : s.buckets) buckets.emplace_back(n);
    d[QRTStatusKeyBuckets] = std::move(buckets);
  }
  return d;
}

// Items directly in the directory and the bytes beneath it; a directory that
// cannot be listed counts as empty and is logged.
void addDirectoryBacklog(const QRTURL& directory, uint64_t* items, uint64_t* bytes) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTErrorRef error;
  std::optional<std::vector<QRTURL>> entries = files.urlsForItemsInDirectoryAtURL(directory, &error);
  if (!entries) {
    if (error && !(error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT))
      QRTLog(platform::kLogError, "Cannot list %@ for the status: %@", directory, error);
    return;
  }
  *items += entries->size();
  if (!entries->empty()) *bytes += files.diskUsageForURL(directory);
}

plist::Dictionary statusDictionary(bool withBuckets) {
  plist::Dictionary status;
  status[QRTStatusKeyUptime] = static_cast<uint64_t>(
      std::chrono::duration_cast<std::chrono::seconds>(QRTMetrics::Clock::now() - QRTMetrics::startTime()).count());

  const QRTContainerCache::Stats cache = QRTContainerCache::sharedInstance().stats();
  plist::Array perClass;
  for (uint64_t n : cache.containersPerClass) perClass.emplace_back(n);
  status[QRTStatusKeyContainersPerClass] = std::move(perClass);
  status[QRTStatusKeyCachedContainers] = cache.containers;
  status[QRTStatusKeyCacheBytes] = cache.approximateBytes;

  QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
  uint64_t items = 0, bytes = 0, pending = 0, unused = 0;
  for (const QRTURL& deathRow : configuration.allDeathrowDirectories()) addDirectoryBacklog(deathRow, &items, &bytes);
  addDirectoryBacklog(configuration.pendingUpdatesDirectory(), &pending, &unused);
  status[QRTStatusKeyDeathRowItems] = items;
  status[QRTStatusKeyDeathRowBytes] = bytes;
  status[QRTStatusKeyPendingProtection] = pending;

  const platform::IdentityRegistryStats identities = platform::identityRegistryStats();
  status[QRTStatusKeyIdentities] = static_cast<uint64_t>(identities.entries);
  status[QRTStatusKeyIdentitiesRefused] = static_cast<uint64_t>(identities.refusedFiles);
  status[QRTStatusKeyLogLevel] = static_cast<uint64_t>(platform::logLevel());

  plist::Array requests;
  for (size_t slot = 0; slot < QRTMetrics::kSlots; ++slot) {
    const QRTLatencyHistogram::Snapshot s = QRTMetrics::requests(slot).snapshot();
    if (s.served == 0) continue;
    const uint64_t command = QRTMetrics::commandForSlot(slot);
    const QRTCommandRow* row = QRTCommandRowFor(command);
    plist::Dictionary entry = latencyDictionary(s, withBuckets);
    entry[QRTStatusKeyCommand] = plist::Integer{command, command > INT64_MAX};
    entry[QRTStatusKeyName] = row ? row->name : "other";
    requests.emplace_back(std::move(entry));
  }
  status[QRTStatusKeyRequests] = std::move(requests);
  status[QRTStatusKeyUpcalls] = latencyDictionary(QRTMetrics::upcalls().snapshot(), withBuckets);
  return status;
}

}  // namespace

void QRTHandleStatus(const plist::Dictionary&, const QRTReplyRef& reply, QRTClientConnection&, uint64_t*) {
  reply->dictionary[QRTReplyKeyStatus] = statusDictionary(false);
}

void QRTHandleMetrics(const plist::Dictionary&, const QRTReplyRef& reply, QRTClientConnection&, uint64_t*) {
  reply->dictionary[QRTReplyKeyStatus] = statusDictionary(true);
}

void QRTHandleSetLogLevel(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                          uint64_t* result) {
  const plist::Value* value = QRTMessageObject(request, QRTKeyLogLevel);
  const plist::Integer* level = value ? value->integerIf() : nullptr;
  if (!level || level->asUnsigned() > platform::kLogDebug) {
    QRTLogRefusal(client.clientUserId(), "Invalid log level %@ from client %u; it takes 0 to 7",
                  value ? std::optional(plist::describe(*value)) : std::nullopt, client.clientUserId());
    *result = QRTErrorInvalidArgument;
    return;
  }
  const int previous = platform::logLevel();
  platform::logSetLevel(static_cast<int>(level->asUnsigned()));
  QRTLog(platform::kLogNotice, "Log level changed from %d to %d by uid %u", previous,
         static_cast<int>(level->asUnsigned()), client.clientUserId());
  reply->dictionary[QRTReplyKeyLogLevel] = static_cast<uint64_t>(previous);
}

std::string QRTServiceStatusLine() {
  QRTLatencyHistogram::Snapshot all;
  for (size_t slot = 0; slot < QRTMetrics::kSlots; ++slot) all.add(QRTMetrics::requests(slot).snapshot());
  return QRTFormat("Serving requests: %llu served, %llu failed, p99 %llu us",
                   static_cast<unsigned long long>(all.served), static_cast<unsigned long long>(all.failed),
                   static_cast<unsigned long long>(all.quantileMicros(0.99)));
}
