// Creating and finding containers through the real daemon: what lands on
// disk, what the cache remembers across restarts, and crash safety.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <set>
#include <thread>

#include "DaemonFixture.h"
#include "base/QRTUUID.h"

namespace {

using StoreTest = DaemonFixture;

TEST_F(StoreTest, NewDataContainerIsCompleteOnDiskAndMapped) {
  Container made = createOrLookup(501, "com.example.app", 2);
  ASSERT_EQ(made.error, 1u);
  EXPECT_FALSE(made.existed);
  EXPECT_EQ(made.identifier, "com.example.app");
  ASSERT_EQ(parentOf(made.path), appClassDir());
  // The directory is named by a fresh upper-case UUID of its own.
  const std::string name = baseName(made.path);
  auto directoryUUID = QRTUUID::fromString(name);
  ASSERT_TRUE(directoryUUID);
  EXPECT_EQ(directoryUUID->UUIDString(), name);
  ASSERT_NE(made.uuid, QRTUUID());
  EXPECT_NE(made.uuid, *directoryUUID);

  EXPECT_EQ(readPlist(made.path + "/" + kMetadataFile), (plist::Dictionary{{"QRTMetadataIdentifier", "com.example.app"},
                                                                           {"QRTMetadataUUID", made.uuid.UUIDString()},
                                                                           {"QRTMetadataContentClass", 2u},
                                                                           {"QRTMetadataPersona", 501u}}));

  auto entries = listDirectory(made.path);
  EXPECT_EQ(std::set<std::string>(entries.begin(), entries.end()),
            (std::set<std::string>{kMetadataFile, "Documents", "Library", "tmp"}));
  for (const char* sub : {"", "/Documents", "/Library", "/Library/Caches", "/Library/Preferences", "/tmp"})
    EXPECT_EQ(ownerAndMode(made.path + sub), std::pair(501u, 0755u)) << sub;

  EXPECT_EQ(readLink(root + "/run/sandbox/mappings/501/1/com.example.app"), made.path);
}

TEST_F(StoreTest, TransientContainerIsReplacedOnEveryCall) {
  Container first = make(501, "com.example.tmp", 2, true);
  EXPECT_NE(first.path.find("/Library/Caches/com.norvane.quarterd/Temp/Data/Application/"), std::string::npos);
  Container second = make(501, "com.example.tmp", 2, true);
  EXPECT_FALSE(second.existed);
  EXPECT_NE(second.path, first.path);
  EXPECT_NE(second.uuid, first.uuid);
  EXPECT_NE(access(first.path.c_str(), F_OK), 0);
  EXPECT_EQ(access(second.path.c_str(), F_OK), 0);
}

TEST_F(StoreTest, RefusalsLeaveNothingOnDisk) {
  Container missing = createOrLookup(501, "com.example.none", 2, false);
  EXPECT_EQ(missing.error, 21u);
  EXPECT_TRUE(missing.path.empty());
  EXPECT_TRUE(listDirectory(appClassDir()).empty());
  EXPECT_TRUE(listDirectory(daemonCaches() + "/Staging").empty());

  EXPECT_EQ(createOrLookup(501, "com.example.app", 1).error, 55u);  // a bundle class needs the entitlement first
  // A system container of another program needs look-up rights.
  setOwnIdentity("com.example.me", {{QRTEntitlementOtherIdLookup, false}});
  EXPECT_EQ(createOrLookup(499, "com.example.other", 12).error, 55u);
  EXPECT_EQ(createOrLookup(499, "com.example.other", 12, true, false, QRTCommandSystemContainerPath).error, 55u);
  EXPECT_TRUE(listDirectory(root + "/private/var/containers/Data/System").empty());
}

TEST_F(StoreTest, BundleAndWellKnownSystemContainers) {
  setOwnIdentity("com.example.installer", {{QRTEntitlementAllowed, true}});
  Container bundle = createOrLookup(33, "com.example.app", 1);
  ASSERT_EQ(bundle.error, 1u);
  EXPECT_EQ(bundle.path.rfind(root + "/private/var/containers/Bundle/Application/", 0), 0u);
  EXPECT_EQ(listDirectory(bundle.path), std::vector<std::string>{kMetadataFile});
  EXPECT_EQ(ownerAndMode(bundle.path).first, 33u);

  // Any caller reaches a well-known system container, under its own name.
  clearOwnIdentity();
  Container system = createOrLookup(0, "com.norvane.mapsd", 12, true, false, QRTCommandSystemContainerPath);
  ASSERT_EQ(system.error, 1u);
  EXPECT_EQ(system.path, root + "/private/var/containers/Data/System/com.norvane.mapsd");
  EXPECT_GT(getxattr(system.path.c_str(), "system.posix_acl_access", nullptr, 0), 0);
  EXPECT_GT(getxattr(system.path.c_str(), "system.posix_acl_default", nullptr, 0), 0);
  EXPECT_EQ(ownerAndMode(system.path + "/Library"), std::pair(4294967294u, 070u));  // group bits: the ACL mask
}

TEST_F(StoreTest, ContainerDeletedByHandIsForgotten) {
  Container made = make(501, "com.example.gone", 2);
  ASSERT_EQ(system(("rm -rf " + made.path).c_str()), 0);
  EXPECT_EQ(createOrLookup(501, "com.example.gone", 2, false).error, 44u);
  EXPECT_EQ(createOrLookup(501, "com.example.gone", 2, false).error, 21u);
  EXPECT_EQ(createOrLookup(501, "com.example.gone", 2, true).error, 1u);
}

TEST_F(StoreTest, RestartFindsEveryContainerAgain) {
  std::map<std::string, Container> made;
  for (int i = 0; i < 5; ++i) {
    std::string id = "com.example.app" + std::to_string(i);
    made[id] = make(501, id, i % 2 ? 2 : 4);
  }
  // A container whose metadata names class 2 but lies among class 4 is ignored.
  std::string stray = root + "/private/var/mobile/Containers/Data/AddonPlugin/" + QRTUUID::random().UUIDString();
  ASSERT_EQ(system(("cp -a " + made["com.example.app1"].path + " " + stray).c_str()), 0);

  killDaemon();
  startDaemon();
  for (const auto& [id, c] : made) {
    Container found = createOrLookup(501, id, c.cls, false);
    EXPECT_EQ(found.error, 1u) << id;
    EXPECT_TRUE(found.existed);
    EXPECT_EQ(found.path, c.path);
    EXPECT_EQ(found.uuid, c.uuid);
  }
  EXPECT_EQ(createOrLookup(501, "com.example.app1", 4, false).error, 21u);
}

TEST_F(StoreTest, KillDuringCreationsLeavesNoIncompleteContainer) {
  std::atomic<bool> stop{false};
  std::vector<std::thread> clients;
  for (int t = 0; t < 4; ++t)
    clients.emplace_back([&, t] {
      for (int i = 0; !stop && i < 1000; ++i)
        createOrLookup(501, "com.example.burst" + std::to_string(t * 1000 + i), 2);
    });
  std::this_thread::sleep_for(std::chrono::milliseconds(400));
  killDaemon();
  stop = true;
  for (auto& t : clients) t.join();

  const std::string classDir = appClassDir();
  auto containers = listDirectory(classDir);
  EXPECT_FALSE(containers.empty());
  for (const std::string& name : containers) {
    std::string path = classDir + "/" + name;
    EXPECT_TRUE(readPlist(path + "/" + kMetadataFile)) << path;
    for (const char* sub : {"/Documents", "/Library/Caches", "/Library/Preferences", "/tmp"})
      EXPECT_EQ(access((path + sub).c_str(), F_OK), 0) << path << sub;
  }
  startDaemon();  // the fixture's tear-down checks a clean exit
}

}  // namespace
