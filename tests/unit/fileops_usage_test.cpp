// Disk usage, protection-class get and set, and the tree dump of
// QRTFileManager, on a real ext4 scratch directory.
#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>

#include "Daemon/fileops/QRTFileManager.h"
#include "TempDir.h"
#include "platform/Log.h"

namespace fs = std::filesystem;

namespace {

class UsageTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(mkdir(root_.c_str(), 0755), 0);
    platform::logOpen(tmp_ / "quarterd.log", "usage-test", 7);
  }
  void TearDown() override { platform::logClose(); }

  std::string path(const std::string& rel) const { return root_ + "/" + rel; }
  QRTURL url(const std::string& rel) const { return QRTURL::fileURL(path(rel)); }
  void makeFile(const std::string& rel, size_t size) {
    fs::create_directories(fs::path(path(rel)).parent_path());
    std::ofstream(path(rel)) << std::string(size, 'x');
  }
  uint64_t allocated(const std::string& rel) const { return static_cast<uint64_t>(lstatOf(path(rel)).st_blocks) * 512; }
  std::string logText() const { return fileText(tmp_ / "quarterd.log"); }
  bool logged(const std::string& line) const { return logText().find(line) != std::string::npos; }
  int32_t classOf(const std::string& rel) {
    int32_t cls = -100;
    EXPECT_TRUE(fm_.dataProtectionClassOfItemAtURL(url(rel), &cls, &error_)) << rel;
    return cls;
  }

  TempDir tmp_{"/var/tmp/qrt-usage-test"};
  std::string root_ = tmp_ / "t";
  QRTFileManager& fm_ = QRTFileManager::defaultManager();
  QRTErrorRef error_;
};

// Hard links in every directory, so that the walk's two threads both meet
// the same inode; one twin lies outside the tree.
TEST_F(UsageTest, CountsAllocatedBytesOfEverythingButDirectoriesAndEachInodeOnce) {
  makeFile("c/empty", 0);
  makeFile("c/a/large", 300000);
  makeFile("shared", 20000);
  ASSERT_EQ(symlink(std::string(200, 'y').c_str(), path("c/a/link").c_str()), 0);  // a link with its own block
  ASSERT_EQ(link(path("shared").c_str(), path("c/a/inside").c_str()), 0);
  fs::create_directories(path("c/a/b/hollow/hollower"));
  auto wide = [](int i) { return "c/wide/d" + std::to_string(i % 40) + "/f" + std::to_string(i); };
  for (int i = 0; i < 300; ++i) makeFile(wide(i), 50 * i);
  for (int i = 0; i < 40; ++i)
    ASSERT_EQ(link(path("c/a/large").c_str(), path("c/wide/d" + std::to_string(i) + "/twin").c_str()), 0);
  sync();
  uint64_t expected = allocated("c/a/large") + allocated("c/a/link") + allocated("shared");
  for (int i = 0; i < 300; ++i) expected += allocated(wide(i));
  ASSERT_GT(allocated("c/a/link"), 0u);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);  // nothing remembered between walks
  EXPECT_EQ(fm_.diskUsageForURL(url("c/a/b/hollow")), 0u);
}

TEST_F(UsageTest, RootThatIsNoDirectoryMeasuresZeroAndIsLogged) {
  makeFile("file", 5000);
  for (const char* rel : {"missing", "file"})
    EXPECT_EQ(fm_.diskUsageForURL(url(rel)), 0u) << rel;  // links: hostile suite
  EXPECT_EQ(fm_.diskUsageForURL(QRTURL()), 0u);
}

// An app can nest directories deeper than any path the kernel takes.
TEST_F(UsageTest, ChildDirectoryBeyondPathMaxIsLeftOut) {
  makeFile("c/counted", 4000);
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
  sync();
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), allocated("c/counted"));
  fs::remove_all(path("c"));  // the TempDir's removal would stop at the long path
}

TEST_F(UsageTest, ClassIsSetAndReadOnFilesAndDirectoriesUnlessThePredicateDeclines) {
  makeFile("f", 10);
  fs::create_directories(path("d"));
  EXPECT_EQ(classOf("f"), 0);  // no attribute yet
  for (const char* rel : {"f", "d"}) {
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), -7, {}, &error_)) << error_->description();
    EXPECT_EQ(classOf(rel), -7) << rel;
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), 4, {}, &error_));
    EXPECT_EQ(classOf(rel), 4) << rel;
  }
  int32_t seen = -1;
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      url("f"), 2, [&](int32_t current) { return seen = current, false; }, &error_));
  EXPECT_EQ(seen, 4);
  EXPECT_EQ(classOf("f"), 4);
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      url("f"), 2, [](int32_t current) { return current == 4; }, &error_));
  EXPECT_EQ(classOf("f"), 2);
  EXPECT_FALSE(error_);
  // Links are refused with the others in the hostile suite.
  EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(url("missing"), 3, {}, &error_));
  EXPECT_EQ(error_->code(), ENOENT);
}

TEST_F(UsageTest, DumpLogsEveryItemOnceAndErrorsForMissingRoots) {
  makeFile("c/sub/file", 10);
  ASSERT_EQ(symlink("nowhere", path("c/dangling").c_str()), 0);
  fm_.printDirectoryStructureAtURL(url("c"));
  fm_.printDirectoryStructureAtURL(url("missing"));
  const std::string log = logText();
  for (const char* rel : {"c", "c/sub", "c/sub/file", "c/dangling"}) {
    const std::string line = "\tOrphaned File: " + path(rel) + "\n";
    EXPECT_NE(log.find(line), std::string::npos) << rel;
    EXPECT_EQ(log.find(line), log.rfind(line)) << rel << " logged twice";
  }
  EXPECT_TRUE(logged("FTS returned error for " + path("missing") + " : No such file or directory"));
}

}  // namespace
