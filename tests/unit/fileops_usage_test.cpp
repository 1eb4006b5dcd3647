// Disk usage, protection-class get and set, and the tree dump of
// QRTFileManager, on a real ext4 scratch directory.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "Daemon/QRTFileManager.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

class UsageTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/var/tmp/qrt-usage-test.XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    base_ = tmpl;
    ASSERT_EQ(chmod(base_.c_str(), 0755), 0);
    root_ = base_ + "/t";
    ASSERT_EQ(mkdir(root_.c_str(), 0755), 0);
    platform::logOpen(base_ + "/quarterd.log", "usage-test", 7);
    oldRoot_ = platform::deviceRoot();
  }
  void TearDown() override {
    platform::logClose();
    platform::setDeviceRoot(oldRoot_);
    std::error_code ec;
    std::filesystem::remove_all(base_, ec);
  }

  std::string path(const std::string& rel) const { return root_ + "/" + rel; }
  QRTURL url(const std::string& rel) const { return QRTURL::fileURL(path(rel)); }
  void makeFile(const std::string& rel, size_t size) {
    std::filesystem::create_directories(std::filesystem::path(path(rel)).parent_path());
    std::ofstream(path(rel)) << std::string(size, 'x');
  }
  static uint64_t allocated(const std::string& p) {
    struct stat st {};
    EXPECT_EQ(lstat(p.c_str(), &st), 0) << p;
    return static_cast<uint64_t>(st.st_blocks) * 512;
  }
  std::string logText() const {
    std::ifstream in(base_ + "/quarterd.log");
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
  }
  bool logged(const std::string& line) const { return logText().find(line) != std::string::npos; }

  QRTFileManager& fm_ = QRTFileManager::defaultManager();
  std::string base_, root_, oldRoot_;
  QRTErrorRef error_;
};

// --- disk usage ------------------------------------------------------------

TEST_F(UsageTest, CountsAllocatedBytesOfEverythingButDirectories) {
  makeFile("c/empty", 0);
  makeFile("c/small", 1);
  makeFile("c/a/b/medium", 5000);
  makeFile("c/a/large", 300000);
  ASSERT_EQ(symlink(std::string(200, 'y').c_str(), path("c/a/link").c_str()), 0);  // a link with its own block
  std::filesystem::create_directories(path("c/a/b/hollow/hollower"));
  // Enough entries and directories that the walk runs on two threads.
  auto wide = [](int i) { return "c/wide/d" + std::to_string(i % 40) + "/f" + std::to_string(i); };
  for (int i = 0; i < 300; ++i) makeFile(wide(i), 50 * i);
  sync();
  uint64_t expected = 0;
  for (int i = 0; i < 300; ++i) expected += allocated(path(wide(i)));
  for (const char* rel : {"c/small", "c/a/b/medium", "c/a/large", "c/a/link"}) expected += allocated(path(rel));
  ASSERT_GT(allocated(path("c/a/link")), 0u);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);
  EXPECT_EQ(fm_.diskUsageForURL(url("c/a/b/hollow")), 0u);
}

TEST_F(UsageTest, HardLinkedFileCountedOncePerWalk) {
  makeFile("c/d0/twin", 10000);
  makeFile("c/d1/solo", 3000);
  makeFile("shared", 20000);
  for (int i = 1; i < 30; ++i) {
    std::filesystem::create_directories(path("c/d" + std::to_string(i)));
    ASSERT_EQ(link(path("c/d0/twin").c_str(), path("c/d" + std::to_string(i) + "/twin").c_str()), 0);
    for (int j = 0; j < 10; ++j) makeFile("c/d" + std::to_string(i) + "/empty" + std::to_string(j), 0);
  }
  ASSERT_EQ(link(path("shared").c_str(), path("c/d5/inside").c_str()), 0);  // its twin lies outside
  sync();
  const uint64_t expected = allocated(path("c/d0/twin")) + allocated(path("c/d1/solo")) + allocated(path("shared"));
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);  // nothing remembered between walks
  EXPECT_TRUE(logged("Skipping hardlinked file at " + path("c/d")));
}

TEST_F(UsageTest, RootThatIsNoDirectoryMeasuresZeroAndIsLogged) {
  makeFile("file", 5000);
  std::filesystem::create_directories(path("dir"));
  makeFile("dir/inner", 5000);
  ASSERT_EQ(symlink(path("dir").c_str(), path("link").c_str()), 0);
  EXPECT_EQ(fm_.diskUsageForURL(url("missing")), 0u);
  EXPECT_EQ(fm_.diskUsageForURL(url("file")), 0u);
  EXPECT_EQ(fm_.diskUsageForURL(url("link")), 0u);  // never followed
  EXPECT_EQ(fm_.diskUsageForURL(QRTURL()), 0u);
  EXPECT_TRUE(logged("Failed to open directory " + path("missing") + " : No such file or directory"));
  EXPECT_TRUE(logged("Failed to open directory " + path("file") + " : Not a directory"));
  EXPECT_TRUE(logged("Failed to open directory " + path("link") + " : Not a directory"));
  EXPECT_TRUE(logged("Failed to get path to url "));
}

