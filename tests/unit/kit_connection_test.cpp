#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <random>
#include <thread>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/Frame.h"

namespace {

using Message = std::pair<uint64_t, plist::Dictionary>;

// The daemon's end of a socketpair, driven by the test.
class FakeServer {
 public:
  FakeServer() {
    int sv[2];
    EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv));
    fd_ = sv[1];
    client = qk::Connection::adopt(sv[0]);
  }
  ~FakeServer() { hangUp(); }

  // The next request, or nothing once the client has gone.
  std::optional<Message> read() {
    for (;;) {
      if (auto f = decoder_.next()) {
        auto message = frame::decodeMessage(f->payload);
        if (!message) return std::nullopt;
        return Message{f->messageId, std::move(*message)};
      }
      uint8_t buf[4096];
      ssize_t n = ::recv(fd_, buf, sizeof buf, 0);
      if (n <= 0) return std::nullopt;
      decoder_.append(buf, static_cast<size_t>(n));
    }
  }
  void write(const std::vector<uint8_t>& bytes) {
    ASSERT_EQ(static_cast<ssize_t>(bytes.size()), ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL));
  }
  void reply(uint64_t id, const plist::Dictionary& d) { write(frame::encode(id, d)); }
  void hangUp() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

  std::unique_ptr<qk::Connection> client;

 private:
  int fd_ = -1;
  frame::Decoder decoder_;
};

plist::Dictionary numbered(uint64_t n) { return qk::Request(qk::Command::infoValueForKey).u64("N", n).message(); }

uint64_t numberOf(const plist::Dictionary& d) { return qk::Reply(d).u64("N"); }

TEST(KitConnection, RepliesOutOfOrderAreMatchedById) {
  FakeServer server;
  std::vector<std::future<std::optional<plist::Dictionary>>> futures;
  for (uint64_t n = 0; n < 3; ++n) futures.push_back(server.client->send(numbered(n)));
  std::vector<Message> requests;
  for (int i = 0; i < 3; ++i) requests.push_back(*server.read());
  std::reverse(requests.begin(), requests.end());
  for (const auto& [id, message] : requests) server.reply(id, {{"N", numberOf(message)}});
  for (uint64_t n = 0; n < 3; ++n) {
    auto reply = futures[n].get();
    ASSERT_TRUE(reply);
    EXPECT_EQ(n, numberOf(*reply));
  }
}

TEST(KitConnection, ManyRequestsInFlightFromManyThreads) {
  constexpr int kThreads = 8, kPerThread = 8;
  FakeServer server;
  // The server holds every reply back until all 64 requests are in flight,
  // then answers them in random order.
  std::thread serverThread([&] {
    std::vector<Message> requests;
    for (int i = 0; i < kThreads * kPerThread; ++i) {
      auto m = server.read();
      ASSERT_TRUE(m);
      requests.push_back(std::move(*m));
    }
    std::shuffle(requests.begin(), requests.end(), std::mt19937(7));
    for (const auto& [id, message] : requests) server.reply(id, {{"N", numberOf(message)}});
  });
  std::atomic<int> matched{0};
  std::vector<std::thread> clients;
  for (int t = 0; t < kThreads; ++t) {
    clients.emplace_back([&, t] {
      std::vector<std::future<std::optional<plist::Dictionary>>> futures;
      for (int i = 0; i < kPerThread; ++i) futures.push_back(server.client->send(numbered(t * 100 + i)));
      for (int i = 0; i < kPerThread; ++i) {
        auto reply = futures[i].get();
        if (reply && numberOf(*reply) == static_cast<uint64_t>(t * 100 + i)) ++matched;
      }
    });
  }
  for (auto& c : clients) c.join();
  serverThread.join();
  EXPECT_EQ(kThreads * kPerThread, matched.load());
}

TEST(KitConnection, ServerClosingMidFlightFailsEveryPendingCall) {
  FakeServer server;
  std::vector<std::future<std::optional<plist::Dictionary>>> futures;
  for (uint64_t n = 0; n < 5; ++n) futures.push_back(server.client->send(numbered(n)));
  for (int i = 0; i < 2; ++i) {
    auto m = server.read();
    ASSERT_TRUE(m);
    server.reply(m->first, {{"N", numberOf(m->second)}});
  }
  server.hangUp();
  EXPECT_TRUE(futures[0].get());
  EXPECT_TRUE(futures[1].get());
  for (int i = 2; i < 5; ++i) EXPECT_FALSE(futures[i].get());
  EXPECT_TRUE(server.client->closed());
  // Later requests fail at once instead of waiting for their timeout.
  EXPECT_FALSE(server.client->call(numbered(9), std::chrono::hours(1)));
}

