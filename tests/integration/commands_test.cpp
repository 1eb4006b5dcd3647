// The container commands through the real daemon: what each one answers,
// what it changes on disk, and the codes a client can provoke.
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <set>
#include <utility>
#include <vector>

#include "DaemonFixture.h"

namespace {

const std::set<std::string> kFreshDataContainer{kMetadataFile,    "Documents",           "Library",
                                                "Library/Caches", "Library/Preferences", "tmp"};

// Every entry below base, as paths relative to it.
std::set<std::string> tree(const std::string& base) {
  std::set<std::string> entries;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(base))
    entries.insert(std::filesystem::relative(entry.path(), base).string());
  return entries;
}

// Allocated bytes of every non-directory below base, each inode once.
uint64_t allocatedBytes(const std::string& base) {
  return std::stoull(
      "0" + output("find " + base + " ! -type d -printf '%i %b\\n' | sort -u | awk '{s += $2 * 512} END {print s}'"));
}

using Listing = std::vector<std::pair<std::string, plist::Data>>;

// Command 1's answer as sorted (identifier, UUID) pairs; arrays missing or out of step fail.
Listing listed(const std::optional<plist::Dictionary>& reply) {
  EXPECT_EQ(codeOf(reply), 1u);
  auto ids = at(reply, QRTReplyKeyIdsArray), uuids = at(reply, QRTReplyKeyUUIDsArray);
  Listing pairs;
  if (!ids || !uuids || !ids->isArray() || !uuids->isArray() || ids->array().size() != uuids->array().size()) {
    ADD_FAILURE() << "the identifier and UUID arrays are missing or out of step";
    return pairs;
  }
  for (size_t i = 0; i < ids->array().size(); ++i) {
    const plist::Data* uuid = uuids->array()[i].dataIf();
    pairs.emplace_back(plist::describe(ids->array()[i]), uuid ? *uuid : plist::Data{});
  }
  std::sort(pairs.begin(), pairs.end());
  return pairs;
}

struct CodeCase {
  const char* what;
  uint64_t command;
  plist::Dictionary keys;
  uint64_t expected;
};

class CommandTest : public InstallerFixture {
 protected:
  static plist::Dictionary unknown(const Container& c) {
    return with(selector(c), {{QRTKeyUUID, uuidData(QRTUUID::random())}});
  }

  void expectCodes(const std::vector<CodeCase>& cases) {
    for (const CodeCase& c : cases) EXPECT_EQ(codeOf(call(c.command, c.keys)), c.expected) << c.what;
  }

  // Passes run one after the other, so the start-up clean-up's has ended once this one answers.
  void settleDeathRow() { EXPECT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u); }

  std::string mapping(const std::string& id) const { return root + "/run/sandbox/mappings/501/1/" + id; }
  Container wellKnownSystemContainer() {
    EXPECT_EQ(codeOf(call(QRTCommandSystemContainerPath, {{QRTKeyIdentifier, "com.norvane.mapsd"}})), 1u);
    return make(499, "com.norvane.mapsd", 12);
  }
};

TEST_F(CommandTest, ContainersForUserListsIdentifiersAndUUIDsInStep) {
  Listing made;
  for (const char* id : {"com.example.a", "com.example.b", "com.example.c"})
    made.emplace_back(id, uuidData(make(501, id, 2).uuid));
  Container temporary = make(501, "com.example.temp", 2, true);

  EXPECT_EQ(listed(call(QRTCommandContainersForUser, {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 2u}})), made);
  EXPECT_EQ(listed(call(QRTCommandContainersForUser,
                        {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 2u}, {QRTKeyTransient, true}})),
            (Listing{{"com.example.temp", uuidData(temporary.uuid)}}));
  EXPECT_EQ(listed(call(QRTCommandContainersForUser, {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 6u}})), Listing{});
  // User 1 passes the user check for any class, so the class itself is refused.
  EXPECT_EQ(codeOf(call(QRTCommandContainersForUser, {{QRTKeyUserID, 1u}, {QRTKeyContainerClass, 14u}})), 11u);
  EXPECT_EQ(codeOf(call(QRTCommandContainersForUser, {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 1u}})), 38u);
}

