#include "Daemon/verify/QRTVerify.h"

#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <ctime>
#include <future>
#include <map>
#include <optional>
#include <set>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "platform/Dir.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"
#include "platform/SafePath.h"
#include "platform/SandboxMappings.h"

using platform::kLogError;
using platform::kLogNotice;
using Severity = QRTFinding::Severity;

namespace {

// When this run of the daemon began: a journal older than that has already
// been through one start's recovery.
const time_t gStartedAt = time(nullptr);

// How long a repair waits for the death-row pass it asks for.
constexpr auto kDeathRowWait = std::chrono::minutes(5);

// The names a transient directory may hold: the first components of the
// class path names.
bool transientTopName(const std::string& name) { return name == "Bundle" || name == "Data" || name == "Shared"; }

std::string errorText(const QRTErrorRef& error) { return error ? error->description() : "unknown error"; }

// Where the sandbox keeps a container's mapping, for the classes whose
// mappings the cache pushes whenever it builds their map.
struct MappingSlot {
  uint32_t user;
  uint64_t itemType;
};
std::optional<MappingSlot> mappingSlot(uint32_t userId, uint64_t containerClass) {
  if (containerClass == QRTClassInternalDaemonData) return MappingSlot{userId, 1};
  if (containerClass == QRTClassSystemData) return MappingSlot{0, 4};
  if (containerClass == QRTClassSystemGroup) return MappingSlot{0, 8};
  return std::nullopt;
}

// The owner a container's top directory is given when it is made.
std::optional<uid_t> expectedOwner(uint32_t userId, uint64_t containerClass) {
  if (QRTIsSystemClass(containerClass)) return 0;
  return platform::hostUserId(QRTIsBundleClass(containerClass) ? QRTInstallerUserId : userId);
}

class Verifier {
 public:
  explicit Verifier(bool repair) : repair_(repair) {}

  QRTVerifyReport run() {
    checkDeathRow();
    {
      QRTAllIdentifiersLock lock(repair_);
      for (const auto& [user, containerClass] : classesToScan())
        for (bool transient : {false, true}) checkClassDirectory(user, containerClass, transient);
      checkTransientDirectories();
      checkStaging();
      checkJournals(QRTGlobalConfiguration::sharedInstance().replaceDirectory(), "replace-journal-stale",
                    "a replace journal that outlived a start");
      checkJournals(QRTGlobalConfiguration::sharedInstance().pendingUpdatesDirectory(), "protection-update-stale",
                    "a protection change that outlived a start");
    }
    // The code-signing work takes the identifier locks itself.
    checkDatabase();
    return std::move(report_);
  }

 private:
  QRTFinding& add(const char* kind, Severity severity, std::string subject, std::string detail, const char* action) {
    report_.findings.push_back(QRTFinding{kind, severity, std::move(subject), std::move(detail), action, false});
    return report_.findings.back();
  }

  // Global classes belong to their one user; per-user classes are looked at
  // for the current mobile user and for every user the cache has met.
  std::vector<std::pair<uint32_t, uint64_t>> classesToScan() {
    std::set<uint32_t> users;
    for (uint32_t user : QRTContainerCache::sharedInstance().usersWithBuiltClassMaps()) users.insert(user);
    const uint32_t mobile = QRTGlobalConfiguration::sharedInstance().currentMobileUserId();
    if (mobile != QRTGlobalConfiguration::kNoDefaultUser) users.insert(mobile);
    std::vector<std::pair<uint32_t, uint64_t>> classes;
    for (uint64_t containerClass = 1; containerClass <= 13; ++containerClass) {
      if (QRTIsBundleClass(containerClass)) classes.emplace_back(QRTInstallerUserId, containerClass);
      if (QRTIsSystemClass(containerClass)) classes.emplace_back(QRTSystemContainerUserId, containerClass);
      if (!QRTIsPerUserClass(containerClass)) continue;
      for (uint32_t user : users)
        if (user != QRTInstallerUserId && user != QRTSystemContainerUserId) classes.emplace_back(user, containerClass);
    }
    return classes;
  }

  bool toDeathRow(const QRTURL& url) {
    QRTErrorRef error;
    if (QRTClientConnection::sharedClientConnection()._moveItemAtURLToDeathRow(url, true, false, &error)) return true;
    QRTLog(kLogError, "verify: failed to move %@ to death row: %@", url, error);
    return false;
  }

