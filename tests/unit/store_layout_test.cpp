// The configuration objects are process-wide, so the whole executable runs on
// one temporary device root set up before the first sharedInstance() call.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "Daemon/QRTContentClass.h"
#include "Daemon/QRTGlobalConfiguration.h"
#include "Daemon/QRTPerUserConfiguration.h"
#include "platform/DeviceRoot.h"

namespace fs = std::filesystem;

namespace {

std::string gRoot;

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::app);
  out << text;
}

class LayoutEnvironment : public ::testing::Environment {
 public:
  void SetUp() override {
    umask(022);
    char templ[] = "/tmp/qrt-layout-XXXXXX";
    ASSERT_NE(mkdtemp(templ), nullptr);
    char* resolved = realpath(templ, nullptr);
    gRoot = resolved;
    free(resolved);
    fs::create_directories(gRoot + "/etc");
    fs::create_directories(gRoot + "/private/var/emplacerd");
    fs::create_directories(gRoot + "/private/var/mobile");
    fs::create_directories(gRoot + "/private/var/real504");
    fs::create_directory_symlink(gRoot + "/private/var/real504", gRoot + "/private/var/link504");
    writeFile(gRoot + "/etc/passwd",
              "root:x:0:0::/private/var/root:/bin/sh\n"
              "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
              "_system:x:499:499::/private/var/empty:/bin/false\n"
              "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
              "second:x:502:502::/private/var/users/second:/bin/sh\n"
              "linked:x:504:504::/private/var/link504:/bin/sh\n"
              "nohome:x:505:505:::/bin/sh\n");
    platform::setDeviceRoot(gRoot);
  }
  void TearDown() override { fs::remove_all(gRoot); }
};

const auto* const gEnvironment = ::testing::AddGlobalTestEnvironment(new LayoutEnvironment);

QRTGlobalConfiguration& config() { return QRTGlobalConfiguration::sharedInstance(); }

std::string host(const std::string& devicePath) { return gRoot + devicePath; }

// Directory with mode 0755 owned by owner:owner.
void expectDirectory(const std::string& path, uint32_t owner) {
  struct stat st;
  ASSERT_EQ(lstat(path.c_str(), &st), 0) << path;
  EXPECT_TRUE(S_ISDIR(st.st_mode)) << path;
  EXPECT_EQ(st.st_mode & 07777, 0755u) << path;
  EXPECT_EQ(st.st_uid, owner) << path;
  EXPECT_EQ(st.st_gid, owner) << path;
}

int32_t protectionClassOf(const std::string& path) {
  uint8_t b[4] = {};
  if (getxattr(path.c_str(), "trusted.com.norvane.protection-class", b, sizeof b) != sizeof b) return 0;
  return static_cast<int32_t>(b[0] | b[1] << 8 | b[2] << 16 | static_cast<uint32_t>(b[3]) << 24);
}

TEST(StoreLayoutGlobal, GettersCreateTheirDirectories) {
  EXPECT_EQ(config().homeDirectory().path(), host("/private/var/root"));
  EXPECT_EQ(config().currentMobileUserId(), 501u);
  const std::string caches = "/private/var/root/Library/Caches/com.norvane.quarterd";
  const std::string library = "/private/var/root/Library/QuarterKit";
  const std::vector<std::pair<QRTURL, std::string>> rows = {
      {config().sharedContainersDirectory(), "/private/var/containers"},
      {config().bundleDirectory(), "/private/var/containers/Bundle"},
      {config().logDirectory(), "/private/var/root/Library/Logs/QuarterKit"},
      {config().cachesDirectory(), caches},
      {config().libraryDirectory(), library},
      {config().transientDirectory(), caches + "/Temp"},
      {config().stagingDirectory(), caches + "/Staging"},
      {config().deathrowDirectory(), caches + "/Dead"},
      {config().replaceDirectory(), library + "/Replace"},
      {config().pendingUpdatesDirectory(), library + "/PendingUpdates"},
  };
  for (const auto& [url, devicePath] : rows) {
    EXPECT_EQ(url.path(), host(devicePath));
    expectDirectory(url.path(), 0);
  }
  EXPECT_EQ(protectionClassOf(config().logDirectory().path()), 4);
  EXPECT_EQ(protectionClassOf(config().cachesDirectory().path()), 4);
  EXPECT_EQ(protectionClassOf(config().libraryDirectory().path()), 4);
  EXPECT_EQ(protectionClassOf(config().stagingDirectory().path()), 0);

  // Each of the three levels belongs to the installer.
  QRTURL transientBundle = config().transientBundleDirectory();
  EXPECT_EQ(transientBundle.path(), host("/private/var/emplacerd/Library/Caches/com.norvane.quarterd"));
  expectDirectory(host("/private/var/emplacerd/Library"), 33);
  expectDirectory(host("/private/var/emplacerd/Library/Caches"), 33);
  expectDirectory(transientBundle.path(), 33);
}

