// Starts the real quarterd on a fresh device root and tears it down with
// SIGTERM, checking that it exits 0.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "QuarterKit/QuarterKit.h"
#include "base/PlistValue.h"

class DaemonFixture : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Starts the daemon and waits for its socket.
  void startDaemon();
  // SIGTERM and the exit status (as waitpid reports it).
  int stopDaemon();
  void killDaemon();

  std::unique_ptr<qk::Connection> connect();
  // One request on a fresh connection; the reply's "ReplyError", or 0 when
  // no reply came.
  uint64_t replyError(const plist::Dictionary& request);

  // Registers an identity for this test program's own executable.
  void setOwnIdentity(const std::string& signingIdentifier, const plist::Dictionary& entitlements);
  void clearOwnIdentity();

  std::string logText() const;
  // Waits (up to 5 s) until the log holds the text.
  bool logContains(const std::string& text) const;

  std::string root;
  pid_t daemon = -1;
};

plist::Dictionary request(uint64_t command, plist::Dictionary keys = {});
