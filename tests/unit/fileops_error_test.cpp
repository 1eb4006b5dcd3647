// Error values: what they carry, when they log, and the exception guard.
#include <gtest/gtest.h>

#include <stdexcept>

#include "Daemon/QRTError.h"

namespace {

TEST(QRTErrorTest, CarriesDescriptionOriginAndCause) {
  QRTErrorRef cause = QRT_POSIX_ERROR(2, "stat of %@ failed: %s", std::string("/a"), "No such file");
  EXPECT_EQ(cause->domain(), QRTPOSIXErrorDomain);
  EXPECT_EQ(cause->code(), 2);
  EXPECT_EQ(cause->description(), "QRTPOSIXErrorDomain 2: stat of /a failed: No such file");

  plist::Dictionary start{{"Extra", "kept"}};
  QRTErrorRef error = QRTCreateError("someFunction", 42, QRTErrorDomain, 21, cause, &start, false,
                                     "No Container with userId: %u", 501u);
  EXPECT_EQ(error->resultCode(), 21u);
  EXPECT_EQ(error->localizedDescription(), "No Container with userId: 501");
  EXPECT_EQ(error->underlying(), cause);
  EXPECT_EQ(plist::find(error->userInfo(), "FunctionName")->string(), "someFunction");
  EXPECT_EQ(plist::find(error->userInfo(), "SourceFileLine")->integer().asSigned(), 42);
  EXPECT_EQ(plist::find(error->userInfo(), "Extra")->string(), "kept");
  EXPECT_EQ(start.size(), 1u);  // the starting dictionary is not changed
}

// Without a format there is no description; negative codes widen by sign.
TEST(QRTErrorTest, WithoutFormatThereIsNoDescription) {
  QRTErrorRef error = QRTCreateError("f", 1, QRTErrorDomain, -1, nullptr, nullptr, true, nullptr);
  EXPECT_EQ(error->localizedDescription(), std::nullopt);
  EXPECT_EQ(error->description(), "QRTErrorDomain -1");
  EXPECT_EQ(error->resultCode(), UINT64_MAX);
}

TEST(QRTErrorTest, GuardTurnsExceptionsIntoError40) {
  EXPECT_EQ(QRT_GUARD([] {}), nullptr);
  QRTErrorRef error = QRT_GUARD([] { throw std::runtime_error("boom"); });
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 40);
  EXPECT_NE(error->localizedDescription()->find("Got exception: "), std::string::npos);
  EXPECT_NE(error->localizedDescription()->find(" : boom"), std::string::npos);
  EXPECT_EQ(QRT_GUARD([] { throw 7; })->code(), 40);
}

}  // namespace
