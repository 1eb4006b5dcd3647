// The request layer of the real daemon: command table, entitlements, framing
// faults, concurrency and shutdown.
#include <sys/socket.h>
#include <sys/wait.h>

#include <atomic>
#include <future>
#include <map>
#include <set>
#include <thread>
#include <vector>

#include "DaemonFixture.h"
#include "QuarterKit/Testing.h"
#include "base/Frame.h"

namespace {

constexpr uint64_t kNotServed = 49;
constexpr uint64_t kNotEntitled = 55;

const std::set<uint64_t> kOpenCommands{QRTCommandCreateOrLookupContainer, QRTCommandGroupContainerPaths,
                                       QRTCommandSystemContainerPath, QRTCommandSystemGroupContainerPaths,
                                       QRTCommandSystemGroupContainerPath};

using DispatcherTest = DaemonFixture;

TEST_F(DispatcherTest, CommandsOutsideTheTableAnswer49AndNoCommandIsCommandZero) {
  for (uint64_t command : {QRTCommandCount, uint64_t{1} << 32, UINT64_MAX})
    EXPECT_EQ(codeOf(call(command)), kNotServed) << command;
  // Command 0 checks the user against the class first: class 0 fits nobody.
  auto connection = connect();
  ASSERT_TRUE(connection);
  EXPECT_EQ(codeOf(connection->call(plist::Dictionary{{QRTKeyIdentifier, "com.example.app"}})), 38u);
}

// Without entitlements only the open commands pass; the master entitlement passes every row,
// the administrative ones too.
TEST_F(DispatcherTest, EntitlementsOpenTheCommandTable) {
  for (bool allowed : {false, true}) {
    if (allowed) setOwnIdentity("com.example.installer", {{QRTEntitlementAllowed, true}});
    std::vector<uint64_t> commands{QRTCommandStatus, QRTCommandMetrics, QRTCommandSetLogLevel};
    for (uint64_t command = 0; command < QRTCommandCount; ++command) commands.push_back(command);
    for (uint64_t command : commands) {
      // Command 17 itself refuses (55) a group the caller may not reach; a well-known one it may.
      plist::Dictionary keys;
      if (command == QRTCommandSystemGroupContainerPath)
        keys = {{QRTKeyGroupIdentifier, "systemgroup.com.norvane.policysets"}};
      uint64_t code = codeOf(call(command, keys));
      EXPECT_NE(code, 0u) << command;
      EXPECT_EQ(code == kNotEntitled, !allowed && !kOpenCommands.contains(command)) << command << ": " << code;
    }
  }
}

TEST_F(DispatcherTest, NamedEntitlementsOpenTheirOwnRowsOnly) {
  setOwnIdentity("com.example.migrator", {{QRTEntitlementDataMigration, true},
                                          {QRTEntitlementUserManagedAssets, false},
                                          {QRTEntitlementWipeContainer, plist::Array{"com.example.addon"}}});
  for (uint64_t command : {QRTCommandPerformDataMigration, QRTCommandWipeAddonDataContainer})
    EXPECT_NE(codeOf(call(command)), kNotEntitled) << command;
  for (uint64_t command : {QRTCommandUserManagedAssetsPath, QRTCommandContainersForUser})
    EXPECT_EQ(codeOf(call(command)), kNotEntitled) << command;

  // A wipe entitlement that is not an array refuses without the master one.
  setOwnIdentity("com.example.wiper", {{QRTEntitlementWipeContainer, true}});
  EXPECT_EQ(codeOf(call(QRTCommandWipeAddonDataContainer)), kNotEntitled);
}

TEST_F(DispatcherTest, UnreadableFrameClosesOnlyItsConnection) {
  auto healthy = connect();
  ASSERT_TRUE(healthy);
  // A well-framed payload that is not a property list, a property list whose
  // top level is not a dictionary, and lengths out of range.
  std::vector<uint8_t> notDictionary = frame::encode(7, {});
  notDictionary[12 + 8] = 0xA0;  // the dictionary marker becomes an array
  for (const std::vector<uint8_t>& bytes :
       {std::vector<uint8_t>{12, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 'n', 'o', 'p', 'e'}, notDictionary,
        std::vector<uint8_t>{3, 0, 0, 0}, std::vector<uint8_t>{0, 0, 0, 2}}) {
    auto bad = connect();
    ASSERT_TRUE(bad && qk::testing::ConnectionAccess::sendRaw(*bad, bytes.data(), bytes.size()));
    EXPECT_EQ(bad->send(request(QRTCommandCount)).get(), std::nullopt) << bytes.size();
    EXPECT_TRUE(bad->closed());
  }
  EXPECT_EQ(codeOf(healthy->call(request(QRTCommandCount))), kNotServed);
}

// Sixty-four clients at once, each with requests in flight on its one
// connection: every reply reaches its own client and request.
TEST_F(DispatcherTest, SixtyFourClientsWithPipelinedRequestsGetTheirOwnReplies) {
  // 1: refused for its entitlement; 30: unknown; 0 with class 0: bad user.
  const std::map<uint64_t, uint64_t> expected{{1, kNotEntitled}, {30, kNotServed}, {0, 38}};
  std::atomic<int> answered{0};
  std::vector<std::thread> clients;
  for (int i = 0; i < 64; ++i) {
    clients.emplace_back([&, i] {
      auto connection = connect();
      std::vector<std::pair<uint64_t, std::future<std::optional<plist::Dictionary>>>> inFlight;
      for (int j = 0; connection && j < 16; ++j) {
        const uint64_t command = (i + j) % 3 == 0 ? 1 : (i + j) % 3 == 1 ? 30 : 0;
        inFlight.emplace_back(command, connection->send(request(command)));
      }
      for (auto& [command, reply] : inFlight) answered += codeOf(reply.get()) == expected.at(command);
    });
  }
  for (auto& t : clients) t.join();
  EXPECT_EQ(answered.load(), 64 * 16);
}

}  // namespace