TEST(StoreLayoutGlobal, RemovedDirectoriesComeBack) {
  QRTURL staging = config().stagingDirectory();
  fs::remove_all(staging.path());
  EXPECT_EQ(config().stagingDirectory(), staging);
  expectDirectory(staging.path(), 0);

  fs::remove_all(host("/private/var/emplacerd/Library"));
  config().transientBundleDirectory();
  expectDirectory(host("/private/var/emplacerd/Library/Caches/com.norvane.quarterd"), 33);

  fs::remove_all(host("/private/var/mobile/Containers"));
  auto classDirectory = config().containerDirectoryURLForUser(501, 2, false);
  ASSERT_TRUE(classDirectory);
  expectDirectory(host("/private/var/mobile/Containers"), 501);
  expectDirectory(classDirectory->path(), 501);
}

TEST(StoreLayoutGlobal, MigrationFileExistsOnlyDirectlyInTheLibrary) {
  writeFile(config().libraryDirectory().path() + "/qrt_marker", "x");
  EXPECT_TRUE(config().migrationFileExistsWithName("qrt_marker"));
  EXPECT_FALSE(config().migrationFileExistsWithName("qrt_absent"));
  EXPECT_FALSE(config().migrationFileExistsWithName("../QuarterKit/qrt_marker"));
}

TEST(StoreLayoutClasses, ClassDirectoriesAndOwners) {
  for (uint64_t cls = 1; cls <= 13; ++cls) {
    const bool global = cls == 1 || cls == 3 || cls == 5 || cls == 8 || cls >= 12;
    const uint32_t user = !global ? 502 : cls >= 12 ? 499 : 33;
    auto url = config().containerDirectoryURLForUser(user, cls, false);
    ASSERT_TRUE(url) << cls;
    const std::string base = global ? host("/private/var/containers/") : host("/private/var/users/second/Containers/");
    EXPECT_EQ(url->path(), base + QRTContentClassPathName(cls));
    expectDirectory(url->path(), cls >= 12 ? 0 : user);
  }
}

TEST(StoreLayoutClasses, TransientClassDirectories) {
  auto bundle = config().containerDirectoryURLForUser(33, 5, true);
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->path(), host("/private/var/emplacerd/Library/Caches/com.norvane.quarterd/Bundle/VPNPlugin"));
  expectDirectory(bundle->path(), 33);

  auto system = config().containerDirectoryURLForUser(499, 12, true);
  ASSERT_TRUE(system);
  EXPECT_EQ(system->path(), host("/private/var/root/Library/Caches/com.norvane.quarterd/Temp/Data/System"));
  expectDirectory(system->path(), 0);

  auto data = config().containerDirectoryURLForUser(502, 2, true);
  ASSERT_TRUE(data);
  EXPECT_EQ(data->path(), host("/private/var/users/second/Library/Caches/com.norvane.quarterd/Temp/Data/Application"));
  expectDirectory(host("/private/var/users/second/Library/Caches/com.norvane.quarterd/Temp"), 502);
  expectDirectory(data->path(), 502);
}

