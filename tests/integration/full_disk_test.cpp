// A store whose file system is full to the last block: every mutating
// command answers an error code with a log line and leaves nothing
// half-made, reads keep working, and once space is freed every command
// works again and a restart recovers what was pending.
#include <fcntl.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

class FullDiskTest : public InstallerFixture {
 protected:
  void SetUp() override {
    InstallerFixture::SetUp();
    if (HasFatalFailure()) return;
    // The store on a small file system of its own, and the log on another,
    // as a journal would be, so that its lines outlive the full store.
    if (!mountOnTmpfs(root + "/private/var", "32m") || !mountOnTmpfs(root + "/private/var/root/Library/Logs", "8m"))
      GTEST_SKIP() << "cannot mount a tmpfs here";
  }

  std::string filler() const { return root + "/private/var/filler"; }

  // Grows the filler until not one more byte fits.
  void fill() {
    const int fd = open(filler().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0);
    std::vector<char> block(1 << 16, 'x');
    for (size_t size = block.size(); size > 0; size /= 2)
      while (write(fd, block.data(), size) == static_cast<ssize_t>(size)) {}
    close(fd);
  }

  uint64_t registerGroup(const std::string& group) {
    return registerProgram("com.example.kept", {{"com.norvane.security.application-groups", plist::Array{group}}});
  }

  std::string infoValue(const Container& c) {
    return stringAt(call(QRTCommandInfoValueForKey, with(selector(c), {{QRTKeyKey, "k"}})), QRTReplyKeyInfoValue);
  }

  // Every metadata file under the store parses: none was truncated.
  void expectMetadataReadable() {
    const std::string out =
        output("find " + root + "/private/var -name '" + kMetadataFile + "' -o -name '*.plist' -type f");
    size_t start = 0, files = 0;
    for (size_t end; (end = out.find('\n', start)) != std::string::npos; start = end + 1, ++files) {
      const std::string path = out.substr(start, end - start);
      EXPECT_TRUE(readPlist(path) || !exists(path)) << path;  // death row's may go meanwhile
    }
    EXPECT_GT(files, 0u);
  }
};

TEST_F(FullDiskTest, EveryChangeFailsCleanlyAndWorksAgainOnceSpaceIsFreed) {
  Container kept = make(501, "com.example.kept", 2);
  Container wiped = make(501, "com.example.wiped", 2), addon = make(501, "com.example.addon", 4);
  ASSERT_EQ(codeOf(call(QRTCommandSetInfoValue, with(selector(kept), {{QRTKeyKey, "k"}, {QRTKeyValue, "before"}}))),
            1u);
  ASSERT_EQ(registerGroup("group.com.example.before"), 1u);
  writeFile(kept.path + "/Documents/file", "content");
  const std::vector<std::string> containersBefore = listDirectory(appClassDir());

  // What each mutating command sends; the transient one stands for a
  // replacement staged by an installer.
  Container fresh = make(501, "com.example.kept", 2, /*transient=*/true);
  struct Change {
    const char* what;
    uint64_t command;
    plist::Dictionary keys;
  };
  const std::string big(64 << 10, 'v');
  const std::vector<Change> changes = {
      {"create",
       QRTCommandCreateOrLookupContainer,
       {{QRTKeyUserID, 501},
        {QRTKeyContainerClass, 2},
        {QRTKeyIdentifier, "com.example.new"},
        {QRTKeyCreateIfNecessary, true}}},
      {"info set", QRTCommandSetInfoValue, with(selector(kept), {{QRTKeyKey, "k"}, {QRTKeyValue, big}})},
      {"replace", QRTCommandReplaceContainer, replaceKeys(&kept, fresh)},
      {"wipe", QRTCommandDeleteDataContainerContent, byName(wiped)},
      {"stage for delete", QRTCommandStageContainerForDelete, stageKeys(addon)},
      {"protection change", QRTCommandSetDataProtection,
       with(byName(kept), {{QRTKeyDataProtectionClass, 3}, {QRTKeyIsThirdParty, false}, {QRTKeyRetryIfLocked, false}})},
      {"code-signing registration", QRTCommandProcessCodeSigningInfo, {}},
      {"migration", QRTCommandPerformDataMigration, {}},
  };

  ASSERT_NO_FATAL_FAILURE(fill());
  for (const Change& change : changes) {
    SCOPED_TRACE(change.what);
    const size_t logBefore = logText().size();
    const uint64_t code = change.command == QRTCommandProcessCodeSigningInfo
                              ? registerGroup("group.com.example." + big.substr(0, 4000))
                              : codeOf(call(change.command, change.keys));
    ASSERT_NE(code, 0u) << "no answer";
    if (code != 1) { EXPECT_GT(logText().size(), logBefore) << "an error without a log line"; }
    // Reads are still served, and the store is as it was.
    EXPECT_EQ(createOrLookup(501, "com.example.kept", 2, false).error, 1u);
    EXPECT_EQ(codeOf(call(QRTCommandCodeSigningInfoForIdentifier, {{QRTKeyIdentifier, "com.example.kept"}})), 1u);
    EXPECT_EQ(readFile(kept.path + "/Documents/file"), "content");
  }
  // Whatever was refused is not half there: no container beyond those made
  // before, the old value where the new one did not fit, nothing truncated.
  for (const std::string& name : listDirectory(appClassDir()))
    EXPECT_TRUE(std::find(containersBefore.begin(), containersBefore.end(), name) != containersBefore.end() ||
                name == baseName(fresh.path))
        << name;
  EXPECT_TRUE(infoValue(kept) == "before" || infoValue(kept) == big);
  EXPECT_TRUE(listDirectory(daemonCaches() + "/Staging").empty());
  expectMetadataReadable();

  // Space again: every command works, and a restart finds a consistent store.
  ASSERT_EQ(unlink(filler().c_str()), 0);
  restartDaemon();
  EXPECT_EQ(make(501, "com.example.new", 2).error, 1u);
  EXPECT_EQ(codeOf(call(QRTCommandSetInfoValue, with(selector(kept), {{QRTKeyKey, "k"}, {QRTKeyValue, "after"}}))), 1u);
  EXPECT_EQ(infoValue(kept), "after");
  EXPECT_EQ(registerGroup("group.com.example.after"), 1u);
  EXPECT_EQ(codeOf(call(QRTCommandDeleteDataContainerContent, byName(wiped))), 1u);
  expectMetadataReadable();
}

}  // namespace
