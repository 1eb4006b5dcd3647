// Code-signing registration through the real daemon: the group and system
// containers that entitlements grant and take away, invalidation, durability
// across a kill, the database's exclusive lock, and hostile registrations.
#include <sqlite3.h>

#include <atomic>
#include <map>
#include <mutex>
#include <thread>

#include "DaemonFixture.h"

namespace {

constexpr const char* kAppGroups = "com.norvane.security.application-groups";
constexpr const char* kSystemGroups = "com.norvane.security.system-groups";
constexpr const char* kSystemContainer = "com.norvane.security.system-container";
constexpr const char* kEntitlementsKey = "com.norvane.QuarterKit.Entitlements";

plist::Dictionary info(plist::Dictionary entitlements) { return {{kEntitlementsKey, std::move(entitlements)}}; }

class CodesignTest : public InstallerFixture {
 protected:
  bool registered(const std::string& id) {
    return codeOf(call(QRTCommandCodeSigningInfoForIdentifier, {{QRTKeyIdentifier, id}})) == 1;
  }

  // Command 13 or 16: group identifier to path.
  std::map<std::string, std::string> groupPaths(uint64_t command, const std::string& id) {
    auto reply = call(command, {{QRTKeyIdentifier, id}, {QRTKeyUserID, 1}});
    EXPECT_EQ(codeOf(reply), 1u) << command << " " << id;
    std::map<std::string, std::string> paths;
    auto dict = at(reply, QRTReplyKeyGroupContainerDict);
    if (dict && dict->isDictionary()) {
      for (const auto& [group, path] : dict->dictionary()) paths[group] = plist::describe(path);
    }
    return paths;
  }
  // A look-up that creates nothing: 1 when the container exists, 21 when not.
  uint64_t lookup(uint64_t user, const std::string& id, uint64_t cls) {
    return createOrLookup(user, id, cls, false).error;
  }
};

TEST_F(CodesignTest, GroupsAreMadeOnDemandSharedAndDroppedWithTheirLastProgram) {
  ASSERT_EQ(registerProgram("com.example.a", {{kAppGroups, strings({"group.g1", "group.g2"})},
                                              {kSystemGroups, strings({"systemgroup.com.example.s1"})}}),
            1u);
  // Registration alone makes nothing.
  EXPECT_EQ(lookup(501, "group.g1", 7), 21u);
  EXPECT_EQ(lookup(499, "systemgroup.com.example.s1", 13), 21u);

  auto app = groupPaths(QRTCommandGroupContainerPaths, "com.example.a");
  ASSERT_EQ(app.size(), 2u);
  for (const char* g : {"group.g1", "group.g2"}) {
    EXPECT_TRUE(exists(app[g])) << g;
    EXPECT_EQ(lookup(501, g, 7), 1u) << g;
  }
  auto system = groupPaths(QRTCommandSystemGroupContainerPaths, "com.example.a");
  ASSERT_EQ(system.size(), 1u);
  EXPECT_EQ(lookup(499, "systemgroup.com.example.s1", 13), 1u);
  // Command 17 judges the caller by its registered entitlements, not by the identity file's.
  setOwnIdentity("com.example.a", {{"com.example.unrelated", true}});
  auto reply = call(QRTCommandSystemGroupContainerPath, {{QRTKeyGroupIdentifier, "systemgroup.com.example.s1"}});
  EXPECT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(at(reply, QRTReplyKeyPath), plist::Value(system["systemgroup.com.example.s1"]));
  beInstaller();

  ASSERT_EQ(registerProgram("com.example.b", {{kAppGroups, "group.g1"}}), 1u);
  EXPECT_EQ(groupPaths(QRTCommandGroupContainerPaths, "com.example.b")["group.g1"], app["group.g1"]);

  ASSERT_EQ(registerProgram("com.example.a", {}), 1u);
  EXPECT_EQ(lookup(501, "group.g1", 7), 1u);
  EXPECT_EQ(lookup(501, "group.g2", 7), 21u);
  EXPECT_EQ(lookup(499, "systemgroup.com.example.s1", 13), 21u);
  EXPECT_FALSE(exists(app["group.g2"]));
  EXPECT_TRUE(logContains("Last reference to group container group.g2 for 501 is going away; removing it."));

  ASSERT_EQ(codeOf(call(QRTCommandProcessCodeSigningInfo, {{QRTKeyIdentifier, "com.example.b"}})), 1u);
  EXPECT_EQ(lookup(501, "group.g1", 7), 21u);
  EXPECT_FALSE(registered("com.example.b"));
}

TEST_F(CodesignTest, SystemGroupRefusalsAndOwnEntitlements) {
  // Step 8: the caller's own entitlements count without any installer registration.
  setOwnIdentity("com.example.self", {{kAppGroups, strings({"group.self"})}});
  auto own = groupPaths(QRTCommandGroupContainerPaths, "com.example.self");
  ASSERT_EQ(own.count("group.self"), 1u);
  EXPECT_TRUE(exists(own["group.self"]));
  for (const char* group : {"systemgroup.com.norvane.sharedpclogging", "systemgroup.com.example.notmine"})
    EXPECT_EQ(codeOf(call(QRTCommandSystemGroupContainerPath, {{QRTKeyGroupIdentifier, group}})), 55u) << group;
  EXPECT_TRUE(
      logContains("com.example.self is not entitled for system group identifier: "
                  "systemgroup.com.example.notmine."));
  EXPECT_EQ(logText().find("sharedpclogging"), std::string::npos);
}

TEST_F(CodesignTest, WithdrawnSystemContainerEntitlementTakesTheContainer) {
  ASSERT_EQ(registerProgram("com.example.sys", {{kSystemContainer, true}}), 1u);
  setOwnIdentity("com.example.sys", {{kSystemContainer, true}});
  auto reply = call(QRTCommandSystemContainerPath, {});
  ASSERT_EQ(codeOf(reply), 1u);
  const std::string path = stringAt(reply, QRTReplyKeyPath);
  EXPECT_TRUE(exists(path));
  beInstaller();
  ASSERT_EQ(registerProgram("com.example.sys", {{kSystemContainer, false}}), 1u);
  EXPECT_FALSE(exists(path));
  EXPECT_EQ(lookup(499, "com.example.sys", 12), 21u);
  EXPECT_TRUE(
      logContains("Deleting system container for ID: com.example.sys because it is no longer in the entitlements"));
  setOwnIdentity("com.example.sys", {{kSystemContainer, true}});
  EXPECT_EQ(codeOf(call(QRTCommandSystemContainerPath, {})), 55u);
}

TEST_F(CodesignTest, AcknowledgedRegistrationsSurviveAKill) {
  std::mutex lock;
  std::vector<std::string> acknowledged;
  std::atomic<bool> stop{false};
  std::vector<std::thread> writers;
  for (int t = 0; t < 3; ++t) {
    writers.emplace_back([&, t] {
      for (int i = 0; !stop; ++i) {
        std::string id = "com.example.burst" + std::to_string(t) + "." + std::to_string(i);
        auto reply = call(QRTCommandProcessCodeSigningInfo,
                          {{QRTKeyIdentifier, id}, {"CodeSigningInfo", info({{kAppGroups, "group.burst"}})}});
        if (!reply) return;
        if (codeOf(reply) != 1) continue;
        std::lock_guard<std::mutex> hold(lock);
        acknowledged.push_back(id);
      }
    });
  }
  for (int wait = 0; wait < 1000; ++wait) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    std::lock_guard<std::mutex> hold(lock);
    if (acknowledged.size() >= 30) break;
  }
  killDaemon();
  stop = true;
  for (auto& writer : writers) writer.join();
  startDaemon();
  EXPECT_GE(acknowledged.size(), 30u);
  for (const std::string& id : acknowledged) EXPECT_TRUE(registered(id)) << id;
}