TEST_F(CommandTest, InfoValuesAndMetadataSurviveARestart) {
  Container app = make(501, "com.example.app", 2);
  Container temporary = make(501, "com.example.temp", 2, true);
  const plist::Dictionary infoRequest = with(selector(app), {{QRTKeyInfoDictRequested, true}});
  EXPECT_FALSE(at(call(QRTCommandMetadataForContainer, infoRequest), QRTReplyKeyInfoDictionary)) << "no info yet";
  const plist::Dictionary values{
      {"text", "hello"},
      {"number", -7},
      {"big", uint64_t{1} << 40},
      {"bytes", plist::Data{0, 1, 2, 255}},
      {"nested", plist::Dictionary{{"list", plist::Array{"x", true, 3}}, {"inner", plist::Dictionary{{"k", "v"}}}}}};
  for (const auto& [key, value] : values)
    ASSERT_EQ(codeOf(call(QRTCommandSetInfoValue, with(selector(app), {{QRTKeyKey, key}, {QRTKeyValue, value}}))), 1u)
        << key;
  for (int run = 0; run < 2; ++run) {
    SCOPED_TRACE(run == 0 ? "before restart" : "after restart");
    for (const auto& [key, value] : values) {
      auto reply = call(QRTCommandInfoValueForKey, with(selector(app), {{QRTKeyKey, key}}));
      EXPECT_EQ(codeOf(reply), 1u) << key;
      EXPECT_EQ(at(reply, QRTReplyKeyInfoValue), value) << key;
    }
    EXPECT_EQ(at(call(QRTCommandMetadataForContainer, infoRequest), QRTReplyKeyInfoDictionary), plist::Value(values));
    restartDaemon();
  }

  for (const Container* c : {&app, &temporary}) {
    auto reply = call(QRTCommandMetadataForContainer, selector(*c));
    EXPECT_EQ(codeOf(reply), 1u);
    EXPECT_EQ(at(reply, QRTReplyKeyPath), plist::Value(c->path));
    EXPECT_EQ(at(reply, QRTReplyKeyTransient), plist::Value(c == &temporary));
    EXPECT_FALSE(at(reply, QRTReplyKeyInfoDictionary)) << "not requested";
  }
  // A request without "Value" removes the key.
  ASSERT_EQ(codeOf(call(QRTCommandSetInfoValue, with(selector(app), {{QRTKeyKey, "text"}}))), 1u);
  auto reply = call(QRTCommandMetadataForContainer, unknown(app));
  EXPECT_EQ(codeOf(reply), 21u);
  EXPECT_FALSE(at(reply, QRTReplyKeyPath));
  expectCodes({
      {"set without key", QRTCommandSetInfoValue, with(selector(app), {{QRTKeyValue, "v"}}), 38},
      // A metadata file its reader would refuse is never written, nor remembered.
      {"value over the size budget", QRTCommandSetInfoValue,
       with(selector(app), {{QRTKeyKey, "huge"}, {QRTKeyValue, plist::Data(2 << 20)}}), 38},
      {"refused value not kept", QRTCommandInfoValueForKey, with(selector(app), {{QRTKeyKey, "huge"}}), 24},
      {"get without key", QRTCommandInfoValueForKey, selector(app), 38},
      {"key removed", QRTCommandInfoValueForKey, with(selector(app), {{QRTKeyKey, "text"}}), 24},
      {"key never set", QRTCommandInfoValueForKey, with(selector(app), {{QRTKeyKey, "never"}}), 24},
      {"set on unknown UUID", QRTCommandSetInfoValue, with(unknown(app), {{QRTKeyKey, "k"}, {QRTKeyValue, "v"}}), 21},
      {"get on unknown UUID", QRTCommandInfoValueForKey, with(unknown(app), {{QRTKeyKey, "number"}}), 21},
      {"set without UUID", QRTCommandSetInfoValue,
       without(with(selector(app), {{QRTKeyKey, "k"}, {QRTKeyValue, "v"}}), QRTKeyUUID), 11},
      {"get without UUID", QRTCommandInfoValueForKey, without(with(selector(app), {{QRTKeyKey, "number"}}), QRTKeyUUID),
       11},
      {"metadata without UUID", QRTCommandMetadataForContainer, without(selector(app), QRTKeyUUID), 11},
      {"user check", QRTCommandInfoValueForKey,
       with(selector(app), {{QRTKeyKey, "number"}, {QRTKeyContainerClass, 1u}}), 38},
  });
}