  // One class directory: every entry must be a container of this user and
  // class, with the owner it was made with; then the cache and the sandbox
  // must know exactly these containers.
  void checkClassDirectory(uint32_t userId, uint64_t containerClass, bool transient) {
    QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
    QRTContainerCache& cache = QRTContainerCache::sharedInstance();
    std::optional<QRTURL> directory =
        QRTIsGlobalClass(containerClass)
            ? configuration.globalContainerBaseURLWithContentClass(containerClass, transient)
            : configuration.containerDirectoryURLForUser(userId, containerClass, transient);
    QRTFileManager& fm = QRTFileManager::defaultManager();
    if (!directory || !fm.itemExistsAtURL(*directory)) return;
    QRTErrorRef error;
    auto items = fm.urlsForItemsInDirectoryAtURL(*directory, &error);
    if (!items) {
      add("class-directory-unreadable", Severity::error, directory->path(), errorText(error),
          "check the directory's owner and mode");
      return;
    }
    // Held once, so that each container's owner costs one look-up of its name.
    platform::Dir held;
    platform::Dir::open(directory->path(), &held);
    std::map<std::string, std::vector<QRTMetadataRef>> onDisk;
    for (const QRTURL& item : *items) {
      QRTMetadataRef metadata = checkContainer(held, item, userId, containerClass);
      if (metadata) onDisk[metadata->identifier()].push_back(transient ? metadata->withTransient(true) : metadata);
    }
    std::optional<std::vector<QRTMetadataRef>> cached = cache.builtContainersForUser(userId, containerClass, transient);
    if (!cached) return;  // the cache reads the directory when it is first asked
    std::map<std::string, QRTMetadataRef> known;
    for (const QRTMetadataRef& entry : *cached) {
      auto found = onDisk.find(entry->identifier());
      const bool present = found != onDisk.end() &&
                           std::any_of(found->second.begin(), found->second.end(),
                                       [&](const QRTMetadataRef& m) { return m->url().path() == entry->url().path(); });
      if (present) {
        known[entry->identifier()] = entry;
        continue;
      }
      QRTFinding& finding =
          add("cache-entry-stale", Severity::warning, entry->url().path(),
              "the cache holds " + entry->identifier() + " but its directory is gone or invalid", "forget the entry");
      QRTErrorRef removeError;
      if (repair_)
        finding.repaired =
            cache.removeContainerForUser(userId, containerClass, entry->identifier(), transient, &removeError);
    }
    for (const auto& [identifier, containers] : onDisk) {
      auto entry = known.find(identifier);
      for (const QRTMetadataRef& container : containers) {
        if (entry != known.end() && entry->second->url().path() == container->url().path()) continue;
        if (entry != known.end() || containers.size() > 1) {
          add("identifier-duplicate", Severity::error, container->url().path(),
              "another container of this class holds " + identifier, "keep one of them by hand");
          continue;
        }
        QRTFinding& finding = add("cache-entry-missing", Severity::warning, container->url().path(),
                                  identifier + " is on disk but not in the cache", "add it to the cache");
        QRTErrorRef addError;
        if (repair_)
          finding.repaired =
              cache.addContainerMetadata(container, userId, container->url(), transient, true, &addError);
        if (finding.repaired) known[identifier] = container;
      }
    }
    if (!transient) checkMappings(userId, containerClass, known);
  }

