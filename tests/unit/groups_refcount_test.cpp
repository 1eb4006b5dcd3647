// Group container reference counting against the real mapping and store: a
// group's container goes exactly when the last program naming it drops it.
#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <set>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTMetadata.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"

namespace {

std::optional<TempDir> gTmp;

class GroupRefcountTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    const std::string root = gTmp.emplace("/tmp/qrt-groups").path();
    std::string script = std::string(QRT_TEST_SOURCE_DIR) + "/../scripts/make-device-root";
    ASSERT_EQ(system((script + " " + root).c_str()), 0);
    platform::setDeviceRoot(root);
    // The mapping's first whole read waits a second before it is put in: the
    // first tests' writes land meanwhile and must be read back over it.
    std::ofstream(root + "/run/quarterd.pausepoint") << "first-snapshot-read";
    ASSERT_NE(QRTCodeSigningMapping::sharedInstance(), nullptr);
  }
  static void TearDownTestSuite() { gTmp.reset(); }

  static uint64_t registerWith(const std::string& program, plist::Dictionary entitlements,
                               const plist::Dictionary& options = {}) {
    plist::Dictionary info{{QRTCodeSigningEntitlementsKey, std::move(entitlements)}};
    return mapping().processCodeSigningInfo(&info, program, &options);
  }
  static uint64_t registerGroups(const std::string& program, const std::vector<std::string>& groups) {
    return registerWith(program, {{QRTApplicationGroupsEntitlement, plist::Array(groups.begin(), groups.end())}});
  }
  static uint64_t drop(const std::string& program) {
    return mapping().processCodeSigningInfo(nullptr, program, nullptr);
  }
  static QRTCodeSigningMapping& mapping() { return *QRTCodeSigningMapping::sharedInstance(); }

  // Makes the program's group containers the way command 13 does.
  static std::map<std::string, std::string> paths(const std::string& program) {
    QRTClientConnection client(program, 0, false, std::nullopt);
    uint64_t code = 1;
    auto found = QRTGroupManager::defaultManager().groupContainerPathsForUser(501, client, program, &mapping(), &code);
    EXPECT_EQ(code, 1u);
    return found ? *found : std::map<std::string, std::string>{};
  }
  static bool present(const std::string& group) {
    QRTErrorRef error;
    return QRTContainerCache::sharedInstance().containerForUser({501, 7, group}, &error) != nullptr;
  }
};

TEST_F(GroupRefcountTest, ContainerGoesWithTheLastProgramNamingItAndNoSooner) {
  std::mt19937 random(20261123);
  std::map<std::string, std::vector<std::string>> named;
  for (int p = 0; p < 50; ++p) {
    std::vector<std::string> groups;
    for (int g = 0; g < 10; ++g) {
      if (random() % 3 == 0) groups.push_back("group.shared." + std::to_string(g));
    }
    const std::string program = "com.example.member." + std::to_string(p);
    named[program] = groups;
    ASSERT_EQ(registerGroups(program, groups), 1u);
    EXPECT_EQ(paths(program).size(), groups.size()) << program;
  }
  // Some programs change their groups; the kept counts follow every write.
  for (int p = 0; p < 50; p += 5) {
    const std::string program = "com.example.member." + std::to_string(p);
    std::vector<std::string>& groups = named[program];
    if (!groups.empty()) groups.erase(groups.begin());
    groups.push_back("group.shared." + std::to_string(p % 10));
    ASSERT_EQ(registerGroups(program, groups), 1u);
    paths(program);
  }
  EXPECT_TRUE(mapping().groupReferenceCountsMatchDatabase());
  std::vector<std::string> order;
  for (const auto& [program, groups] : named) order.push_back(program);
  std::shuffle(order.begin(), order.end(), random);
  for (const std::string& program : order) {
    const uint64_t before = mapping().generation();
    ASSERT_EQ(drop(program), 1u);
    EXPECT_GT(mapping().generation(), before);
    named.erase(program);
    std::set<std::string> stillNamed;
    for (const auto& [remaining, groups] : named) stillNamed.insert(groups.begin(), groups.end());
    for (int g = 0; g < 10; ++g) {
      const std::string group = "group.shared." + std::to_string(g);
      EXPECT_EQ(present(group), stillNamed.count(group) == 1) << group << " after dropping " << program;
    }
    ASSERT_TRUE(mapping().groupReferenceCountsMatchDatabase()) << "after dropping " << program;
  }

  // Reordering or repeating a registration, or reconciling, keeps the groups named.
  ASSERT_EQ(registerGroups("com.example.order", {"group.order.a", "group.order.b"}), 1u);
  ASSERT_EQ(paths("com.example.order").size(), 2u);
  const uint64_t before = mapping().generation();
  ASSERT_EQ(registerGroups("com.example.order", {"group.order.a", "group.order.b"}), 1u);
  EXPECT_EQ(mapping().generation(), before);  // the same registration writes nothing
  ASSERT_EQ(registerGroups("com.example.order", {"group.order.b", "group.order.a", "group.order.b"}), 1u);
  QRTGroupManager::defaultManager().removeReferencesForGroupIdentifiers(
      QRTGroupManager::droppedGroups(std::vector<std::string>{"group.order.a", "group.order.b"},
                                     std::vector<std::string>{"group.order.b", "group.order.a"}),
      QRTGroupTypeApplication, mapping().groupReferenceCounts(QRTGroupTypeApplication));
  EXPECT_TRUE(present("group.order.a"));
  EXPECT_TRUE(present("group.order.b"));

  uint64_t code = 1;
  ASSERT_TRUE(QRTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
      {501, 7, std::string("group.nobody")}, QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code));
  ASSERT_EQ(registerGroups("com.example.keeper", {"group.kept"}), 1u);
  ASSERT_EQ(paths("com.example.keeper").size(), 1u);
  mapping().performAllCodeSigningMigrationAndReconciliation();
  EXPECT_FALSE(present("group.nobody"));
  EXPECT_TRUE(present("group.kept"));
}