TEST(KitConnection, DestroyingTheConnectionReleasesWaiters) {
  FakeServer server;
  auto future = server.client->send(numbered(1));
  server.client.reset();
  EXPECT_FALSE(future.get());
}

TEST(KitConnection, UnknownReplyIdIsIgnored) {
  FakeServer server;
  auto future = server.client->send(numbered(4));
  auto m = server.read();
  ASSERT_TRUE(m);
  server.reply(m->first + 1000, {{"N", 99}});
  server.reply(m->first, {{"N", 4}});
  auto reply = future.get();
  ASSERT_TRUE(reply);
  EXPECT_EQ(4u, numberOf(*reply));
  EXPECT_FALSE(server.client->closed());
}

TEST(KitConnection, UndecodablePayloadFailsOnlyItsRequest) {
  FakeServer server;
  auto bad = server.client->send(numbered(1));
  auto good = server.client->send(numbered(2));
  auto first = server.read(), second = server.read();
  ASSERT_TRUE(first && second);
  std::vector<uint8_t> garbage = {12, 0, 0, 0};
  for (int i = 0; i < 8; ++i) garbage.push_back(static_cast<uint8_t>(first->first >> (8 * i)));
  garbage.insert(garbage.end(), {'j', 'u', 'n', 'k'});
  server.write(garbage);
  server.reply(second->first, {{"N", 2}});
  EXPECT_FALSE(bad.get());
  EXPECT_TRUE(good.get());
  EXPECT_FALSE(server.client->closed());
}

TEST(KitConnection, FrameLengthOutOfRangeClosesTheConnection) {
  FakeServer server;
  auto future = server.client->send(numbered(1));
  ASSERT_TRUE(server.read());
  server.write({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0});
  EXPECT_FALSE(future.get());
  EXPECT_TRUE(server.client->closed());
}

TEST(KitConnection, TimedOutCallIgnoresItsLateReply) {
  FakeServer server;
  server.client->setReplyTimeout(std::chrono::milliseconds(1));
  EXPECT_FALSE(qk::perform(*server.client, qk::Request(numbered(1))));
  server.client->setReplyTimeout(std::chrono::minutes(1));
  auto late = server.read();
  ASSERT_TRUE(late);
  server.reply(late->first, {{"N", 1}});
  std::thread answer([&] {
    auto m = server.read();
    if (m) server.reply(m->first, {{"N", 2}});
  });
  auto reply = server.client->call(numbered(2));
  answer.join();
  ASSERT_TRUE(reply);
  EXPECT_EQ(2u, numberOf(*reply));
}

TEST(KitConnection, OversizedRequestFailsAloneAndTheStreamGoesOn) {
  FakeServer server;
  EXPECT_FALSE(server.client->call({{"Blob", plist::Data(frame::kMaxLength, 0)}}));
  std::thread answer([&] {
    auto m = server.read();
    if (m) server.reply(m->first, {{"N", numberOf(m->second)}});
  });
  auto reply = server.client->call(numbered(3));
  answer.join();
  ASSERT_TRUE(reply);
  EXPECT_EQ(3u, numberOf(*reply));
}

TEST(KitConnection, ConnectsByPathAndReportsFailure) {
  EXPECT_EQ("/run/com.norvane.quarterd", qk::requestSocketPath());
  EXPECT_EQ("/tmp/root/run/com.norvane.quarterd", qk::requestSocketPath("/tmp/root/"));

  std::string error;
  EXPECT_EQ(nullptr, qk::Connection::connect("/nonexistent/socket", &error));
  EXPECT_NE(std::string::npos, error.find("/nonexistent/socket"));

  char dir[] = "/tmp/kit_connection_XXXXXX";
  ASSERT_NE(nullptr, mkdtemp(dir));
  std::string path = std::string(dir) + "/sock";
  int listener = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  strcpy(address.sun_path, path.c_str());
  ASSERT_EQ(0, bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address));
  ASSERT_EQ(0, listen(listener, 1));
  auto connection = qk::Connection::connect(path, &error);
  EXPECT_NE(nullptr, connection) << error;
  connection.reset();
  close(listener);
  unlink(path.c_str());
  rmdir(dir);
}

