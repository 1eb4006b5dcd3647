// The container cache over a real class directory: building, look-ups,
// vanished containers and the sandbox mappings it pushes.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <optional>

#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"
#include "platform/SandboxMappings.h"

namespace {

std::optional<TempDir> gTmp;
std::string gRoot;

class ContainerCacheTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    gRoot = gTmp.emplace("/tmp/qrt-cache").path();
    std::string script = std::string(QRT_TEST_SOURCE_DIR) + "/../scripts/make-device-root";
    ASSERT_EQ(system((script + " " + gRoot).c_str()), 0);
    std::ofstream(gRoot + "/etc/passwd", std::ios::app) << "other:x:502:502::/private/var/other:/bin/sh\n";
    ASSERT_EQ(mkdir((gRoot + "/private/var/other").c_str(), 0755), 0);
    platform::setDeviceRoot(gRoot);
  }
  static void TearDownTestSuite() { gTmp.reset(); }

  // A container written to disk behind the cache's back.
  static QRTURL writeContainer(uint32_t user, uint64_t cls, const std::string& identifier, bool transient = false) {
    auto dir = QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(user, cls, transient);
    if (!dir) throw std::runtime_error("no class directory");
    QRTURL url = dir->URLByAppendingPathComponent(QRTUUID::random().UUIDString(), true);
    EXPECT_EQ(mkdir(url.fileSystemRepresentation(), 0755), 0);
    QRTMetadata metadata(user, QRTUUID::random(), cls, identifier, std::nullopt, url, std::nullopt);
    EXPECT_TRUE(metadata.writeMetadataToDiskWithError(nullptr));
    return url;
  }

  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
};

TEST_F(ContainerCacheTest, RejectsBadInputBeforeTouchingAnything) {
  QRTErrorRef error;
  for (const auto& [cls, identifier] : {std::pair<uint64_t, std::optional<std::string>>{0, "a"}, {14, "a"}, {2, {}}}) {
    EXPECT_FALSE(cache.containerForUser({501, cls, identifier}, &error)) << cls;
    EXPECT_EQ(error->code(), 47) << cls;
  }
  // A user that cannot own the class: the build refuses, the look-up says rebuild failed.
  EXPECT_FALSE(cache.containerForUser({501, 1, std::string("a")}, &error));
  EXPECT_EQ(error->code(), 43);
  ASSERT_TRUE(error->underlying());
  EXPECT_EQ(error->underlying()->code(), 47);
  EXPECT_TRUE(cache.removeContainerForUser(501, 2, std::string("never.there"), false, &error));
}

// Finding containers after a restart and forgetting one deleted by hand are
// the store integration tests'; here, what the cache alone decides.
TEST_F(ContainerCacheTest, UUIDMatchIsExactAndListingsDropVanishedContainers) {
  QRTURL kept = writeContainer(502, 2, "com.example.kept");
  QRTURL gone = writeContainer(502, 2, "com.example.gone");
  QRTErrorRef error;
  auto found = cache.containerForUser({502, 2, std::string("com.example.kept")}, &error);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), kept);
  // Lower case never matches the UUID's text form.
  std::string lower = found->uuid().UUIDString();
  std::transform(lower.begin(), lower.end(), lower.begin(), ::tolower);
  EXPECT_FALSE(cache.containerForUser(502, 2, std::string("com.example.kept"), lower));
  EXPECT_EQ(cache.containerForUser(502, 2, std::string("com.example.kept"), found->uuid().UUIDString()), found);

  ASSERT_EQ(system(("rm -rf " + gone.path()).c_str()), 0);
  auto all = cache.allContainersForUser(502, 2, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0]->identifier(), "com.example.kept");
}