TEST_F(CommandTest, RecreateBringsBackRemovedDefaultDirectories) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/keep.txt", "mine");
  for (uint64_t command : {QRTCommandRecreateDefaultStructure, QRTCommandRecreateContainerStructure}) {
    ASSERT_EQ(system(("rm -rf " + app.path + "/Library/Caches " + app.path + "/tmp").c_str()), 0);
    ASSERT_EQ(codeOf(call(command, selector(app))), 1u) << command;
    for (const char* sub : {"/Library/Caches", "/tmp"})
      EXPECT_EQ(ownerAndMode(app.path + sub), std::pair(501u, 0755u)) << command << sub;
    EXPECT_TRUE(exists(app.path + "/Documents/keep.txt")) << command;
  }

  // A new system container's sub-directories, and one made again, give the
  // systemusers group full rights in effect: the mask must not cut them.
  Container system = wellKnownSystemContainer();
  const std::string caches = system.path + "/Library/Caches";
  auto expectSealed = [&](const std::string& sub) {
    EXPECT_EQ(ownerAndMode(system.path + sub), std::pair(4294967294u, 0070u)) << sub;
    const std::string acl = output("getfacl -pn --omit-header -e '" + system.path + sub + "'");
    EXPECT_NE(acl.find("\ngroup:499:rwx\t#effective:rwx\nmask::rwx"), std::string::npos) << sub << ":\n" << acl;
    EXPECT_NE(acl.find("default:group:499:rwx\t#effective:rwx"), std::string::npos) << sub << ":\n" << acl;
  };
  for (const char* sub : {"/Documents", "/Library", "/Library/Caches", "/Library/Preferences", "/tmp"})
    expectSealed(sub);
  ASSERT_EQ(rmdir(caches.c_str()), 0);
  ASSERT_EQ(codeOf(call(QRTCommandRecreateDefaultStructure, selector(system))), 1u);
  expectSealed("/Library/Caches");

  expectCodes({{"unknown UUID", QRTCommandRecreateDefaultStructure, unknown(app), 21},
               {"unknown UUID", QRTCommandRecreateContainerStructure, unknown(app), 21},
               {"no UUID", QRTCommandRecreateContainerStructure, without(selector(app), QRTKeyUUID), 11}});
}

