// Commands 25 to 29: the retry test, shared content, the network extension
// and user-managed assets, with paths and links a container's owner plants.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "DaemonFixture.h"

namespace {

class SpecialCommandsTest : public DaemonFixture {};

TEST_F(SpecialCommandsTest, UserManagedAssetsStayInsideTheirDirectory) {
  setOwnIdentity("com.example.caller", plist::Dictionary{{QRTEntitlementUserManagedAssets, true}});
  Container app = make(501, "com.example.app", 2);
  // "UserID" is ignored: the mobile user's container is meant.
  auto first =
      call(QRTCommandUserManagedAssetsPath, {{QRTKeyIdentifier, "com.example.app"}, {QRTKeyUserID, uint64_t{777}}});
  ASSERT_EQ(codeOf(first), 1u);
  const std::string assets = stringAt(first, QRTReplyKeyPath);
  EXPECT_EQ(parentOf(assets), app.path + "/Library");
  EXPECT_TRUE(baseName(assets).starts_with("com.norvane.UserManagedAssets."));
  EXPECT_EQ(ownerAndMode(assets), std::make_pair(501u, 0755u));
  auto relative =
      call(QRTCommandUserManagedAssetsPath, {{QRTKeyIdentifier, "com.example.app"}, {QRTKeyIsRelative, true}});
  EXPECT_EQ(stringAt(relative, QRTReplyKeyPath), "Library/" + baseName(assets));

  // What the owner plants, as the owner.
  const std::string outside = root + "/outside";
  ASSERT_EQ(mkdir(outside.c_str(), 0755), 0);
  writeFile(outside + "/file", "not yours");
  ASSERT_EQ(asUser(501,
                   [&] {
                     FILE* f = nullptr;
                     return mkdir((assets + "/sub").c_str(), 0755) == 0 &&
                            symlink(outside.c_str(), (assets + "/out_dir").c_str()) == 0 &&
                            symlink((outside + "/file").c_str(), (assets + "/out_file").c_str()) == 0 &&
                            symlink("sub", (assets + "/mid").c_str()) == 0 &&
                            symlink("../../../../../../outside", (assets + "/up").c_str()) == 0 &&
                            (f = fopen((assets + "/sub/file").c_str(), "w")) && fclose(f) == 0;
                   }),
            0);

  for (const char* path : {"../../Library", "sub/../sub/file", "out_dir/file", "out_dir", "out_file", "mid/file", "up",
                           "/etc/passwd", ""}) {
    EXPECT_EQ(codeOf(call(QRTCommandDeleteUserManagedAsset,
                          {{QRTKeyIdentifier, "com.example.app"}, {QRTKeySourcePath, path}})),
              10u)
        << path;
  }
  EXPECT_EQ(readFile(outside + "/file"), "not yours");
  EXPECT_TRUE(exists(root + "/etc/passwd"));
  EXPECT_EQ(listDirectory(outside).size(), 1u);
  EXPECT_EQ(codeOf(call(QRTCommandDeleteUserManagedAsset,
                        {{QRTKeyIdentifier, "com.example.app"}, {QRTKeySourcePath, "sub/file"}})),
            1u);
  EXPECT_FALSE(exists(assets + "/sub/file"));

  // The directory removed by hand is not made again.
  ASSERT_EQ(system(("rm -rf " + assets).c_str()), 0);
  EXPECT_EQ(codeOf(call(QRTCommandUserManagedAssetsPath, {{QRTKeyIdentifier, "com.example.app"}})), 11u);
  EXPECT_FALSE(exists(assets));
}

TEST_F(SpecialCommandsTest, NetworkExtensionOnlyForTheBroker) {
  setOwnIdentity("com.example.other", plist::Dictionary{{QRTEntitlementNetworkExtension, true}});
  plist::Dictionary keys{{QRTKeyIdentifier, "com.example.vpn"}, {QRTKeyContainerClass, uint64_t{6}}};
  EXPECT_EQ(codeOf(call(QRTCommandSetNetworkExtension, keys)), 49u);
  EXPECT_TRUE(listDirectory(root + "/private/var/mobile/Containers/Data/VPNPlugin").empty());
  setOwnIdentity("com.norvane.tunnelbroker", plist::Dictionary{{QRTEntitlementNetworkExtension, true}});
  EXPECT_EQ(codeOf(call(QRTCommandSetNetworkExtension, with(keys, {{QRTKeyContainerClass, uint64_t{4}}}))), 11u);
  ASSERT_EQ(codeOf(call(QRTCommandSetNetworkExtension, with(keys, {{QRTKeyUserID, uint64_t{0}}}))), 1u);
  Container vpn = createOrLookup(501, "com.example.vpn", 6, false);
  EXPECT_EQ(vpn.error, 1u);
  EXPECT_EQ(readLink(root + "/run/sandbox/mappings/501/1/com.norvane.tunnelworker"), vpn.path);
}

TEST_F(SpecialCommandsTest, SharedContentRefusesDotsAndTheUnentitled) {
  setOwnIdentity("com.example.caller", plist::Dictionary{{QRTEntitlementStageSharedContent, true}});
  plist::Dictionary keys{{QRTKeyIdentifier, "systemgroup.com.example"}, {QRTKeySourcePath, "a"}, {QRTKeyDestPath, "b"}};
  EXPECT_EQ(codeOf(call(QRTCommandStageSharedContent, with(keys, {{QRTKeySourcePath, "x/../a"}}))), 38u);
  EXPECT_EQ(codeOf(call(QRTCommandStageSharedContent, with(keys, {{QRTKeyDestPath, ".."}}))), 38u);
  EXPECT_EQ(codeOf(call(QRTCommandStageSharedContent, without(keys, QRTKeyIdentifier))), 11u);
  EXPECT_EQ(codeOf(call(QRTCommandStageSharedContent, keys)), 55u);

  // Entitled through its own entitlements: the content moves inside the
  // container, and never through a link the owner planted.
  setOwnIdentity("com.example.caller",
                 plist::Dictionary{{QRTEntitlementStageSharedContent, true},
                                   {"com.norvane.security.system-groups", plist::Array{"systemgroup.com.example"}}});
  EXPECT_EQ(codeOf(call(QRTCommandStageSharedContent, keys)), 21u)
      << "the system group container is made on demand, not here";
  auto group = at(call(QRTCommandSystemGroupContainerPaths), QRTReplyKeyGroupContainerDict);
  ASSERT_TRUE(group && group->dictionaryIf() && plist::find(*group->dictionaryIf(), "systemgroup.com.example"));
  const std::string container = plist::find(*group->dictionaryIf(), "systemgroup.com.example")->string();
  const std::string outside = root + "/outside";
  writeFile(outside, "keep");
  writeFile(container + "/a", "shared");
  ASSERT_EQ(symlink(outside.c_str(), (container + "/link").c_str()), 0);
  ASSERT_EQ(symlink(root.c_str(), (container + "/dir").c_str()), 0);
  for (const auto& [source, dest] : std::vector<std::pair<std::string, std::string>>{
           {"link", "b"}, {"a", "dir/b"}, {"/etc/passwd", "b"}, {"dir/outside", "b"}}) {
    EXPECT_EQ(
        codeOf(call(QRTCommandStageSharedContent, with(keys, {{QRTKeySourcePath, source}, {QRTKeyDestPath, dest}}))),
        10u)
        << source << " " << dest;
  }
  EXPECT_EQ(readFile(outside), "keep");
  EXPECT_FALSE(exists(root + "/b"));
  auto moved = call(QRTCommandStageSharedContent, keys);
  EXPECT_EQ(codeOf(moved), 1u);
  EXPECT_EQ(stringAt(moved, QRTReplyKeyPath), container + "/b");
  EXPECT_EQ(readFile(container + "/b"), "shared");
}

TEST_F(SpecialCommandsTest, RetryTestOnlyOnInternalBuilds) {
  setOwnIdentity("com.example.caller", plist::Dictionary{{QRTEntitlementAllowed, true}});
  plist::Dictionary keys{{QRTKeyNumRetryCrashes, uint64_t{1}}, {QRTKeyUserID, uint64_t{501}}};
  EXPECT_EQ(codeOf(call(QRTCommandRetryTest, keys)), 1u);
  EXPECT_TRUE(logContains("People really shouldn't be calling this on non-internal installs!"));
  EXPECT_TRUE(listDirectory(appClassDir()).empty());

  writePlist(root + "/etc/device-properties.plist", {{"InternalBuild", true}});
  // One crash: the daemon ends without a reply, then the next call cleans up.
  EXPECT_FALSE(call(QRTCommandRetryTest, keys));
  int status = -1;
  ASSERT_EQ(waitpid(daemon, &status, 0), daemon);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  daemon = -1;
  startDaemon();
  EXPECT_EQ(codeOf(call(QRTCommandRetryTest, keys)), 1u);
  EXPECT_EQ(createOrLookup(501, "com.norvane.retryTest", 2, false).error, 21u);
}

}  // namespace