// A look-up trusts a container directory it has seen with its metadata file
// only while the directory is the same one, unchanged since; the stamp is
// kept once the change time is more than a second old.
TEST_F(ContainerCacheTest, ALookUpSeesEveryChangeToAContainerItHasSeen) {
  const std::vector<std::pair<std::string, std::string>> changes = {
      {"removed", "rm {}/" + std::string(QRTMetadataFileName)},
      // The directory's modification time put back: its change time moves all the same.
      {"removed.and.touched", "rm {}/" + std::string(QRTMetadataFileName) + " && touch -d @0 {}"},
      {"swapped", "mv {} {}.aside && mkdir {}"},
  };
  std::vector<QRTURL> urls;
  QRTErrorRef error;
  for (const auto& [name, command] : changes) urls.push_back(writeContainer(502, 6, "com.example." + name));
  for (const auto& [name, command] : changes)
    EXPECT_TRUE(cache.containerForUser({502, 6, "com.example." + name}, &error));
  usleep(1100 * 1000);
  for (const auto& [name, command] : changes)
    for (int look = 0; look < 2; ++look) EXPECT_TRUE(cache.containerForUser({502, 6, "com.example." + name}, &error));
  for (size_t row = 0; row < changes.size(); ++row) {
    std::string shell = changes[row].second;
    for (size_t at; (at = shell.find("{}")) != std::string::npos;) shell.replace(at, 2, urls[row].path());
    ASSERT_EQ(system(shell.c_str()), 0) << shell;
    EXPECT_FALSE(cache.containerForUser({502, 6, "com.example." + changes[row].first}, &error)) << changes[row].first;
    EXPECT_EQ(error->code(), 44) << changes[row].first;
  }
}

// Entries are shared snapshots: each says which map it is in, and adding one
// under another place or flag stores a copy and leaves the given one alone.
TEST_F(ContainerCacheTest, EntriesAgreeWithTheirMapAndAreNeverChangedInPlace) {
  const QRTURL url = writeContainer(502, 4, "com.example.snap", true);
  const std::string id = "com.example.snap";
  QRTErrorRef error;
  QRTMetadataRef transient = cache.containerForUser({502, 4, id, true}, &error);
  ASSERT_TRUE(transient);
  EXPECT_TRUE(transient->transient());
  EXPECT_EQ(cache.containerForUser(502, 4, id, transient->uuid().UUIDString()), transient);

  const QRTURL moved = QRTURL::fileURL(url.path() + "-moved", true);
  QRTMetadataRef stored;
  ASSERT_TRUE(cache.addContainerMetadata(transient, 502, moved, false, false, &error, &stored));
  EXPECT_TRUE(transient->transient());
  EXPECT_EQ(transient->url(), url);
  EXPECT_FALSE(stored->transient());
  EXPECT_EQ(stored->url(), moved);
  EXPECT_TRUE(cache.removeContainerForUser(502, 4, id, false, &error));
}

TEST_F(ContainerCacheTest, SandboxMappingsFollowTheClassAndTheSystemClassBuild) {
  QRTURL live = writeContainer(499, 12, "com.example.daemon");
  writeContainer(499, 12, "com.example.transient", true);
  QRTErrorRef error;
  ASSERT_TRUE(cache.allContainersForUser(499, 12, false, &error));
  ASSERT_TRUE(cache.allContainersForUser(499, 12, true, &error));
  EXPECT_EQ(platform::sandboxStateItem(0, 4, "com.example.daemon"), live.path());
  EXPECT_EQ(platform::sandboxStateItem(0, 4, "com.example.transient"), std::nullopt);

  auto metadata = cache.containerForUser({499, 12, std::string("com.example.daemon")}, &error);
  ASSERT_TRUE(metadata);
  EXPECT_TRUE(cache.removeContainerForUser(499, 12, std::string("com.example.daemon"), false, &error));
  EXPECT_EQ(platform::sandboxStateItem(0, 4, "com.example.daemon"), std::nullopt);
  EXPECT_TRUE(cache.addContainerMetadata(metadata, 499, live, false, true, &error));
  EXPECT_EQ(platform::sandboxStateItem(0, 4, "com.example.daemon"), live.path());

  // The item type and the user follow the class.
  QRTURL url = QRTURL::fileURL("/somewhere/else", true);
  EXPECT_TRUE(cache.setSandboxContainerMappingForUser(501, "com.example.group", 7, url));
  EXPECT_EQ(platform::sandboxStateItem(501, 2, "com.example.group"), url.path());
  EXPECT_TRUE(cache.setSandboxContainerMappingForUser(501, "systemgroup.x", 13, url));
  EXPECT_EQ(platform::sandboxStateItem(0, 8, "systemgroup.x"), url.path());
  EXPECT_TRUE(cache.setSandboxContainerMappingForUser(501, "com.example.group", 7, std::nullopt));
  EXPECT_EQ(platform::sandboxStateItem(501, 2, "com.example.group"), std::nullopt);
  EXPECT_TRUE(cache.setSandboxContainerMappingForUser(33, "com.example.bundle", 1, url));
  EXPECT_FALSE(cache.setSandboxContainerMappingForUser(501, "x", 0, url));
  EXPECT_FALSE(cache.setSandboxContainerMappingForUser(501, "x", 14, url));
}

}  // namespace
