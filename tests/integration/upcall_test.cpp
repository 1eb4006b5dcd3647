// The kernel upcall socket seen from the sandbox launcher: a starting
// process's containers, the frame checks and who may ask.
#include <sys/stat.h>
#include <unistd.h>

#include "DaemonFixture.h"
#include "QuarterKit/Upcall.h"

namespace {

class UpcallTest : public DaemonFixture {
 protected:
  std::unique_ptr<qk::UpcallClient> kernel() {
    std::string error;
    auto client = qk::UpcallClient::connect(qk::upcallSocketPath(root), &error);
    EXPECT_TRUE(client) << error;
    return client;
  }
};

qk::UpcallRequest app(const std::string& id, uint32_t persona = 501) {
  qk::UpcallRequest r;
  r.codeSignatureId = id;
  r.personaId = persona;
  return r;
}

TEST_F(UpcallTest, StartingProcessGetsItsContainers) {
  auto k = kernel();
  ASSERT_TRUE(k);
  struct Case {
    const char* name;
    qk::UpcallRequest request;
    const char* expectedId;  // identifier of the data container, or null for none
    uint64_t cls;
  };
  qk::UpcallRequest both = app("com.example.signed");
  both.containerId = "com.example.container";
  qk::UpcallRequest plugin = app("com.example.plugin");
  plugin.containerType = 1;
  qk::UpcallRequest personaOnly;
  personaOnly.personaId = 0;
  // The installer's registration says the program's data container is a plug-in's.
  setOwnIdentity("com.example.installer", {{QRTEntitlementAllowed, true}});
  EXPECT_EQ(registerProgram("com.example.mapped", {}, {{"com.norvane.QuarterKit.DataContainerClass", 4}}), 1u);
  const Case cases[] = {
      {"application", app("com.example.app"), "com.example.app", 2},
      {"container id wins", both, "com.example.container", 2},
      {"unmapped plug-in", plugin, "com.example.plugin", 4},
      {"mapped plug-in started as an application", app("com.example.mapped"), "com.example.mapped", 4},
      {"persona only", personaOnly, nullptr, 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    auto answer = k->call(c.request);
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->replyId, 322515000u);
    ASSERT_EQ(answer->returnCode, 0);
    ASSERT_TRUE(answer->readable);
    EXPECT_EQ(answer->status, 1u);
    uint32_t persona = c.request.personaId.value_or(0);
    EXPECT_EQ(answer->home, root + (persona == 0 ? "/private/var/root" : "/private/var/mobile"));
    if (!c.expectedId) {
      EXPECT_FALSE(answer->dataContainer);
      EXPECT_FALSE(answer->tempDir);
      continue;
    }
    // The same container a client finds, made on disk, with its tmp.
    Container found = createOrLookup(persona, c.expectedId, c.cls, false);
    EXPECT_EQ(found.error, 1u);
    EXPECT_EQ(answer->dataContainer, found.path);
    EXPECT_EQ(answer->tempDir, found.path + "/tmp");
    EXPECT_TRUE(exists(found.path + "/tmp"));
    EXPECT_TRUE(answer->groups.empty());
    EXPECT_FALSE(answer->systemContainer);
    EXPECT_EQ(k->call(c.request)->dataContainer, found.path);
  }
  // Groups and system containers the request names, in request order.
  qk::UpcallRequest full = app("com.example.app");
  full.appGroupIds = {"group.com.example.b", "group.com.example.a"};
  full.systemContainerId = "com.example.system";
  full.systemGroupIds = {"systemgroup.com.example.s"};
  auto withGroups = k->call(full);
  ASSERT_TRUE(withGroups && withGroups->readable);
  EXPECT_EQ(withGroups->status, 1u);
  using Pairs = std::vector<std::pair<std::string, std::string>>;
  EXPECT_EQ(withGroups->groups,
            (Pairs{{"group.com.example.b", createOrLookup(501, "group.com.example.b", 7, false).path},
                   {"group.com.example.a", createOrLookup(501, "group.com.example.a", 7, false).path}}));
  // (A client needs the system container's entitlement to look it up.)
  ASSERT_TRUE(withGroups->systemContainer);
  EXPECT_EQ(parentOf(*withGroups->systemContainer), root + "/private/var/containers/Data/System");
  EXPECT_TRUE(exists(*withGroups->systemContainer));
  EXPECT_EQ(withGroups->systemGroups,
            (Pairs{{"systemgroup.com.example.s", createOrLookup(499, "systemgroup.com.example.s", 13, false).path}}));
  for (const auto& [id, path] : withGroups->groups) EXPECT_TRUE(exists(path)) << id;

  // A container that cannot be made (a persona without an account): status 0
  // and no paths at all.
  auto answer = k->call(app("com.example.app", 4242));
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->returnCode, 0);
  EXPECT_EQ(answer->status, 0u);
  EXPECT_FALSE(answer->home || answer->dataContainer || answer->tempDir);
}

