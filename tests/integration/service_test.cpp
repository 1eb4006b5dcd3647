// quarterd as a service: readiness and stopping told to the service manager
// through a notify socket this test owns, SIGHUP reopening the log.
#include <signal.h>
#include <stdio.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "QuarterKit/Upcall.h"

namespace {

class ServiceTest : public DaemonFixture {
 protected:
  // Restarts the daemon with NOTIFY_SOCKET naming a datagram socket of ours.
  void restartNotifying() {
    ASSERT_EQ(stopDaemon(), 0);
    notify = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    ASSERT_GE(notify, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = root + "/notify";
    ASSERT_LT(path.size(), sizeof address.sun_path);
    path.copy(address.sun_path, path.size());
    ASSERT_EQ(bind(notify, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    timeval timeout{30, 0};
    setsockopt(notify, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    setenv("NOTIFY_SOCKET", path.c_str(), 1);
    startDaemon();
    unsetenv("NOTIFY_SOCKET");
  }
  void TearDown() override {
    if (notify >= 0) close(notify);
    DaemonFixture::TearDown();
  }

  // Messages up to and including the first that holds state; empty when none came.
  std::vector<std::string> receiveUntil(const std::string& state) {
    std::vector<std::string> messages;
    char buffer[4096];
    for (ssize_t n; (n = recv(notify, buffer, sizeof buffer, 0)) > 0;) {
      messages.emplace_back(buffer, static_cast<size_t>(n));
      if (contains(messages.back(), state)) return messages;
    }
    return {};
  }

  int notify = -1;
};

TEST_F(ServiceTest, ReadyOnlyOnceRequestsAreServedAndStoppingOnSigterm) {
  restartNotifying();
  std::vector<std::string> start = receiveUntil("READY=1");
  ASSERT_FALSE(start.empty()) << "no READY=1";
  // The moment READY=1 is out, a request must be answered (this program
  // has no entitlement: a refusal is an answer too).
  EXPECT_NE(codeOf(call(QRTCommandContainersForUser, {{QRTKeyUserID, 501}, {QRTKeyContainerClass, 2}})), 0u);
  EXPECT_TRUE(contains(start.front(), "STATUS=Starting")) << start.front();
  EXPECT_TRUE(contains(start.back(), "STATUS=")) << start.back();

  EXPECT_EQ(stopDaemon(), 0);
  EXPECT_FALSE(receiveUntil("STOPPING=1").empty()) << "no STOPPING=1";
}

// The daemon under the unit's own system-call filter (any call outside it
// kills the process, as under the service manager) serves both sockets, makes
// user and system containers, and removes both sockets on SIGTERM.
TEST_F(ServiceTest, ServesUnderTheUnitsSystemCallFilterAndRemovesItsSocketsOnExit) {
#ifdef __SANITIZE_THREAD__
  GTEST_SKIP() << "the thread sanitizer's runtime makes calls outside the unit's filter";
#endif
  const std::string unit = readFile(QRT_UNIT_PATH), key = "\nSystemCallFilter=";
  const size_t at = unit.find(key);
  ASSERT_NE(at, std::string::npos);
  const std::string filter = unit.substr(at + key.size(), unit.find('\n', at + 1) - at - key.size());
  ASSERT_EQ(stopDaemon(), 0);
  daemon = fork();
  if (daemon == 0) {
    execl(QRT_SECCOMP_RUN_PATH, QRT_SECCOMP_RUN_PATH, "--filter", filter.c_str(), "--", QRT_DAEMON_PATH, "--root",
          root.c_str(), nullptr);
    _exit(127);
  }
  const std::string request = qk::requestSocketPath(root), upcall = qk::upcallSocketPath(root);
  ASSERT_TRUE(eventually([&] { return exists(upcall) && exists(request); }));
  setOwnIdentity("com.example.installer", {{QRTEntitlementAllowed, true}});
  make(501, "com.example.app", 2);
  EXPECT_EQ(codeOf(call(QRTCommandSystemContainerPath, {{QRTKeyIdentifier, "com.norvane.mapsd"}})), 1u);
  make(499, "com.norvane.mapsd", 12);
  qk::UpcallRequest question;
  question.codeSignatureId = "com.example.app";
  question.personaId = 501;
  auto client = qk::UpcallClient::connect(upcall);
  ASSERT_TRUE(client);
  auto answer = client->call(question);
  EXPECT_TRUE(answer && answer->returnCode == 0 && answer->dataContainer);
  client.reset();

  EXPECT_EQ(stopDaemon(), 0) << "a call outside the filter kills with SIGSYS";
  EXPECT_FALSE(exists(request));
  EXPECT_FALSE(exists(upcall));
}

TEST_F(ServiceTest, HangupReopensTheLogAfterOutsideRotation) {
  const std::string log = root + "/private/var/root/Library/Logs/QuarterKit/quarterd.log";
  ASSERT_TRUE(logContains("quarterd built at"));
  ASSERT_EQ(rename(log.c_str(), (log + ".rotated").c_str()), 0);
  kill(daemon, SIGHUP);
  EXPECT_TRUE(logContains("Log reopened"));
  EXPECT_FALSE(contains(readFile(log + ".rotated"), "Log reopened"));
}

}  // namespace
