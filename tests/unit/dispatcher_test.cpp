// The request layer's pure rules: user-id validation, message readers and
// the latency histogram.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <thread>

#include "Daemon/QRTError.h"
#include "Daemon/requests/QRTRequestDispatcher.h"
#include "TempDir.h"
#include "base/Frame.h"
#include "platform/DeviceRoot.h"

namespace {

// The mobile account is 502 here, so a rule that hard-codes 501 shows.
TEST(ValidateUserId, EffectiveUserByClassAndCaller) {
  TempDir root("/tmp/qrt-dispatch");
  std::filesystem::create_directories(root / "etc");
  std::ofstream(root / "etc/passwd") << "mobile:x:502:502::/private/var/mobile:/bin/sh\n";
  platform::setDeviceRoot(root.path());
  constexpr uint32_t kRefused = 0xffffffff;  // with error 38
  const uint32_t cases[][5] = {
      // requested user, class, caller, caller is a system process, effective user. Global classes belong to their fixed
      // users...
      {33, 1, 0, 1, 33},
      {33, 8, 501, 0, 33},
      {501, 1, 0, 1, kRefused},
      {499, 12, 0, 1, 499},
      {0, 12, 0, 1, kRefused},
      {1, 13, 0, 1, kRefused},
      // ...ordinary callers, and low uids without system-level entitlements, get their own user...
      {1, 2, 600, 0, 600},
      {600, 2, 600, 0, 600},
      {501, 2, 600, 0, kRefused},
      {0, 7, 600, 0, kRefused},
      {501, 2, 120, 0, kRefused},
      {0, 2, 120, 0, kRefused},
      {1, 2, 120, 0, 120},
      {501, 2, 600, 1, kRefused},
      // ...system callers name any user of a per-user class (1: the current mobile user).
      {1, 2, 33, 1, 502},
      {1, 0, 0, 1, 502},
      {0, 2, 0, 1, 0},
      {777, 11, 500, 1, 777},
      {501, 0, 0, 1, kRefused},
      {501, 14, 0, 1, kRefused},
  };
  for (const auto& [requested, cls, caller, system, expected] : cases) {
    uint32_t effective = 0xdeadbeef;
    uint64_t result = 1;
    const bool ok = validateUserId(requested, cls, caller, system != 0, &effective, &result);
    EXPECT_EQ(ok ? effective : kRefused, expected) << requested << " " << cls << " " << caller << " " << system;
    EXPECT_EQ(result, ok ? 1u : 38u) << requested << " " << cls << " " << caller << " " << system;
  }
  platform::setDeviceRoot("/");
}

// Each reader against a value of every type: only its own type reads.
TEST(MessageReaders, MissingOrMistypedValuesReadAsNothing) {
  std::array<uint8_t, 16> bytes{};
  bytes[0] = 0xAB;
  const plist::Data uuid(bytes.begin(), bytes.end());
  const std::pair<const char*, plist::Value> values[] = {
      {"u64", UINT64_MAX},
      {"i64", -5},
      {"bool", true},
      {"string", "com.example"},
      {"uuid", uuid},
      {"data", plist::Data{1, 2, 3}},
      {"real", 2.5},
      {"array", plist::Array{"com.example"}},
      {"dict", plist::Dictionary{{"k", 1}}},
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
    plist::Dictionary withIdentifier{{QRTKeyIdentifier, value}};
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
      replies.emplace_back(f->messageId, QRTMessageU64(*message, QRTReplyKeyError));
    }
  }
  sender.join();
  EXPECT_EQ(replies, (std::vector<std::pair<uint64_t, uint64_t>>{{7, QRTErrorException}, {8, 1}}));
  EXPECT_EQ(connection->repliesDue(), 0);
  close(fds[1]);
}

// Quantiles come from the bucket that holds the rank, interpolated inside it:
// within a factor of two of the truth, never from a neighbouring bucket.
TEST(LatencyHistogram, QuantilesFallInTheBucketOfTheirRank) {
  struct {
    std::vector<std::pair<uint64_t, int>> samples;  // microseconds, how many
    double q;
    uint64_t low, high;
  } rows[] = {
      {{}, 0.5, 0, 0},
      {{{0, 10}}, 0.99, 0, 1},
      {{{100, 99}, {5000, 1}}, 0.5, 64, 128},
      {{{100, 98}, {5000, 2}}, 0.99, 4096, 8192},
      {{{3, 50}, {1000, 50}}, 0.5, 2, 4},
      {{{UINT64_MAX, 1}}, 0.5, uint64_t{1} << 30, uint64_t{1} << 31},
  };
  for (const auto& row : rows) {
    QRTLatencyHistogram histogram;
    for (const auto& [micros, count] : row.samples)
      for (int i = 0; i < count; ++i) histogram.record(micros, i % 2 == 1);
    const QRTLatencyHistogram::Snapshot snapshot = histogram.snapshot();
    const uint64_t q = snapshot.quantileMicros(row.q);
    EXPECT_GE(q, row.low) << row.q;
    EXPECT_LE(q, row.high) << row.q;
    uint64_t served = 0;
    for (const auto& sample : row.samples) served += static_cast<uint64_t>(sample.second);
    EXPECT_EQ(snapshot.served, served);
  }
}

}  // namespace