TEST_F(UpcallTest, MalformedFramesGetTheirCodes) {
  auto k = kernel();
  ASSERT_TRUE(k);
  const std::vector<uint8_t> good = qk::packUpcallRequest(app("com.example.app"));
  std::vector<uint8_t> unknownItem = {2, 0, 9, 0, 2, 0, 0, 0, 'x', 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  std::vector<uint8_t> cut(good.begin(), good.end() - 8);  // no end marker
  // Three bytes, none of them NUL.
  std::vector<uint8_t> noNul = {2, 0, 0, 0, 3, 0, 0, 0, 'a', 'b', 'c', 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  struct Case {
    const char* name;
    qk::UpcallFrame frame;
    std::vector<uint8_t> region;
    int32_t code;
  };
  const Case cases[] = {
      {"other routine", {.id = 322514901}, good, -303},
      {"not complex", {.bits = 0}, good, -304},
      {"two descriptors", {.descriptorCount = 2}, good, -304},
      {"not out-of-line", {.descriptorType = 2}, good, -300},
      {"request size differs", {.requestSize = 4}, good, -300},
      {"unknown item", {}, unknownItem, 4},
      {"cut buffer", {}, cut, 5},
      {"string without NUL", {}, noNul, 5},
      {"empty region", {}, {}, 5},
  };
  for (const Case& c : cases) {
    ASSERT_TRUE(k->send(c.frame, c.region)) << c.name;
    auto answer = k->receive();
    ASSERT_TRUE(answer) << c.name;
    EXPECT_EQ(answer->replyId, c.frame.id + 100) << c.name;
    EXPECT_EQ(answer->returnCode, c.code) << c.name;
  }
  EXPECT_EQ(k->call(app("com.example.app"))->status, 1u) << "the connection survived all of them";

  // Not this server's id, and a region over 1 MiB, close the connection.
  for (qk::UpcallFrame frame : {qk::UpcallFrame{.id = 42}, qk::UpcallFrame{.regionSize = (1u << 20) + 1}}) {
    auto c = kernel();
    ASSERT_TRUE(c->send(frame, good));
    EXPECT_FALSE(c->receive());
    EXPECT_TRUE(c->closedByPeer());
  }
}

TEST_F(UpcallTest, OnlyRootMayAsk) {
  const std::string path = qk::upcallSocketPath(root);
  struct stat st {};
  ASSERT_EQ(lstat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0600u);
  // As uid 501: connecting fails, then (the mode opened) the answer's return code is 5.
  auto asked = [&] {
    auto c = qk::UpcallClient::connect(path);
    auto answer = c ? c->call(app("com.example.app")) : std::nullopt;
    return answer && answer->returnCode == 5;
  };
  EXPECT_EQ(asUser(501, [&] { return !qk::UpcallClient::connect(path); }), 0);
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  pid_t pid = -1;
  EXPECT_EQ(asUser(501, asked, &pid), 0);
  EXPECT_TRUE(logContains("Refusing an upcall from pid " + std::to_string(pid) + ":"));
}

}  // namespace
