// The configuration objects are process-wide, so the whole executable runs on
// one temporary device root set up before the first sharedInstance() call.
#include <gtest/gtest.h>
#include <unistd.h>

#include <optional>
#include <thread>
#include <vector>

#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"

namespace fs = std::filesystem;

namespace {

std::string gRoot;

void appendFile(const std::string& path, const std::string& text) { std::ofstream(path, std::ios::app) << text; }

class LayoutEnvironment : public ::testing::Environment {
 public:
  void SetUp() override {
    umask(022);
    gRoot = fs::canonical(tmp_.emplace("/tmp/qrt-layout").path());
    for (const char* home : {"/etc", "/private/var/emplacerd", "/private/var/mobile", "/private/var/real504"})
      fs::create_directories(gRoot + home);
    fs::create_directory_symlink(gRoot + "/private/var/real504", gRoot + "/private/var/link504");
    appendFile(gRoot + "/etc/passwd",
               "root:x:0:0::/private/var/root:/bin/sh\n"
               "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
               "_system:x:499:499::/private/var/empty:/bin/false\n"
               "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
               "second:x:502:502::/private/var/users/second:/bin/sh\n"
               "linked:x:504:504::/private/var/link504:/bin/sh\n"
               "nohome:x:505:505:::/bin/sh\n");
    platform::setDeviceRoot(gRoot);
  }
  void TearDown() override { tmp_.reset(); }
  std::optional<TempDir> tmp_;
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

TEST(StoreLayoutGlobal, GettersCreateTheirDirectoriesAgainOnceRemoved) {
  // Where they lie is checked end to end through the paths the daemon hands out.
  EXPECT_EQ(config().currentMobileUserId(), 501u);
  for (const QRTURL& url : {config().sharedContainersDirectory(), config().bundleDirectory(), config().logDirectory(),
                            config().cachesDirectory(), config().libraryDirectory(), config().transientDirectory(),
                            config().stagingDirectory(), config().deathrowDirectory(), config().replaceDirectory(),
                            config().pendingUpdatesDirectory()})
    expectDirectory(url.path(), 0);
  for (const QRTURL& url : {config().logDirectory(), config().cachesDirectory(), config().libraryDirectory()})
    EXPECT_EQ(protectionClassOf(url.path()), 4) << url.path();
  EXPECT_EQ(protectionClassOf(config().stagingDirectory().path()), 0);

  // Each of the three levels belongs to the installer.
  config().transientBundleDirectory();
  const std::string installer = host("/private/var/emplacerd");
  for (const char* level : {"/Library", "/Library/Caches", "/Library/Caches/com.norvane.quarterd"})
    expectDirectory(installer + level, 33);

  QRTURL staging = config().stagingDirectory();
  fs::remove_all(staging.path());
  EXPECT_EQ(config().stagingDirectory(), staging);
  expectDirectory(staging.path(), 0);

  fs::remove_all(host("/private/var/mobile/Containers"));
  ASSERT_TRUE(config().containerDirectoryURLForUser(501, 2, false));
  expectDirectory(host("/private/var/mobile/Containers"), 501);
  expectDirectory(host("/private/var/mobile/Containers/Data/Application"), 501);
}

TEST(StoreLayoutClasses, ClassDirectoriesAndOwnersAndInvalidClasses) {
  for (uint64_t cls = 1; cls <= 13; ++cls) {
    const bool global = cls == 1 || cls == 3 || cls == 5 || cls == 8 || cls >= 12;
    const uint32_t user = !global ? 502 : cls >= 12 ? 499 : 33;
    auto url = config().containerDirectoryURLForUser(user, cls, false);
    ASSERT_TRUE(url) << cls;
    EXPECT_TRUE(url->path().starts_with(host(global ? "/private/var/containers/" : "/private/var/users/second/")));
    expectDirectory(url->path(), cls >= 12 ? 0 : user);
  }
  const std::string userCaches = "/private/var/users/second/Library/Caches/com.norvane.quarterd";
  const std::vector<std::tuple<uint32_t, uint64_t, std::string, uint32_t>> transient = {
      {33, 5, "/private/var/emplacerd/Library/Caches/com.norvane.quarterd/Bundle/VPNPlugin", 33},
      {499, 12, "/private/var/root/Library/Caches/com.norvane.quarterd/Temp/Data/System", 0},
      {502, 2, userCaches + "/Temp/Data/Application", 502}};
  for (const auto& [user, cls, devicePath, owner] : transient) {
    auto url = config().containerDirectoryURLForUser(user, cls, true);
    ASSERT_TRUE(url) << cls;
    EXPECT_EQ(url->path(), host(devicePath));
    expectDirectory(url->path(), owner);
  }
  expectDirectory(host(userCaches + "/Temp"), 502);

  // Invalid classes give nothing, and global base URLs are not created.
  auto mobile = config().getPerUserConfigurationForUserId(501);
  for (uint64_t cls : {uint64_t{0}, uint64_t{14}, UINT64_MAX}) {
    EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(cls, true)) << cls;
    EXPECT_FALSE(config().containerDirectoryURLForUser(501, cls, false)) << cls;
    EXPECT_FALSE(mobile->containerDirectoryURLForContentClass(cls, false)) << cls;
  }
  EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(2, false));
  EXPECT_FALSE(mobile->containerDirectoryURLForContentClass(12, true));