TEST_F(CommandTest, RegenerateDirectoryUUIDMovesTheContainerOnly) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/note.txt", "moves along");
  ASSERT_EQ(codeOf(call(QRTCommandRegenerateDirectoryUUID, selector(app))), 1u);

  Container after = createOrLookup(501, "com.example.app", 2, false);
  ASSERT_EQ(after.error, 1u);
  EXPECT_EQ(after.uuid, app.uuid);
  EXPECT_EQ(parentOf(after.path), parentOf(app.path));
  auto directoryUUID = QRTUUID::fromString(baseName(after.path));
  ASSERT_TRUE(directoryUUID) << after.path;
  EXPECT_NE(*directoryUUID, app.uuid);
  EXPECT_FALSE(exists(app.path));
  EXPECT_TRUE(exists(after.path + "/Documents/note.txt"));
  EXPECT_EQ(at(readPlist(after.path + "/" + kMetadataFile), "QRTMetadataUUID"), plist::Value(app.uuid.UUIDString()));
  EXPECT_EQ(readLink(mapping("com.example.app")), after.path);
  EXPECT_EQ(at(call(QRTCommandMetadataForContainer, selector(app)), QRTReplyKeyPath), plist::Value(after.path));

  // A container under its well-known name keeps it.
  Container system = wellKnownSystemContainer();
  EXPECT_EQ(codeOf(call(QRTCommandRegenerateDirectoryUUID, selector(system))), 11u);
  EXPECT_TRUE(exists(system.path + "/" + kMetadataFile));
  EXPECT_EQ(createOrLookup(499, "com.norvane.mapsd", 12, false).path, system.path);

  expectCodes({{"unknown UUID", QRTCommandRegenerateDirectoryUUID, unknown(app), 21},
               {"no UUID", 9, without(selector(app), QRTKeyUUID), 11}});
}

TEST_F(CommandTest, DeleteAndStageForDeleteMoveToDeathRowUntilAPassRuns) {
  settleDeathRow();
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/data.txt", "doomed");
  const plist::Dictionary keys = byName(501, 2, "com.example.app");

  // "Transient" is passed on: no transient container of the identifier exists.
  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainer, with(keys, {{QRTKeyTransient, true}}))), 21u);
  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainer, with(keys, {{QRTKeyContainerClass, 1u}}))), 38u);
  EXPECT_EQ(createOrLookup(501, "com.example.app", 2, false).error, 1u);

  ASSERT_EQ(codeOf(call(QRTCommandDeleteContainer, keys)), 1u);
  EXPECT_EQ(createOrLookup(501, "com.example.app", 2, false).error, 21u);
  EXPECT_FALSE(exists(app.path));
  EXPECT_FALSE(exists(mapping("com.example.app")));
  EXPECT_TRUE(exists(deadDirectory() + "/" + baseName(app.path) + "/Documents/data.txt"));

  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u);
  EXPECT_TRUE(listDirectory(deadDirectory()).empty());
  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainer, keys)), 21u);

  // Command 11 stages what its parallel arrays name.
  Container a = make(501, "com.example.a", 2), b = make(501, "com.example.b", 4);
  Container c = make(501, "com.example.c", 2), d = make(501, "com.example.d", 2);
  auto cIsLive = [&] { return createOrLookup(501, "com.example.c", 2, false).error == 1u; };
  auto entries = [](plist::Array classes, plist::Array users, plist::Array uuids, plist::Array identifiers) {
    return plist::Dictionary{{QRTKeyContainerClassesArray, classes},
                             {QRTKeyUserIDsArray, users},
                             {QRTKeyUUIDsArray, uuids},
                             {QRTKeyIdentifiersArray, identifiers}};
  };

  // Valid entries around invalid ones: a class out of range, a non-string
  // identifier, a container that does not exist.
  EXPECT_EQ(codeOf(call(QRTCommandStageContainerForDelete,
                        entries({2u, 14u, 2u, 2u, 4u}, {501u, 1u, 501u, 501u, 501u},
                                {uuidData(a.uuid), uuidData(c.uuid), uuidData(c.uuid), uuidData(QRTUUID::random()),
                                 uuidData(b.uuid)},
                                {"com.example.a", "com.example.c", 42, "com.example.none", "com.example.b"}))),
            1u);
  EXPECT_EQ(createOrLookup(501, "com.example.a", 2, false).error, 21u);
  EXPECT_EQ(createOrLookup(501, "com.example.b", 4, false).error, 21u);
  EXPECT_TRUE(cIsLive());
  std::vector<std::string> dead = listDirectory(deadDirectory());
  EXPECT_EQ(std::set<std::string>(dead.begin(), dead.end()),
            (std::set<std::string>{baseName(a.path), baseName(b.path)}));

  const plist::Dictionary one = entries({2u}, {501u}, {uuidData(c.uuid)}, {"com.example.c"});
  expectCodes({
      {"more classes than UUIDs", QRTCommandStageContainerForDelete,
       with(one, {{QRTKeyContainerClassesArray, plist::Array{2u, 2u}}}), 11},
      {"more identifiers than UUIDs", QRTCommandStageContainerForDelete,
       with(one, {{QRTKeyIdentifiersArray, plist::Array{"x", "y"}}}), 11},
      {"identifiers not an array", QRTCommandStageContainerForDelete,
       with(one, {{QRTKeyIdentifiersArray, "com.example.c"}}), 11},
      {"fewer user ids than classes", QRTCommandStageContainerForDelete,
       with(one, {{QRTKeyUserIDsArray, plist::Array{}}}), 40},
      {"user check", QRTCommandStageContainerForDelete, with(one, {{QRTKeyContainerClassesArray, plist::Array{1u}}}),
       38},
      {"nothing to stage", QRTCommandStageContainerForDelete, {}, 1},
  });
  EXPECT_TRUE(cIsLive()) << "refused requests stage nothing";
  // Extra user ids have no class to be checked against; the daemon survives them.
  EXPECT_NE(codeOf(call(QRTCommandStageContainerForDelete,
                        entries({2u}, {501u, 7u, "x", 501u}, {uuidData(d.uuid)}, {"com.example.d"}))),
            0u);
  EXPECT_TRUE(cIsLive());
}