// After every kind of write the in-memory snapshot holds exactly the rows the
// database does, child lists included.
TEST_F(GroupRefcountTest, SnapshotFollowsEveryWrite) {
  auto withParent = [](const std::string& id) { return plist::Dictionary{{QRTCodeSigningParentBundleIDKey, id}}; };
  QRTClientConnection& internal = QRTClientConnection::sharedClientConnection();
  const std::string bundle = "com.example.snap.bundle";
  const std::vector<std::string> twoGroups{"group.snap.b", "group.snap.c"};
  const plist::Dictionary system{{QRTSystemContainerEntitlement, true},
                                 {QRTSystemGroupsEntitlement, plist::Array{"systemgroup.snap"}}},
      dataClass{{QRTCodeSigningDataContainerClassKey, 4}}, placeholder{{QRTCodeSigningPlaceholderKey, true}},
      callerRegistered{{"a", true}};
  const struct {
    const char* write;
    std::function<void()> run;
  } writes[] = {
      {"register", [&] { registerGroups("com.example.snap", {"group.snap.a"}); }},
      {"update groups", [&] { registerGroups("com.example.snap", twoGroups); }},
      {"data class", [&] { registerWith("com.example.snap", {}, dataClass); }},
      {"child", [&] { registerGroups("com.example.snap.child", {}); }},
      {"child under a parent", [&] { registerWith("com.example.snap.child", {}, withParent("com.example.snap")); }},
      {"child moved to another parent",
       [&] {
         registerGroups("com.example.snap.other", {"group.snap.a"});
         registerWith("com.example.snap.child", {}, withParent("com.example.snap.other"));
       }},
      {"placeholder", [&] { registerWith("com.example.snap.ph", {}, placeholder); }},
      {"registered by the caller",
       [&] { mapping().processCallerRegisteredEntitlements(callerRegistered, "com.example.snap.caller"); }},
      {"system container and groups", [&] { registerWith("com.example.snap.sys", system, {}); }},
      {"system container withdrawn", [&] { registerWith("com.example.snap.sys", {}, {}); }},
      {"invalidate with children",
       [&] { mapping().invalidateCodeSigningInfoForIdentifierAndItsChildren("com.example.snap.other", nullptr); }},
      {"invalidate without bundle", [&] { mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer(); }},
      {"import from the installer's cache",
       [&] {
         uint64_t code = 1;
         auto m = internal.createOrLookupContainerForUser({QRTInstallerUserId, 1, bundle},
                                                          QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code);
         ASSERT_TRUE(m);
         const plist::Value cached =
             plist::Dictionary{{"Entitlements", plist::Dictionary{{QRTApplicationGroupsEntitlement, "group.snap.i"}}}};
         internal.setInfoValue(cached, std::string(QRTCachedCodeSigningInfoKey), QRTInstallerUserId, m->uuid(), bundle,
                               1, true, &code);
         ASSERT_EQ(code, 1u);
         EXPECT_TRUE(mapping().getCodeSigningInfoForIdentifier(bundle));
       }},
      {"migrations", [&] { mapping().performAllCodeSigningMigrationAndReconciliation(); }},
      {"remove with children",
       [&] { mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.snap"); }},
      {"remove", [&] { drop("com.example.snap.other"); }},
  };
  for (const auto& row : writes) {
    row.run();
    EXPECT_TRUE(mapping().snapshotMatchesDatabase()) << "after " << row.write;
  }
  EXPECT_EQ(mapping().dataContainerTypeForIdentifier("com.example.snap.sys"), 0u);
  EXPECT_FALSE(mapping().identifierHasSystemContainer("com.example.snap.sys"));
  EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("com.example.snap.caller"));
  EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("com.example.snap.ph"));
}

}  // namespace