  // The container's metadata, when it is one of this user and class; every
  // other entry is a finding.
  QRTMetadataRef checkContainer(const platform::Dir& classDirectory, const QRTURL& item, uint32_t userId,
                                uint64_t containerClass) {
    QRTErrorRef error;
    std::shared_ptr<QRTMetadata> metadata = QRTMetadata::readAndValidateMetadataAtUrl(item, userId, true, &error);
    if (!metadata) {
      const std::string text = errorText(error);
      const char* kind = "metadata-unreadable";
      if (text.find("Incorrect UserId") != std::string::npos) kind = "metadata-wrong-user";
      if (text.find("should match") != std::string::npos) kind = "metadata-wrong-class";
      QRTFinding& finding = add(kind, Severity::error, item.path(), text, "move the directory to death row");
      if (repair_) finding.repaired = toDeathRow(item);
      return nullptr;
    }
    ++report_.containers;
    const std::optional<uid_t> owner = expectedOwner(userId, containerClass);
    platform::Item top;
    if (owner && classDirectory.valid() && classDirectory.openItem(item.lastPathComponent(), &top) == 0 &&
        S_ISDIR(top.st.st_mode) && top.st.st_uid != *owner) {
      QRTFinding& finding = add("owner-drift", Severity::warning, item.path(),
                                "owned by " + std::to_string(top.st.st_uid) + ", made for " + std::to_string(*owner),
                                "give the directory back to its owner");
      if (repair_) finding.repaired = platform::Dir::setOwner(top, *owner, static_cast<gid_t>(-1)) == 0;
    }
    if (QRTIsSystemClass(containerClass)) {
      QRTFileManager& fm = QRTFileManager::defaultManager();
      bool matches = true;
      QRTErrorRef aclError;
      if (!fm.topLevelSystemContainerACLMatchesAtURL(item, &matches, &aclError)) {
        add("acl-unreadable", Severity::warning, item.path(), errorText(aclError), "stamp the ACL anew");
      } else if (!matches) {
        QRTFinding& finding = add("acl-drift", Severity::warning, item.path(),
                                  "the top directory's ACL is not the system container's", "stamp the ACL anew");
        if (repair_) finding.repaired = fm.setTopLevelSystemContainerACLAtURL(item, &aclError);
      }
    }
    return metadata;
  }

  // The mappings the cache pushes for the class must lead to its containers;
  // those of the system classes must not outlive their container.
  void checkMappings(uint32_t userId, uint64_t containerClass, const std::map<std::string, QRTMetadataRef>& known) {
    std::optional<MappingSlot> slot = mappingSlot(userId, containerClass);
    if (!slot) return;
    QRTContainerCache& cache = QRTContainerCache::sharedInstance();
    for (const auto& [identifier, container] : known) {
      std::optional<std::string> target = platform::sandboxStateItem(slot->user, slot->itemType, identifier);
      if (target == container->url().path()) continue;
      QRTFinding& finding =
          add(target ? "sandbox-mapping-wrong" : "sandbox-mapping-missing", Severity::warning, identifier,
              target ? "leads to " + *target : "no mapping", "point the mapping at the container");
      if (repair_)
        finding.repaired =
            cache.setSandboxContainerMappingForUser(userId, identifier, containerClass, container->url());
    }
    for (const std::string& identifier : platform::sandboxStateItems(slot->user, slot->itemType)) {
      if (known.count(identifier)) continue;
      std::optional<std::string> target = platform::sandboxStateItem(slot->user, slot->itemType, identifier);
      struct stat st;
      // Item type 1 is shared with the other data classes: only a mapping
      // that leads nowhere is known to be wrong there.
      const bool dangling = !target || platform::safeStat(*target, &st) != 0;
      if (slot->itemType == 1 && !dangling) continue;
      QRTFinding& finding =
          add("sandbox-mapping-orphan", Severity::warning, identifier,
              dangling ? "leads nowhere" : "leads to " + *target + ", which is no container", "withdraw the mapping");
      if (repair_)
        finding.repaired = platform::sandboxSetStateItem(slot->user, slot->itemType, identifier, nullptr) == 0;
    }
  }

  // Transient directories hold class directories only.
  void checkTransientDirectories() {
    QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
    std::vector<QRTURL> directories{configuration.transientDirectory(), configuration.transientBundleDirectory()};
    const uint32_t mobile = configuration.currentMobileUserId();
    if (mobile != QRTGlobalConfiguration::kNoDefaultUser) {
      if (auto user = configuration.getPerUserConfigurationForUserId(mobile)->transientDirectory())
        directories.push_back(*user);
    }
    for (const QRTURL& directory : directories) {
      QRTErrorRef error;
      auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &error);
      for (const QRTURL& item : items.value_or(std::vector<QRTURL>{})) {
        if (transientTopName(item.lastPathComponent())) continue;
        QRTFinding& finding = add("transient-leftover", Severity::warning, item.path(),
                                  "not a class directory of the transient store", "move it to death row");
        if (repair_) finding.repaired = toDeathRow(item);
      }
    }
  }