TEST_F(CommandTest, DeathRowMovesWhatItCannotRemoveToTmp) {
  settleDeathRow();
  const std::string dead = deadDirectory();
  ASSERT_EQ(
      system(("mkdir -p " + root + "/tmp " + dead + "/temp.ABC123/gone " + dead + "/stuck/locked " + dead + "/.hidden")
                 .c_str()),
      0);
  writeFile(dead + "/temp.ABC123/gone/file", "x");
  writeFile(dead + "/stuck/locked/file", "x");
  writeFile(dead + "/stuck/loose", "x");
  // Nothing can be unlinked inside an immutable directory, nor the directory itself.
  ASSERT_EQ(system(("chattr +i " + dead + "/stuck/locked").c_str()), 0);

  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u);
  bool movedAside = exists(root + "/tmp/stuck/locked/file");
  const std::string unlock = "chattr -f -i " + root + "/tmp/stuck/locked " + dead + "/stuck/locked";
  [[maybe_unused]] int unlocked = system(unlock.c_str());
  EXPECT_TRUE(movedAside);
  EXPECT_EQ(listDirectory(dead), std::vector<std::string>{".hidden"});
  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u) << "a second pass finds nothing to do";
}

TEST_F(CommandTest, WipesKeepIdentityAndPathButNotContent) {
  Container app = make(501, "com.example.app", 2), addon = make(501, "com.example.addon", 4),
            other = make(501, "com.example.other", 4);
  for (const Container* c : {&app, &addon, &other}) writeFile(c->path + "/Documents/old.txt", "old");
  writeFile(app.path + "/Library/Preferences/prefs.plist", "old");
  auto expectWiped = [&](const Container& before) {
    Container after = createOrLookup(before.user, before.identifier, before.cls, false);
    EXPECT_EQ(after.error, 1u);
    EXPECT_EQ(after.path, before.path);
    EXPECT_EQ(after.uuid, before.uuid);
    EXPECT_EQ(tree(after.path), kFreshDataContainer);
    EXPECT_EQ(at(readPlist(after.path + "/" + kMetadataFile), "QRTMetadataUUID"),
              plist::Value(before.uuid.UUIDString()))
        << "the UUID must survive a restart";
  };

  ASSERT_EQ(codeOf(call(QRTCommandDeleteDataContainerContent, byName(501, 2, "com.example.app"))), 1u);
  expectWiped(app);
  EXPECT_EQ(listDirectory(parentOf(app.path)).size(), 1u);
  EXPECT_EQ(readLink(mapping("com.example.app")), app.path);
  wellKnownSystemContainer();
  make(33, "com.example.bundle", 1);
  expectCodes({
      {"system class", QRTCommandDeleteDataContainerContent, byName(499, 12, "com.norvane.mapsd"), 11},
      {"bundle class", QRTCommandDeleteDataContainerContent, byName(33, 1, "com.example.bundle"), 11},
      {"missing", QRTCommandDeleteDataContainerContent, byName(501, 2, "com.example.none"), 21},
      {"no identifier", QRTCommandDeleteDataContainerContent, {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 2u}}, 18},
      {"user check", QRTCommandDeleteDataContainerContent, byName(501, 1, "com.example.app"), 38},
      // The master entitlement without a wipe list wipes no addon data.
      {"addon without a list", QRTCommandWipeAddonDataContainer, byName(501, 4, "com.example.other"), 55},
  });

  setOwnIdentity("com.example.wiper",
                 {{QRTEntitlementWipeContainer, plist::Array{"com.example.addon", 7, "com.example.absent"}}});
  // The class of the request does not matter: this wipe is always of class 4.
  EXPECT_EQ(codeOf(call(QRTCommandWipeAddonDataContainer, byName(501, 2, "com.example.addon"))), 1u);
  expectWiped(addon);
  expectCodes({
      {"not in the list", QRTCommandWipeAddonDataContainer, byName(501, 4, "com.example.other"), 55},
      {"listed but missing", QRTCommandWipeAddonDataContainer, byName(501, 4, "com.example.absent"), 21},
      {"no identifier", QRTCommandWipeAddonDataContainer, {{QRTKeyUserID, 501u}, {QRTKeyContainerClass, 4u}}, 18},
  });
  EXPECT_TRUE(exists(other.path + "/Documents/old.txt"));
}