TEST_F(CodesignTest, DatabaseIsTheDaemonsAlone) {
  ASSERT_EQ(registerProgram("com.example.a", {}), 1u);
  const std::string path = root + "/private/var/root/Library/QuarterKit/containers.sqlite3";
  ASSERT_TRUE(exists(path));
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
  sqlite3_stmt* statement = nullptr;
  int rc = sqlite3_prepare_v2(db, "SELECT count(*) FROM code_signing_info;", -1, &statement, nullptr);
  if (rc == SQLITE_OK) rc = sqlite3_step(statement);
  sqlite3_finalize(statement);
  sqlite3_close(db);
  EXPECT_TRUE(rc == SQLITE_BUSY || rc == SQLITE_LOCKED) << rc;
}

TEST_F(CodesignTest, HostileRegistrationsAreRefusedOrIgnoredAndInvalidationSparesBundledAndSelfRegistered) {
  ASSERT_EQ(registerProgram("com.example.kept", {{kAppGroups, "group.kept"}}), 1u);
  struct Case {
    const char* what;
    plist::Dictionary keys;
    uint64_t code;
    const char* log;
  };
  const std::vector<Case> cases = {
      {"info a string", {{QRTKeyIdentifier, "com.example.kept"}, {"CodeSigningInfo", "x"}}, 38, nullptr},
      {"options an array",
       {{QRTKeyIdentifier, "com.example.kept"}, {"CodeSigningInfo", info({})}, {"OptionsDictionary", strings({"a"})}},
       38,
       nullptr},
      {"no identifier", {{"CodeSigningInfo", info({})}}, 18, nullptr},
      {"options of the wrong types",
       {{QRTKeyIdentifier, "com.example.typed"},
        {"CodeSigningInfo", info({})},
        {"OptionsDictionary", plist::Dictionary{{"com.norvane.QuarterKit.DataContainerClass", "2"},
                                                {"RegByCaller", "yes"},
                                                {"com.norvane.QuarterKit.ParentBundleID", 7}}}},
       1,
       nullptr},
      {"non-string groups",
       {{QRTKeyIdentifier, "com.example.nonstring"},
        {"CodeSigningInfo", info({{kAppGroups, plist::Array{plist::Value("group.a"), plist::Value(3)}}})}},
       1,
       "Entitlement com.norvane.security.application-groups for com.example.nonstring contains non-string values; "
       "ignoring."},
      {"control characters",
       {{QRTKeyIdentifier, "com.example.\x01\n\x7f"}, {"CodeSigningInfo", info({})}},
       11,
       nullptr},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(codeOf(call(QRTCommandProcessCodeSigningInfo, c.keys)), c.code) << c.what;
    if (c.log) { EXPECT_TRUE(logContains(c.log)) << c.what; }
  }
  // Nothing refused touched the stored entry or its group.
  EXPECT_TRUE(registered("com.example.kept"));
  EXPECT_EQ(groupPaths(QRTCommandGroupContainerPaths, "com.example.kept").count("group.kept"), 1u);

  // Invalidation spares a program with a bundle and one registered by
  // itself; "RegByCaller" as a string is no caller registration.
  make(33, "com.example.bundled", 1);
  ASSERT_EQ(registerProgram("com.example.bundled", {}), 1u);
  ASSERT_EQ(registerProgram("com.example.self", {}, {{"RegByCaller", true}}), 1u);
  EXPECT_EQ(codeOf(call(QRTCommandInvalidateCodeSigningInfoForAppsWithoutBundleContainer)), 1u);
  EXPECT_TRUE(registered("com.example.bundled"));
  EXPECT_TRUE(registered("com.example.self"));
  EXPECT_FALSE(registered("com.example.typed"));
  EXPECT_FALSE(registered("com.example.kept"));
  ASSERT_EQ(registerProgram("com.example.kept", {}), 1u);
  EXPECT_TRUE(registered("com.example.kept")) << "registering again makes it valid";
}

