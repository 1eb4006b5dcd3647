#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <random>
#include <thread>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "QuarterKit/Testing.h"
#include "base/Frame.h"
#include "base/QRTProtocol.h"
#include "base/QRTUUID.h"

namespace {

using Message = std::pair<uint64_t, plist::Dictionary>;
using Reply = std::future<std::optional<plist::Dictionary>>;

plist::Dictionary numbered(uint64_t n) { return qk::Request(qk::Command::infoValueForKey).u64("N", n).message(); }

uint64_t numberOf(const plist::Dictionary& d) { return qk::Reply(d).u64("N"); }

// The daemon's end of a socketpair, driven by the test.
class FakeServer {
 public:
  FakeServer() {
    int sv[2];
    EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv));
    fd_ = sv[1];
    client = qk::testing::ConnectionAccess::adopt(sv[0]);
  }
  ~FakeServer() { hangUp(); }

  Message next() {
    for (;;) {
      if (auto f = decoder_.next()) {
        auto message = frame::decodeMessage(f->payload);
        EXPECT_TRUE(message);
        return {f->messageId, message.value_or(plist::Dictionary{})};
      }
      uint8_t buf[4096];
      ssize_t n = ::recv(fd_, buf, sizeof buf, 0);
      if (n <= 0) {
        ADD_FAILURE() << "no request";
        return {};
      }
      decoder_.append(buf, static_cast<size_t>(n));
    }
  }
  void write(const std::vector<uint8_t>& bytes) {
    ASSERT_EQ(static_cast<ssize_t>(bytes.size()), ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL));
  }
  void reply(uint64_t id, const plist::Dictionary& d) { write(frame::encode(id, d)); }
  void echo(const Message& m) { reply(m.first, {{"N", numberOf(m.second)}}); }  // answers with its own number
  void hangUp() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

  std::unique_ptr<qk::Connection> client;

 private:
  int fd_ = -1;
  frame::Decoder decoder_;
};

TEST(KitConnection, ManyRequestsInFlightFromManyThreadsAreMatchedById) {
  constexpr int kThreads = 8, kPerThread = 8;
  FakeServer server;
  // The server holds every reply back until all 64 requests are in flight,
  // then answers them out of order.
  std::thread serverThread([&] {
    std::vector<Message> requests;
    for (int i = 0; i < kThreads * kPerThread; ++i) requests.push_back(server.next());
    std::shuffle(requests.begin(), requests.end(), std::mt19937(7));
    for (const auto& m : requests) server.echo(m);
  });
  std::atomic<int> matched{0};
  std::vector<std::thread> clients;
  for (int t = 0; t < kThreads; ++t) {
    clients.emplace_back([&, t] {
      std::vector<Reply> replies;
      for (int i = 0; i < kPerThread; ++i) replies.push_back(server.client->send(numbered(t * 100 + i)));
      for (int i = 0; i < kPerThread; ++i) {
        auto reply = replies[i].get();
        if (reply && numberOf(*reply) == static_cast<uint64_t>(t * 100 + i)) ++matched;
      }
    });
  }
  for (auto& c : clients) c.join();
  serverThread.join();
  EXPECT_EQ(kThreads * kPerThread, matched.load());
}

TEST(KitConnection, ClosingMidFlightReleasesEveryWaiter) {
  FakeServer server;
  std::vector<Reply> replies;
  for (uint64_t n = 0; n < 5; ++n) replies.push_back(server.client->send(numbered(n)));
  for (int i = 0; i < 2; ++i) server.echo(server.next());
  server.hangUp();
  for (int i = 0; i < 5; ++i) EXPECT_EQ(i < 2, replies[i].get().has_value()) << i;
  EXPECT_TRUE(server.client->closed());
  // Later requests fail at once instead of waiting for their timeout.
  EXPECT_FALSE(server.client->call(numbered(9), std::chrono::hours(1)));

  // So does destroying the connection on the client's side.
  FakeServer other;
  auto reply = other.client->send(numbered(1));
  other.client.reset();
  EXPECT_FALSE(reply.get());
}

