// Starts the real quarterd on a fresh device root and tears it down with
// SIGTERM, checking that it exits 0.
#pragma once

#include <signal.h>
#include <sys/types.h>
#include <unistd.h>

#include <functional>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "QuarterKit/QuarterKit.h"
#include "base/PlistValue.h"
#include "base/QRTProtocol.h"
#include "base/QRTUUID.h"

// A container as command 0 (or 15) answered for it; user and cls echo the
// request, error is 0 when no reply came.
struct Container {
  uint64_t user = 0;
  uint64_t cls = 0;
  uint64_t error = 0;
  std::string identifier;
  std::string path;
  QRTUUID uuid;
  bool existed = false;
};

// A program's exit status (below 0 when it did not exit normally) and what it printed.
struct ProgramRun {
  int status = -1;
  std::string out, err;
};

class DaemonFixture : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Starts the daemon and waits for its socket.
  void startDaemon();
  // The signal (SIGTERM unless given), then the exit status as waitpid reports it.
  int stopDaemon(int signal = SIGTERM);
  void killDaemon() { stopDaemon(SIGKILL); }

  // SIGTERM (expecting exit 0), then start again.
  void restartDaemon();

  std::unique_ptr<qk::Connection> connect();
  // One request on a fresh connection; nothing when no reply came, which
  // tests that kill the daemon rely on.
  std::optional<plist::Dictionary> call(uint64_t command, plist::Dictionary keys = {});
  // Command 0, or 15 for a well-known system container.
  Container createOrLookup(uint64_t user, const std::string& identifier, uint64_t cls, bool create = true,
                           bool transient = false, uint64_t command = 0);

  // createOrLookup that expects a success.
  Container make(uint64_t user, const std::string& identifier, uint64_t cls, bool transient = false);
  // Command 22, registering a program's entitlements as an installer does.
  uint64_t registerProgram(const std::string& id, const plist::Dictionary& entitlements,
                           const plist::Dictionary& options = {});

  std::string daemonCaches() const { return root + "/private/var/root/Library/Caches/com.norvane.quarterd"; }
  std::string deadDirectory() const { return daemonCaches() + "/Dead"; }
  // User 501's application class directory.
  std::string appClassDir() const { return root + "/private/var/mobile/Containers/Data/Application"; }

  // Registers (or replaces) the identity file name.plist for an executable;
  // system-level entitlements count for the users listed (root when none are).
  void setIdentity(const std::string& name, const std::string& executable, const std::string& signingIdentifier,
                   const plist::Dictionary& entitlements, const plist::Array& users = {});
  // Registers an identity for this test program's own executable.
  void setOwnIdentity(const std::string& signingIdentifier, const plist::Dictionary& entitlements);
  void clearOwnIdentity();

  // Moves a directory of the device root onto a tmpfs of its own, the daemon
  // stopped around it; false (the daemon running as before) when mounting is
  // refused. mountHomeOnTmpfs does so for user 501's home.
  bool mountOnTmpfs(const std::string& directory, const std::string& size);
  bool mountHomeOnTmpfs() { return mountOnTmpfs(root + "/private/var/mobile", "96m"); }

  // A copy of quarterctl under the root that holds the master entitlement; its path.
  std::string entitledQuarterctl();

  // Arms the crash point and expects the daemon to die there by SIGKILL while
  // it serves the command (started first if it is stopped), or with no command
  // while it starts. The daemon is left stopped and the point disarmed.
  void expectKilledAt(const std::string& point, std::optional<uint64_t> command, const plist::Dictionary& keys = {});
  // The next start counts as the first after a boot.
  void reboot() { unlink((root + "/run/quarterd.fb_check").c_str()); }

  std::string logText() const;
  // Waits (up to 10 s) until the log holds the text.
  bool logContains(const std::string& text) const;
  // How often the log holds the text now.
  size_t logCount(const std::string& text) const;

  std::string root;
  pid_t daemon = -1;
  std::vector<std::string> mounted;  // innermost last

 private:
  void launchDaemon();
};

// The fixture with this test program registered as an installer that holds
// the master entitlement.
class InstallerFixture : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    if (!HasFatalFailure()) beInstaller();
  }
  void beInstaller() { setOwnIdentity("com.example.installer", {{QRTEntitlementAllowed, true}}); }
};

plist::Dictionary request(uint64_t command, plist::Dictionary keys = {});
// The reply's "ReplyError", or 0 when there is none.
uint64_t codeOf(const std::optional<plist::Dictionary>& reply);
plist::Data uuidData(const QRTUUID& uuid);
// Lenient readers: a missing or mistyped key fails the check that uses it.
std::optional<plist::Value> at(const std::optional<plist::Dictionary>& reply, const char* key);
std::optional<uint64_t> u64At(const std::optional<plist::Dictionary>& reply, const char* key);
std::string stringAt(const std::optional<plist::Dictionary>& reply, const char* key);  // "" when there is none

// Request keys naming a container, and the keys with more added (a key in
// both takes its value from more) or with one erased.
plist::Dictionary byName(uint64_t user, uint64_t cls, const std::string& identifier);
plist::Dictionary byName(const Container& c);
plist::Dictionary selector(const Container& c);
plist::Dictionary with(plist::Dictionary keys, plist::Dictionary more);
plist::Dictionary without(plist::Dictionary keys, const std::string& key);
// Command 2's keys: fresh replaces old, or (no old) a transient container is promoted.
plist::Dictionary replaceKeys(const Container* old, const Container& fresh);
// Command 11's parallel arrays for one container.
plist::Dictionary stageKeys(const Container& c);
plist::Array strings(std::initializer_list<const char*> items);

// Drops every group and takes uid as user and group, or exits 126.
void becomeUser(uid_t uid);
// The child's exit status; 255 when it did not exit.
int exitStatus(pid_t pid);
// Runs step in a child as the user: its exit status, 0 when step returned
// true; *pid (when given) receives the child's pid.
int asUser(uid_t uid, const std::function<bool()>& step, pid_t* pid = nullptr);
// A connected stream socket, or -1.
int rawConnect(const std::string& path);

inline const char* const kMetadataFile = ".com.norvane.quarter_kit.metadata.plist";
std::string baseName(const std::string& path);
std::string parentOf(const std::string& path);
// The owner and permission bits (stat follows links); all ones when missing.
std::pair<uint32_t, uint32_t> ownerAndMode(const std::string& path);

bool contains(const std::string& text, const std::string& part);
// Polls the condition until it holds, for up to 10 s; whether it held.
bool eventually(const std::function<bool()>& condition);
// File helpers; a missing file reads as empty, a missing directory lists nothing.
void writeFile(const std::string& path, const std::string& text);
void writePlist(const std::string& path, const plist::Dictionary& dictionary);
std::string readFile(const std::string& path);
// What a shell command prints on standard output.
std::string output(const std::string& command);
bool exists(const std::string& path);
std::vector<std::string> listDirectory(const std::string& path);
std::optional<plist::Dictionary> readPlist(const std::string& path);
std::string readLink(const std::string& path);