TEST_F(CodesignTest, TenThousandChildBundlesHitTheLimitAndGoWithTheirParent) {
  make(33, "com.example.parent", 1);
  ASSERT_EQ(registerProgram("com.example.parent", {}), 1u);
  auto connection = connect();
  ASSERT_TRUE(connection);
  std::map<uint64_t, int> codes;
  std::string accepted;
  for (int base = 0; base < 10000; base += 50) {
    std::vector<std::future<std::optional<plist::Dictionary>>> replies;
    for (int i = base; i < base + 50; ++i) {
      replies.push_back(connection->send(
          request(QRTCommandProcessCodeSigningInfo,
                  {{QRTKeyIdentifier, "com.example.child." + std::to_string(i)},
                   {"CodeSigningInfo", info({})},
                   {"OptionsDictionary",
                    plist::Dictionary{{"com.norvane.QuarterKit.ParentBundleID", "com.example.parent"}}}})));
    }
    for (size_t i = 0; i < replies.size(); ++i) {
      uint64_t code = codeOf(replies[i].get());
      if (code == 1 && accepted.empty()) accepted = "com.example.child." + std::to_string(base + i);
      ++codes[code];
    }
  }
  EXPECT_EQ(codes[1], 1024);
  EXPECT_EQ(codes[38], 10000 - 1024);
  EXPECT_TRUE(logContains("Parent com.example.parent already has 1024 child bundles; not adding"));
  // Deleting the parent's bundle takes the parent's and its children's information.
  EXPECT_EQ(codeOf(call(QRTCommandDeleteContainer, byName(33, 1, "com.example.parent"))), 1u);
  EXPECT_FALSE(registered("com.example.parent"));
  ASSERT_FALSE(accepted.empty());
  EXPECT_FALSE(registered(accepted));
}

}  // namespace