  fs::remove_all(host("/private/var/containers/Bundle/Framework"));
  auto url = config().globalContainerBaseURLWithContentClass(8, false);
  ASSERT_TRUE(url);
  EXPECT_EQ(url->path(), host("/private/var/containers/Bundle/Framework"));
  EXPECT_FALSE(fs::exists(url->path()));
}

TEST(StoreLayoutPerUser, HomesAndBackupPathsAndUsersWithoutAccountOrHome) {
  auto mobile = config().getPerUserConfigurationForCurrentMobileUser();
  ASSERT_TRUE(mobile->systemGroupContainerBackupDirectory());
  EXPECT_FALSE(fs::exists(host("/private/var/mobile/Library/Backup"))) << "named, not made";
  auto linked = config().getPerUserConfigurationForUserId(504);
  // A home reached through a link is taken as written, and refused when used.
  EXPECT_EQ(linked->userHomeDirectory().value_or(QRTURL()).path(), host("/private/var/link504"));
  linked->userBaseDirectory();
  EXPECT_FALSE(fs::exists(host("/private/var/real504/Containers")));

  // 502's home is made by the first getter that needs it.
  fs::remove_all(host("/private/var/users"));
  auto second = config().getPerUserConfigurationForUserId(502);
  EXPECT_FALSE(second->existsUserBaseDirectory());
  ASSERT_TRUE(second->userBaseDirectory());
  EXPECT_TRUE(second->existsUserBaseDirectory());

  // A user without an account or a home gets nothing until added.
  for (uint32_t uid : {777u, 505u}) {
    auto user = config().getPerUserConfigurationForUserId(uid);
    EXPECT_FALSE(user->userHomeDirectory() || user->existsUserBaseDirectory() || user->transientDirectory() ||
                 user->oldLoggingPath())
        << uid;
    for (uint64_t cls : {2, 4, 6, 7, 9, 10, 11}) {
      EXPECT_FALSE(config().containerDirectoryURLForUser(uid, cls, false)) << cls;
      EXPECT_FALSE(config().containerDirectoryURLForUser(uid, cls, true)) << cls;
    }
  }
  appendFile(host("/etc/passwd"), "late:x:777:777::/private/var/late:/bin/sh\n");
  auto late = config().containerDirectoryURLForUser(777, 2, false);
  ASSERT_TRUE(late);
  EXPECT_EQ(late->path(), host("/private/var/late/Containers/Data/Application"));
}

TEST(StoreLayoutPerUser, ConcurrentLookUpsShareOneObjectAndDirectory) {
  std::shared_ptr<QRTPerUserConfiguration> seen[4];
  std::vector<std::thread> threads;
  for (auto& slot : seen) {
    threads.emplace_back([&slot] {
      for (int round = 0; round < 50; ++round) {
        slot = config().getPerUserConfigurationForUserId(501);
        EXPECT_TRUE(config().containerDirectoryURLForUser(501, 7, false));  // created by whoever comes first
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& configuration : seen) EXPECT_EQ(configuration, seen[0]);
}

}  // namespace