TEST(StoreLayoutClasses, InvalidClassesGiveNothing) {
  auto mobile = config().getPerUserConfigurationForUserId(501);
  for (uint64_t cls : {uint64_t{0}, uint64_t{14}, UINT64_MAX}) {
    EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(cls, true)) << cls;
    EXPECT_FALSE(config().containerDirectoryURLForUser(501, cls, false)) << cls;
    EXPECT_FALSE(mobile->containerDirectoryURLForContentClass(cls, false)) << cls;
  }
  EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(2, false));
  EXPECT_FALSE(mobile->containerDirectoryURLForContentClass(12, true));
}

TEST(StoreLayoutClasses, GlobalBaseURLIsNotCreated) {
  fs::remove_all(host("/private/var/containers/Bundle/Framework"));
  auto url = config().globalContainerBaseURLWithContentClass(8, false);
  ASSERT_TRUE(url);
  EXPECT_EQ(url->path(), host("/private/var/containers/Bundle/Framework"));
  EXPECT_FALSE(fs::exists(url->path()));
}

TEST(StoreLayoutPerUser, HomesAndBackupPaths) {
  auto mobile = config().getPerUserConfigurationForCurrentMobileUser();
  EXPECT_EQ(config().getPerUserConfigurationForUserId(501), mobile);
  ASSERT_TRUE(mobile->userHomeDirectory());
  EXPECT_EQ(mobile->userHomeDirectory()->path(), host("/private/var/mobile"));
  EXPECT_EQ(mobile->systemGroupContainerBackupDirectory()->path(),
            host("/private/var/mobile/Library/Backup/SystemContainers/Shared"));
  EXPECT_FALSE(fs::exists(host("/private/var/mobile/Library/Backup")));

  auto linked = config().getPerUserConfigurationForUserId(504);
  ASSERT_TRUE(linked->userHomeDirectory());
  EXPECT_EQ(linked->userHomeDirectory()->path(), host("/private/var/real504"));

  // 502's home is made by the first getter that needs it.
  fs::remove_all(host("/private/var/users"));
  auto second = config().getPerUserConfigurationForUserId(502);
  EXPECT_FALSE(second->existsUserBaseDirectory());
  ASSERT_TRUE(second->userBaseDirectory());
  EXPECT_TRUE(second->existsUserBaseDirectory());
}

TEST(StoreLayoutPerUser, UserWithoutAccountGivesNothing) {
  for (uint32_t uid : {777u, 505u}) {
    auto user = config().getPerUserConfigurationForUserId(uid);
    EXPECT_FALSE(user->userHomeDirectory()) << uid;
    EXPECT_FALSE(user->existsUserBaseDirectory());
    EXPECT_FALSE(user->transientDirectory());
    EXPECT_FALSE(user->oldLoggingPath());
    for (uint64_t cls : {2, 4, 6, 7, 9, 10, 11}) {
      EXPECT_FALSE(config().containerDirectoryURLForUser(uid, cls, false)) << cls;
      EXPECT_FALSE(config().containerDirectoryURLForUser(uid, cls, true)) << cls;
    }
  }
  // An account added later is found at the next look-up.
  writeFile(host("/etc/passwd"), "late:x:777:777::/private/var/late:/bin/sh\n");
  auto late = config().containerDirectoryURLForUser(777, 2, false);
  ASSERT_TRUE(late);
  EXPECT_EQ(late->path(), host("/private/var/late/Containers/Data/Application"));
}

TEST(StoreLayoutPerUser, ConcurrentLookUpsShareOneObject) {
  std::vector<std::thread> threads;
  std::vector<std::shared_ptr<QRTPerUserConfiguration>> seen(8);
  for (size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&seen, i] {
      for (int round = 0; round < 50; ++round) {
        seen[i] = config().getPerUserConfigurationForUserId(501);
        config().containerDirectoryURLForUser(501, 7, false);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& configuration : seen) EXPECT_EQ(configuration, seen[0]);
}

}  // namespace