  // With the identifier locks held nothing is being built: whatever staging
  // holds was left by work that never finished.
  void checkStaging() {
    for (const QRTURL& staging : QRTGlobalConfiguration::sharedInstance().allStagingDirectories()) {
      QRTErrorRef error;
      auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(staging, &error);
      for (const QRTURL& item : items.value_or(std::vector<QRTURL>{})) {
        QRTFinding& finding = add("staging-leftover", Severity::warning, item.path(),
                                  "left in staging by unfinished work", "move it to death row");
        if (repair_) finding.repaired = toDeathRow(item);
      }
    }
  }

  // Before the store's checks, so that what they move to death row stays
  // there until the next pass.
  void checkDeathRow() {
    size_t items = 0;
    std::string first;
    for (const QRTURL& deathRow : QRTGlobalConfiguration::sharedInstance().allDeathrowDirectories()) {
      QRTErrorRef error;
      auto listed = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow, &error);
      if (listed && !listed->empty() && first.empty()) first = deathRow.path();
      items += listed ? listed->size() : 0;
    }
    if (items == 0) return;
    QRTFinding& finding =
        add("deathrow-backlog", Severity::notice, first, std::to_string(items) + " items wait", "run a death-row pass");
    if (!repair_) return;
    auto done = std::make_shared<std::promise<uint64_t>>();
    std::future<uint64_t> result = done->get_future();
    QRTClientConnection::sharedClientConnection().deleteContainersOnDeathRowWithCompletion(
        [done](uint64_t code) { done->set_value(code); });
    finding.repaired = result.wait_for(kDeathRowWait) == std::future_status::ready && result.get() == QRTErrorNone;
  }

  // Start-up recovery takes up every journal; one older than this start is
  // stuck, and only a start can take it up again.
  void checkJournals(const QRTURL& directory, const char* kind, const char* what) {
    QRTErrorRef error;
    auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &error);
    for (const QRTURL& item : items.value_or(std::vector<QRTURL>{})) {
      struct stat st;
      if (platform::safeStat(item.path(), &st) != 0 || st.st_mtime >= gStartedAt) continue;
      add(kind, Severity::warning, item.path(), what, "restart quarterd; its start-up recovery takes it up");
    }
  }

  void checkDatabase() {
    QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
    if (!mapping) {
      add("codesign-unavailable", Severity::error, "code-signing database", "the database could not be opened",
          "check the daemon's log");
      return;
    }
    QRTCodeSigningMapping::DatabaseCheck check = mapping->checkDatabase(repair_);
    for (const std::string& problem : check.problems)
      add("codesign-integrity", Severity::error, "code-signing database", problem,
          "stop quarterd and restore the database from a backup");
    const size_t first = report_.findings.size();
    for (const std::string& identifier : check.withoutBundle)
      add("codesign-orphan", Severity::warning, identifier, "its bundle container is gone",
          "invalidate its code-signing information");
    if (repair_ && first < report_.findings.size()) {
      const bool invalidated = mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer() == QRTErrorNone;
      for (size_t i = first; i < report_.findings.size(); ++i) report_.findings[i].repaired = invalidated;
    }
    for (QRTGroupType type : check.driftedCounts)
      add("group-count-drift", Severity::warning, type == QRTGroupTypeSystem ? "system groups" : "application groups",
          "the kept reference counts differ from the database's", "count the references afresh")
          .repaired = repair_;
  }

  bool repair_;
  QRTVerifyReport report_;
};

}  // namespace

const char* QRTFindingSeverityName(Severity severity) {
  switch (severity) {
    case Severity::notice: return "notice";
    case Severity::warning: return "warning";
    case Severity::error: return "error";
  }
  return "error";
}

QRTVerifyReport QRTVerifyStore(bool repair) {
  const auto started = std::chrono::steady_clock::now();
  QRTVerifyReport report = Verifier(repair).run();
  size_t repaired = 0;
  for (const QRTFinding& finding : report.findings) repaired += finding.repaired ? 1 : 0;
  QRTLog(
      kLogNotice, "verify%s: %llu containers, %llu findings, %llu repaired, %lld ms", repair ? " --repair" : "",
      static_cast<unsigned long long>(report.containers), static_cast<unsigned long long>(report.findings.size()),
      static_cast<unsigned long long>(repaired),
      static_cast<long long>(
          std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - started).count()));
  return report;
}