TEST_F(UsageTest, UnreadableDirectoryIsSkippedAndTheRestMeasured) {
  makeFile("c/open/f", 7000);
  makeFile("c/locked/f", 9000);
  ASSERT_EQ(chmod(path("c/locked").c_str(), 0), 0);
  sync();
  const uint64_t expected = allocated(path("c/open/f"));
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {  // root opens anything; someone else cannot
    if (setresuid(65534, 65534, 65534) != 0) _exit(2);
    uint64_t total = fm_.diskUsageForURL(url("c"));
    _exit(write(fds[1], &total, sizeof total) == sizeof total ? 0 : 3);
  }
  close(fds[1]);
  uint64_t total = 0;
  EXPECT_EQ(read(fds[0], &total, sizeof total), static_cast<ssize_t>(sizeof total));
  close(fds[0]);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(total, expected);
  EXPECT_TRUE(logged("Failed to open directory " + path("c/locked") + " : Permission denied"));
}

TEST_F(UsageTest, ChildDirectoryBeyondPathMaxIsLeftOut) {
  makeFile("c/counted", 4000);
  sync();
  // Built relative to open directories: the full path is too long for the kernel.
  const std::string name(200, 'n');
  int fd = open(path("c").c_str(), O_RDONLY | O_DIRECTORY);
  for (int depth = 0; depth < 25 && fd >= 0; ++depth) {
    ASSERT_EQ(mkdirat(fd, name.c_str(), 0755), 0);
    int next = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY);
    close(fd);
    fd = next;
  }
  ASSERT_GE(fd, 0);
  int file = openat(fd, "deep", O_WRONLY | O_CREAT, 0644);
  ASSERT_EQ(write(file, "deep", 4), 4);
  close(file);
  close(fd);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), allocated(path("c/counted")));
  EXPECT_TRUE(logged("Failed to create path to child directory by appending \"" + name + "\" to "));
  std::filesystem::remove_all(path("c"));  // TearDown's removal would stop at the long path
}

// --- protection classes ----------------------------------------------------

TEST_F(UsageTest, ClassIsSetAndReadOnFilesAndDirectories) {
  makeFile("f", 10);
  std::filesystem::create_directories(path("d"));
  int32_t cls = -1;
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("f"), &cls, &error_));
  EXPECT_EQ(cls, 0);  // no attribute yet
  for (const char* rel : {"f", "d"}) {
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), 3, {}, &error_)) << error_->description();
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url(rel), &cls, &error_));
    EXPECT_EQ(cls, 3) << rel;
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), -7, {}, &error_));
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url(rel), &cls, &error_));
    EXPECT_EQ(cls, -7) << rel;
  }
}

TEST_F(UsageTest, PredicateSeesTheCurrentClassAndMayDecline) {
  makeFile("f", 10);
  ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url("f"), 4, {}, &error_));
  int32_t seen = -1;
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      url("f"), 2, [&](int32_t current) { return seen = current, false; }, &error_));
  EXPECT_EQ(seen, 4);
  int32_t cls = -1;
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("f"), &cls, &error_));
  EXPECT_EQ(cls, 4);
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url("f"), 2, [](int32_t current) { return current == 4; },
                                                    &error_));
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("f"), &cls, &error_));
  EXPECT_EQ(cls, 2);
  EXPECT_FALSE(error_);
}

TEST_F(UsageTest, WhileLockedClassOneCannotBeSetButOthersCan) {
  std::filesystem::create_directories(base_ + "/run/device");
  std::ofstream(base_ + "/run/device/lockstate") << "1\n";
  platform::setDeviceRoot(base_);
  makeFile("f", 10);
  EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(url("f"), 1, {}, &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->domain(), QRTPOSIXErrorDomain);
  EXPECT_EQ(error_->code(), EPERM);
  EXPECT_EQ(error_->localizedDescription(), "Failed to setclass(1) on file " + path("f") + ": Operation not permitted");
  int32_t cls = -1;
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("f"), &cls, &error_));
  EXPECT_EQ(cls, 0);  // unchanged
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url("f"), 3, {}, &error_));
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("f"), &cls, &error_));
  EXPECT_EQ(cls, 3);
}

TEST_F(UsageTest, SymbolicLinksAndMissingItemsFailToOpen) {
  makeFile("target", 10);
  ASSERT_EQ(symlink(path("target").c_str(), path("link").c_str()), 0);
  int32_t cls = 99;
  EXPECT_FALSE(fm_.dataProtectionClassOfItemAtURL(url("link"), &cls, &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), ELOOP);
  EXPECT_EQ(error_->localizedDescription(), "Failed to open " + path("link") + " : Too many levels of symbolic links");
  EXPECT_EQ(cls, 99);
  error_.reset();
  EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(url("link"), 3, {}, &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), ELOOP);
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(url("target"), &cls, &error_));
  EXPECT_EQ(cls, 0);  // the target was left alone
  EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(url("missing"), 3, {}, &error_));
  EXPECT_EQ(error_->code(), ENOENT);
}

// --- tree dump -------------------------------------------------------------

TEST_F(UsageTest, DumpLogsEveryItemOnceAndErrorsForMissingRoots) {
  makeFile("c/sub/file", 10);
  ASSERT_EQ(symlink("nowhere", path("c/dangling").c_str()), 0);
  fm_.printDirectoryStructureAtURL(url("c"));
  const std::string log = logText();
  for (const char* rel : {"c", "c/sub", "c/sub/file", "c/dangling"}) {
    const std::string line = "\tOrphaned File: " + path(rel) + "\n";
    const size_t at = log.find(line);
    EXPECT_NE(at, std::string::npos) << rel;
    EXPECT_EQ(log.find(line, at + 1), std::string::npos) << rel << " logged twice";
  }
  fm_.printDirectoryStructureAtURL(url("missing"));
  EXPECT_TRUE(logged("FTS returned error for " + path("missing") + " : No such file or directory"));
}

}  // namespace