TEST(KitRequest, EncodesValuesTheWayTheDaemonReadsThem) {
  auto uuid = QRTUUID::fromString("0A1B2C3D-4E5F-4061-8293-A4B5C6D7E8F9");
  ASSERT_TRUE(uuid);
  const plist::Dictionary m = qk::Request(qk::Command::replaceContainer)
                                  .uuid("U", *uuid)
                                  .uuid("Absent", std::optional<QRTUUID>())
                                  .string("S", std::optional<std::string>())
                                  .u64("Big", UINT64_MAX)
                                  .u64("Small", 7)
                                  .i64("Negative", -2)
                                  .message();
  EXPECT_EQ(2u, plist::find(m, "Command")->integer().asUnsigned());
  EXPECT_EQ(plist::Value(plist::Data(uuid->bytes().begin(), uuid->bytes().end())), *plist::find(m, "U"));
  EXPECT_EQ(nullptr, plist::find(m, "Absent"));
  EXPECT_EQ(nullptr, plist::find(m, "S"));
  EXPECT_EQ((plist::Integer{UINT64_MAX, true}), plist::find(m, "Big")->integer());
  EXPECT_EQ((plist::Integer{7, false}), plist::find(m, "Small")->integer());
  EXPECT_EQ(-2, plist::find(m, "Negative")->integer().asSigned());

  // The unsigned form survives the wire.
  auto frame = frame::encode(1, m);
  frame::Decoder decoder;
  decoder.append(frame.data(), frame.size());
  auto decoded = frame::decodeMessage(decoder.next()->payload);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(m, *decoded);
}

TEST(KitRequest, ReplyGettersReadMistypedKeysAsAbsent) {
  qk::Reply reply({{"ReplyError", 1},
                   {"ReplyPath", 5},
                   {"ReplyUUID", plist::Data(15, 0)},
                   {"ReplyIdsArray", plist::Array{"a", 3, "b"}},
                   {"ReplyExisted", "yes"}});
  EXPECT_TRUE(reply.ok());
  EXPECT_FALSE(reply.string("ReplyPath"));
  EXPECT_FALSE(reply.uuid("ReplyUUID"));
  EXPECT_FALSE(reply.boolean("ReplyExisted"));
  EXPECT_EQ(0u, reply.u64("Missing"));
  EXPECT_EQ((std::vector<std::string>{"a", "b"}), reply.strings("ReplyIdsArray"));
  EXPECT_EQ(0u, qk::Reply({}).error());
}

// The typed calls put each argument under the key the daemon reads.
TEST(KitRequest, TypedCallsUseTheProtocolKeys) {
  FakeServer server;
  QRTUUID uuid = QRTUUID::random();
  std::thread caller([&] {
    qk::createOrLookupContainer(*server.client, 501, "com.example.app", 2, true, false);
    qk::stageContainerForDelete(*server.client, {501}, {uuid}, {"a"}, {2});
    qk::setDataProtection(*server.client, 501, std::nullopt, 2, -1, true, false);
  });
  auto next = [&]() -> plist::Dictionary {
    auto m = server.read();
    if (!m) return {};
    server.reply(m->first, {{"ReplyError", 1}});
    return m->second;
  };
  using D = plist::Dictionary;
  using A = plist::Array;
  EXPECT_EQ((D{{"Command", 0},
               {"UserID", 501},
               {"Identifier", "com.example.app"},
               {"ContainerClass", 2},
               {"CreateIfNecessary", true},
               {"Transient", false}}),
            next());
  EXPECT_EQ((D{{"Command", 3},
               {"UserIDsArray", A{501}},
               {"UUIDsArray", A{qk::uuidValue(uuid)}},
               {"IdentifiersArray", A{"a"}},
               {"ContainerClassesArray", A{2}}}),
            next());
  EXPECT_EQ((D{{"Command", 21},
               {"UserID", 501},
               {"ContainerClass", 2},
               {"DataProtectionClass", -1},
               {"IsThirdParty", true},
               {"RetryIfLocked", false}}),
            next());
  caller.join();
}

}  // namespace
