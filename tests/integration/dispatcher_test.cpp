// The request layer of the real daemon: command table, entitlements, framing
// faults, concurrency and shutdown.
#include <sys/socket.h>
#include <sys/wait.h>

#include <atomic>
#include <future>
#include <thread>
#include <vector>

#include "DaemonFixture.h"
#include "QuarterKit/Testing.h"
#include "base/Frame.h"

namespace {

constexpr uint64_t kNotServed = 49;
constexpr uint64_t kNotEntitled = 55;
const char* kAllowed = QRTEntitlementAllowed;

bool isNoneCommand(uint64_t c) {
  return c == QRTCommandCreateOrLookupContainer || c == QRTCommandGroupContainerPaths ||
         c == QRTCommandSystemContainerPath || c == QRTCommandSystemGroupContainerPaths ||
         c == QRTCommandSystemGroupContainerPath;
}

using DispatcherTest = DaemonFixture;

TEST_F(DispatcherTest, CommandsOutsideTheTableAnswer49) {
  for (uint64_t command : {QRTCommandCount, uint64_t{1} << 32, UINT64_MAX})
    EXPECT_EQ(replyError(request(command)), kNotServed) << command;
}

// Without entitlements only the open commands pass; the master entitlement passes every row,
// the administrative ones too.
TEST_F(DispatcherTest, EntitlementsOpenTheCommandTable) {
  for (bool allowed : {false, true}) {
    if (allowed) setOwnIdentity("com.example.installer", {{kAllowed, true}});
    std::vector<uint64_t> commands{QRTCommandStatus, QRTCommandMetrics, QRTCommandSetLogLevel};
    for (uint64_t command = 0; command < QRTCommandCount; ++command) commands.push_back(command);
    for (uint64_t command : commands) {
      // Command 17 itself refuses (55) a group the caller may not reach; a well-known one it may.
      plist::Dictionary keys;
      if (command == QRTCommandSystemGroupContainerPath)
        keys = {{QRTKeyGroupIdentifier, "systemgroup.com.norvane.policysets"}};
      uint64_t code = replyError(request(command, keys));
      EXPECT_NE(code, 0u) << command;
      EXPECT_EQ(code == kNotEntitled, !allowed && !isNoneCommand(command)) << command << ": " << code;
    }
  }
}

TEST_F(DispatcherTest, MessageWithoutCommandIsCommandZero) {
  // Command 0 checks the user against the class first: class 0 fits nobody.
  EXPECT_EQ(replyError(plist::Dictionary{{QRTKeyIdentifier, "com.example.app"}}), 38u);
}

TEST_F(DispatcherTest, NamedEntitlementsOpenTheirOwnRowsOnly) {
  setOwnIdentity("com.example.migrator", {{QRTEntitlementDataMigration, true},
                                          {QRTEntitlementUserManagedAssets, false},
                                          {QRTEntitlementWipeContainer, plist::Array{"com.example.addon"}}});
  for (uint64_t command : {QRTCommandPerformDataMigration, QRTCommandWipeAddonDataContainer})
    EXPECT_NE(replyError(request(command)), kNotEntitled) << command;
  for (uint64_t command : {QRTCommandUserManagedAssetsPath, QRTCommandContainersForUser})
    EXPECT_EQ(replyError(request(command)), kNotEntitled) << command;

  // A wipe entitlement that is not an array refuses without the master one.
  setOwnIdentity("com.example.wiper", {{QRTEntitlementWipeContainer, true}});
  EXPECT_EQ(replyError(request(QRTCommandWipeAddonDataContainer)), kNotEntitled);
}

TEST_F(DispatcherTest, UnreadableFrameClosesOnlyItsConnection) {
  auto healthy = connect();
  auto bad = connect();
  ASSERT_TRUE(healthy && bad);
  // A well-framed payload that is not a property list.
  std::vector<uint8_t> garbage = {12, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 'n', 'o', 'p', 'e'};
  ASSERT_TRUE(qk::testing::ConnectionAccess::sendRaw(*bad, garbage.data(), garbage.size()));
  auto lost = bad->send(request(QRTCommandCount));
  EXPECT_EQ(lost.get(), std::nullopt);
  EXPECT_TRUE(bad->closed());

  // A property list whose top level is not a dictionary, and a length out of range.
  for (std::vector<uint8_t> frameBytes :
       {frame::encode(7, {}), std::vector<uint8_t>{3, 0, 0, 0}, std::vector<uint8_t>{0, 0, 0, 2}}) {
    if (frameBytes.size() > 12) frameBytes[12 + 8] = 0xA0;  // the dictionary marker becomes an array
    auto conn = connect();
    ASSERT_TRUE(qk::testing::ConnectionAccess::sendRaw(*conn, frameBytes.data(), frameBytes.size()));
    EXPECT_EQ(conn->send(request(QRTCommandCount)).get(), std::nullopt);
  }

  EXPECT_EQ(codeOf(healthy->call(request(QRTCommandCount))), kNotServed);
}

TEST_F(DispatcherTest, SixtyFourClientsAtOnceAllGetTheirReplies) {
  std::atomic<int> answered{0};
  std::vector<std::thread> clients;
  for (int i = 0; i < 64; ++i) {
    clients.emplace_back([&, i] {
      auto connection = connect();
      if (!connection) return;
      for (int j = 0; j < 10; ++j) {
        uint64_t command = (i + j) % 2 ? 1 : 30;
        answered += codeOf(connection->call(request(command))) == (command == 1 ? kNotEntitled : kNotServed);
      }
    });
  }
  for (auto& t : clients) t.join();
  EXPECT_EQ(answered.load(), 640);
}

TEST_F(DispatcherTest, PipelinedRequestsAreMatchedByMessageId) {
  auto connection = connect();
  ASSERT_TRUE(connection);
  std::vector<std::pair<uint64_t, std::future<std::optional<plist::Dictionary>>>> inFlight;
  for (int i = 0; i < 1000; ++i) {
    // 1: refused for its entitlement; 30: unknown; 0 with class 0: bad user.
    uint64_t command = i % 3 == 0 ? 1 : (i % 3 == 1 ? 30 : 0);
    inFlight.emplace_back(command, connection->send(request(command)));
  }
  for (auto& [command, future] : inFlight) {
    EXPECT_EQ(codeOf(future.get()), command == 1 ? kNotEntitled : (command == 30 ? kNotServed : 38u));
  }
}

}  // namespace
