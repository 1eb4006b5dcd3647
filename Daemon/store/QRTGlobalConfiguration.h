// The paths of the container store that do not depend on a user, the class
// directories, and the current mobile user. Getters create their directory on
// every call, so a directory removed from under the daemon comes back at its
// next use.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/QRTURL.h"

class QRTPerUserConfiguration;

class QRTGlobalConfiguration {
 public:
  static QRTGlobalConfiguration& sharedInstance();

  // "/private/var/root/" under the device root.
  const QRTURL& homeDirectory() const { return homeDirectory_; }
  // "/private/var/emplacerd/" under the device root.
  const QRTURL& emplacerdHomeDirectory() const { return emplacerdHomeDirectory_; }
  // kNoDefaultUser in the host profile when no DefaultUser= names an account.
  uint32_t currentMobileUserId() const { return currentMobileUserId_; }
  static constexpr uint32_t kNoDefaultUser = 4294967294u;

  QRTURL sharedContainersDirectory();
  QRTURL bundleDirectory();
  // Not cached: computed on every call.
  QRTURL logDirectory();
  QRTURL cachesDirectory();
  QRTURL libraryDirectory();
  QRTURL transientDirectory();
  QRTURL stagingDirectory();
  QRTURL deathrowDirectory();
  // Where the item at url is built or sent on its way out, on url's own file
  // system so that it is only ever renamed: the daemon's staging (death-row)
  // directory when it shares url's file system, otherwise ".staging"
  // (".deathrow") in the user base that holds url, made by root with mode
  // 0700 and checked to be root's and not a link at every call. Nothing,
  // with a log line, when neither fits.
  std::optional<QRTURL> stagingDirectoryForURL(const QRTURL& url);
  std::optional<QRTURL> deathrowDirectoryForURL(const QRTURL& url);
  // The daemon's directory and those of the user bases known so far that
  // pass the checks, for death-row passes and start-up clean-up.
  std::vector<QRTURL> allStagingDirectories();
  std::vector<QRTURL> allDeathrowDirectories();
  // Start-up: makes known every user whose base holds such a directory, so
  // that clean-up and passes reach what an earlier run left there.
  void loadUsersWithLeftovers();

  // How many containers of one class a user other than root may hold.
  size_t maxContainersPerClass() const;
  QRTURL replaceDirectory();
  QRTURL pendingUpdatesDirectory();
  QRTURL transientBundleDirectory();

  // The class directory of a global class, not itself created; nothing for
  // any other class.
  std::optional<QRTURL> globalContainerBaseURLWithContentClass(uint64_t contentClass, bool transient);
  // The class directory, created; nothing for an invalid class or a per-user
  // class of a user without an account.
  std::optional<QRTURL> containerDirectoryURLForUser(uint32_t userId, uint64_t contentClass, bool transient);

  // Never null. Users without an account are not kept, so that made-up user
  // ids cannot grow the map and an account added later is found.
  std::shared_ptr<QRTPerUserConfiguration> getPerUserConfigurationForUserId(uint32_t userId);
  std::shared_ptr<QRTPerUserConfiguration> getPerUserConfigurationForCurrentMobileUser();

  // The top-level items of an application data container.
  static const std::vector<std::string>& appUserDataItemNames();
  // Whether an item of that name lies directly in libraryDirectory.
  bool migrationFileExistsWithName(const std::string& name);

 private:
  QRTGlobalConfiguration();

  std::optional<QRTURL> directoryOnFileSystemOf(const QRTURL& url, const QRTURL& daemonDirectory, const char* name);
  std::vector<QRTURL> allDirectories(const QRTURL& daemonDirectory, const char* name);

  // Computes the URL into slot on first use, then creates the directory.
  QRTURL cachedDirectory(std::optional<QRTURL>& slot, const char* getter, QRTURL (*compute)(QRTGlobalConfiguration&),
                         int32_t protectionClass, const char* failureMessage);

  std::recursive_mutex lock_;
  QRTURL homeDirectory_;
  QRTURL emplacerdHomeDirectory_;
  uint32_t currentMobileUserId_ = 0;
  std::map<uint32_t, std::shared_ptr<QRTPerUserConfiguration>> perUserConfigurations_;

  std::optional<QRTURL> sharedContainersDirectory_;
  std::optional<QRTURL> cachesDirectory_;
  std::optional<QRTURL> libraryDirectory_;
  std::optional<QRTURL> stagingDirectory_;
  std::optional<QRTURL> deathrowDirectory_;
  std::optional<QRTURL> replaceDirectory_;
  std::optional<QRTURL> pendingUpdatesDirectory_;
  std::optional<QRTURL> bundleDirectory_;
  std::optional<QRTURL> transientDirectory_;
};
