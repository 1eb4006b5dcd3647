// The request layer's pure rules: user-id validation and message readers.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <sys/socket.h>

#include <fstream>
#include <thread>

#include "base/Frame.h"

#include "Daemon/requests/QRTRequestDispatcher.h"
#include "Daemon/QRTError.h"
#include "platform/DeviceRoot.h"

namespace {

// The mobile account is 502 here, so a rule that hard-codes 501 shows.
class ValidateUserIdTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    char tmpl[] = "/tmp/qrt-dispatch.XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    std::string root = tmpl;
    system(("mkdir -p " + root + "/etc").c_str());
    std::ofstream(root + "/etc/passwd") << "mobile:x:502:502::/private/var/mobile:/bin/sh\n";
    platform::setDeviceRoot(root);
  }

  static uint32_t check(uint32_t requested, uint64_t cls, uint32_t caller, uint64_t* result) {
    uint32_t effective = 0xdeadbeef;
    *result = 1;
    if (!validateUserId(requested, cls, caller, &effective, result)) return 0xffffffff;
    return effective;
  }
};

TEST_F(ValidateUserIdTest, GlobalClassesBelongToTheirFixedUsers) {
  uint64_t result;
  EXPECT_EQ(check(33, 1, 0, &result), 33u);
  EXPECT_EQ(check(33, 8, 501, &result), 33u);  // even an ordinary caller names 33 for a bundle
  EXPECT_EQ(check(501, 1, 0, &result), 0xffffffffu);
  EXPECT_EQ(result, 38u);
  EXPECT_EQ(check(499, 12, 0, &result), 499u);
  EXPECT_EQ(check(0, 12, 0, &result), 0xffffffffu);
  EXPECT_EQ(check(1, 13, 0, &result), 0xffffffffu);
}

TEST_F(ValidateUserIdTest, OrdinaryCallersGetTheirOwnUser) {
  uint64_t result;
  EXPECT_EQ(check(1, 2, 600, &result), 600u);
  EXPECT_EQ(check(600, 2, 600, &result), 600u);
  EXPECT_EQ(check(501, 2, 600, &result), 0xffffffffu);
  EXPECT_EQ(result, 38u);
  EXPECT_EQ(check(0, 7, 600, &result), 0xffffffffu);
}

TEST_F(ValidateUserIdTest, SystemCallersNameAnyUserOfAPerUserClass) {
  uint64_t result;
  EXPECT_EQ(check(1, 2, 33, &result), 502u);  // 1 is the current mobile user
  EXPECT_EQ(check(1, 0, 0, &result), 502u);   // whatever the class
  EXPECT_EQ(check(0, 2, 0, &result), 0u);
  EXPECT_EQ(check(777, 11, 500, &result), 777u);
  EXPECT_EQ(check(501, 0, 0, &result), 0xffffffffu);
  EXPECT_EQ(check(501, 14, 0, &result), 0xffffffffu);
  EXPECT_EQ(result, 38u);
}

// Each reader against a value of every type: only its own type reads.
TEST(MessageReaders, MissingOrMistypedValuesReadAsNothing) {
  std::array<uint8_t, 16> bytes{};
  bytes[0] = 0xAB;
  const plist::Data uuid(bytes.begin(), bytes.end());
  const std::pair<const char*, plist::Value> values[] = {
      {"u64", UINT64_MAX}, {"i64", -5},       {"bool", true},          {"string", "com.example"},
      {"uuid", uuid},      {"data", plist::Data{1, 2, 3}},             {"real", 2.5},
      {"array", plist::Array{"com.example"}}, {"dict", plist::Dictionary{{"k", 1}}},
  };
  plist::Dictionary message;
  for (const auto& [key, value] : values) message[key] = value;
  for (const auto& [key, value] : values) {
    const std::string k = key;
    EXPECT_EQ(QRTMessageU64(message, k), k == "u64" ? UINT64_MAX : k == "i64" ? uint64_t(-5) : 0u) << k;
    EXPECT_EQ(QRTMessageI64(message, k), k == "u64" ? -1 : k == "i64" ? -5 : 0) << k;
    EXPECT_EQ(QRTMessageBool(message, k), k == "bool") << k;
    EXPECT_EQ(QRTMessageString(message, k).has_value(), k == "string") << k;
    EXPECT_EQ(QRTMessageUUID(message, k).has_value(), k == "uuid") << k;
    // A present identifier of another type reads as missing: the caller's own.
    plist::Dictionary withIdentifier{{"Identifier", value}};
    EXPECT_EQ(QRTMessageIdentifier(withIdentifier, std::string("own")), k == "string" ? "com.example" : "own") << k;
    EXPECT_EQ(QRTMessageIdentifier(withIdentifier, std::nullopt).has_value(), k == "string") << k;
  }
  EXPECT_EQ(QRTMessageUUID(message, "uuid")->bytes()[0], 0xAB);
  EXPECT_FALSE(QRTMessageBool(message, "missing"));
  EXPECT_EQ(QRTMessageIdentifier(plist::Dictionary{}, std::string("own")), "own");
}

// A reply too big for one frame becomes a small error reply; the stream
// stays usable for the next one.
TEST(ReplySending, OversizedReplyBecomesErrorFortyOnAnIntactStream) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  auto connection = std::make_shared<platform::RequestConnection>(fds[0], std::nullopt);
  std::thread sender([&] {
    auto big = std::make_shared<QRTReply>(connection, 7);
    big->dictionary["Blob"] = plist::Data(frame::kMaxLength, 1);
    big->send(1);
    auto small = std::make_shared<QRTReply>(connection, 8);
    small->send(1);
  });
  frame::Decoder decoder;
  std::vector<std::pair<uint64_t, uint64_t>> replies;  // message id, ReplyError
  uint8_t buffer[4096];
  while (replies.size() < 2) {
    ssize_t n = recv(fds[1], buffer, sizeof buffer, 0);
    ASSERT_GT(n, 0);
    decoder.append(buffer, static_cast<size_t>(n));
    while (auto f = decoder.next()) {
      auto message = frame::decodeMessage(f->payload);
      ASSERT_TRUE(message);
      replies.emplace_back(f->messageId, QRTMessageU64(*message, "ReplyError"));
    }
  }
  sender.join();
  EXPECT_EQ(replies, (std::vector<std::pair<uint64_t, uint64_t>>{{7, QRTErrorException}, {8, 1}}));
  EXPECT_EQ(connection->repliesDue(), 0);
  close(fds[1]);
}

TEST(CommandTable, RowsMatchTheirNumbersAndEntitlements) {
  for (uint64_t i = 0; i < QRTCommandCount; ++i) EXPECT_EQ(QRTCommandTable[i].command, i);
  EXPECT_EQ(QRTCommandTable[4].replyOnReturn, 0u);
  EXPECT_EQ(QRTCommandTable[21].replyOnReturn, 0u);
  EXPECT_STREQ(QRTCommandTable[11].entitlement, QRTEntitlementWipeContainer);
  EXPECT_STREQ(QRTCommandTable[26].entitlement, QRTEntitlementStageSharedContent);
}

}  // namespace