// Each failure fails its own request only, until a frame length out of range
// ends the connection.
TEST(KitConnection, BadRepliesAndFailedCallsFailOnlyWhatTheyMust) {
  FakeServer server;
  auto first = server.client->send(numbered(1));
  auto second = server.client->send(numbered(2));
  Message m1 = server.next(), m2 = server.next();
  // An unknown id is ignored; an undecodable payload fails only its request.
  server.reply(m1.first + 1000, {{"N", 99}});
  std::vector<uint8_t> garbage = {12, 0, 0, 0};
  for (int i = 0; i < 8; ++i) garbage.push_back(static_cast<uint8_t>(m1.first >> (8 * i)));
  garbage.insert(garbage.end(), {'j', 'u', 'n', 'k'});
  server.write(garbage);
  server.echo(m2);
  EXPECT_FALSE(first.get());
  EXPECT_EQ(numberOf(second.get().value_or(plist::Dictionary{})), 2u);

  // A timed-out call ignores its late reply; an oversized request fails alone.
  server.client->setReplyTimeout(std::chrono::milliseconds(1));
  EXPECT_FALSE(qk::perform(*server.client, qk::Request(numbered(3))));
  server.client->setReplyTimeout(std::chrono::minutes(1));
  server.echo(server.next());
  EXPECT_FALSE(server.client->call({{"Blob", plist::Data(frame::kMaxLength, 0)}}));
  std::thread answer([&] { server.echo(server.next()); });
  EXPECT_EQ(numberOf(server.client->call(numbered(4)).value_or(plist::Dictionary{})), 4u);
  answer.join();
  EXPECT_FALSE(server.client->closed());

  auto fifth = server.client->send(numbered(5));
  server.next();
  server.write({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0});
  EXPECT_FALSE(fifth.get());
  EXPECT_TRUE(server.client->closed());
}

// Frames split at every size, big ones (which leave in their own buffer)
// between small ones: each comes out whole and in order, and the length of
// the frame in progress is known as soon as its length field is.
TEST(FrameDecoder, SplitStreamsOfBigAndSmallFramesComeOutWhole) {
  std::vector<uint8_t> stream;
  std::vector<plist::Dictionary> sent;
  for (size_t size : {0, 200000, 10, 70000, 0}) {
    sent.push_back(plist::Dictionary{{"Pad", plist::Data(size, static_cast<uint8_t>(size))}});
    std::vector<uint8_t> bytes = frame::encode(sent.size(), sent.back());
    stream.insert(stream.end(), bytes.begin(), bytes.end());
  }
  for (size_t chunk : {size_t{1}, size_t{3}, size_t{4096}, stream.size()}) {
    frame::Decoder decoder;
    std::vector<plist::Dictionary> got;
    for (size_t at = 0; at < stream.size(); at += chunk) {
      decoder.append(stream.data() + at, std::min(chunk, stream.size() - at));
      EXPECT_EQ(decoder.pendingFrameSize() > frame::kHeaderSize, decoder.buffered() >= 4) << chunk;
      while (auto f = decoder.next()) {
        EXPECT_EQ(f->messageId, got.size() + 1);
        auto message = frame::decodeMessage(f->payload);
        ASSERT_TRUE(message);
        got.push_back(*message);
      }
    }
    EXPECT_EQ(got, sent) << chunk;
    EXPECT_EQ(decoder.buffered(), 0u);
  }
}

// Both directions of the value encoding: absent optionals are left out, a
// UUID is 16 bytes of data, a u64 above INT64_MAX stays unsigned; a reply's
// mistyped keys read as absent.
TEST(KitRequest, ValuesAreEncodedAndReadTheWayTheDaemonDoes) {
  auto uuid = QRTUUID::fromString("0A1B2C3D-4E5F-4061-8293-A4B5C6D7E8F9");
  ASSERT_TRUE(uuid);
  const plist::Dictionary m = qk::Request(qk::Command::replaceContainer)
                                  .uuid("U", *uuid)
                                  .uuid("Absent", std::nullopt)
                                  .string("S", std::nullopt)
                                  .u64("Big", UINT64_MAX)
                                  .u64("Small", 7)
                                  .i64("Negative", -2)
                                  .message();
  EXPECT_EQ(m, (plist::Dictionary{{QRTKeyCommand, 2},
                                  {"U", plist::Data(uuid->bytes().begin(), uuid->bytes().end())},
                                  {"Big", plist::Integer{UINT64_MAX, true}},
                                  {"Small", plist::Integer{7, false}},
                                  {"Negative", -2}}));

  qk::Reply reply({{QRTReplyKeyError, 1},
                   {QRTReplyKeyPath, 5},
                   {QRTReplyKeyUUID, plist::Data(15, 0)},
                   {QRTReplyKeyIdsArray, plist::Array{"a", 3, "b"}},
                   {QRTReplyKeyExisted, "yes"}});
  EXPECT_TRUE(reply.ok());
  EXPECT_FALSE(reply.string(QRTReplyKeyPath) || reply.uuid(QRTReplyKeyUUID) || reply.boolean(QRTReplyKeyExisted));
  EXPECT_EQ(0u, reply.u64("Missing"));
  EXPECT_EQ((std::vector<std::string>{"a", "b"}), reply.strings(QRTReplyKeyIdsArray));
}

}  // namespace
