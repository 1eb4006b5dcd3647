// The request layer's pure rules: user-id validation and message readers.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <fstream>

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

TEST(MessageReaders, MissingOrMistypedValuesReadAsNothing) {
  std::array<uint8_t, 16> bytes{};
  bytes[0] = 0xAB;
  plist::Dictionary message{{"Big", UINT64_MAX},
                            {"Neg", -5},
                            {"Flag", true},
                            {"Name", "com.example"},
                            {"UUID", plist::Data(bytes.begin(), bytes.end())},
                            {"ShortUUID", plist::Data{1, 2, 3}},
                            {"Identifier", 17}};
  EXPECT_EQ(QRTMessageU64(message, "Big"), UINT64_MAX);
  EXPECT_EQ(QRTMessageI64(message, "Neg"), -5);
  EXPECT_EQ(QRTMessageU64(message, "Name"), 0u);
  EXPECT_FALSE(QRTMessageBool(message, "Missing"));
  EXPECT_FALSE(QRTMessageBool(message, "Big"));
  EXPECT_EQ(QRTMessageString(message, "Name"), "com.example");
  EXPECT_EQ(QRTMessageString(message, "Flag"), std::nullopt);
  ASSERT_TRUE(QRTMessageUUID(message, "UUID"));
  EXPECT_EQ(QRTMessageUUID(message, "UUID")->bytes()[0], 0xAB);
  EXPECT_EQ(QRTMessageUUID(message, "ShortUUID"), std::nullopt);
  // A present but mistyped identifier is nil; only a missing one falls back.
  EXPECT_EQ(QRTMessageIdentifier(message, std::string("own")), std::nullopt);
  EXPECT_EQ(QRTMessageIdentifier(plist::Dictionary{}, std::string("own")), "own");
}

TEST(CommandTable, RowsMatchTheirNumbersAndEntitlements) {
  for (uint64_t i = 0; i < QRTCommandCount; ++i) EXPECT_EQ(QRTCommandTable[i].command, i);
  EXPECT_EQ(QRTCommandTable[4].replyOnReturn, 0u);
  EXPECT_EQ(QRTCommandTable[21].replyOnReturn, 0u);
  EXPECT_STREQ(QRTCommandTable[11].entitlement, QRTEntitlementWipeContainer);
  EXPECT_STREQ(QRTCommandTable[26].entitlement, QRTEntitlementStageSharedContent);
}

}  // namespace