TEST_F(CommandTest, DiskUsageCountsAllocatedBytesOnce) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/big", std::string(20000, 'a'));
  writeFile(app.path + "/tmp/small", "b");
  ASSERT_EQ(link((app.path + "/Documents/big").c_str(), (app.path + "/Library/big-link").c_str()), 0);
  ASSERT_EQ(symlink("Documents/big", (app.path + "/shortcut").c_str()), 0);
  const uint64_t expected = allocatedBytes(app.path);
  ASSERT_GE(expected, 20000u);
  auto reply = call(QRTCommandDiskUsage, selector(app));
  EXPECT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(u64At(reply, QRTReplyKeyDiskUsage), expected);

  // A bundle is measured once; later answers come from its metadata.
  Container bundle = make(33, "com.example.bundle", 1);
  writeFile(bundle.path + "/binary", std::string(9000, 'c'));
  const uint64_t bundleBytes = allocatedBytes(bundle.path);
  EXPECT_EQ(u64At(call(QRTCommandDiskUsage, selector(bundle)), QRTReplyKeyDiskUsage), bundleBytes);
  writeFile(bundle.path + "/resource", std::string(50000, 'd'));
  EXPECT_EQ(u64At(call(QRTCommandDiskUsage, selector(bundle)), QRTReplyKeyDiskUsage), bundleBytes);

  // Even a refusal answers a usage.
  for (const auto& [keys, code] : {std::pair(unknown(app), 21u), std::pair(without(selector(app), QRTKeyUUID), 11u)}) {
    reply = call(QRTCommandDiskUsage, keys);
    EXPECT_EQ(codeOf(reply), code);
    EXPECT_EQ(u64At(reply, QRTReplyKeyDiskUsage), 0u) << code;
  }
}

}  // namespace
