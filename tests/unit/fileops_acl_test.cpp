#include <acl/libacl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <unistd.h>

#include <cerrno>
#include <tuple>

#include "Daemon/fileops/QRTFileManager.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"

namespace {

constexpr uid_t kNobody = 4294967294u;
constexpr const char* kMetadataName = ".com.norvane.quarter_kit.metadata.plist";
// The lists every stamped item carries (ids numeric, canonical order); 4242 is systemusers.
const std::string kFullList = "user::---,group::---,group:4242:rwx,mask::rwx,other::---";

void writeFile(const std::string& path, const std::string& content, mode_t mode = 0644) {
  std::ofstream(path) << content;
  ASSERT_EQ(chmod(path.c_str(), mode), 0) << path;
}

// The item's list as text, or "none" when it has none of that type.
std::string aclText(const std::string& path, acl_type_t type = ACL_TYPE_ACCESS) {
  acl_t acl = acl_get_file(path.c_str(), type);
  if (!acl) return "error " + std::to_string(errno);
  std::string result = "none";
  if (acl_entries(acl) > 0) {
    char* text = acl_to_any_text(acl, nullptr, ',', TEXT_NUMERIC_IDS);
    result = text ? text : "error";
    acl_free(text);
  }
  acl_free(acl);
  return result;
}

QRTURL dirURL(const std::string& path) { return QRTURL::fileURL(path, true); }

std::tuple<uid_t, gid_t, mode_t> ownerAndMode(const std::string& path) {
  const struct stat st = lstatOf(path);
  return {st.st_uid, st.st_gid, st.st_mode & 07777};
}

// Each test has a device root of its own: etc/{passwd,group} and
// tree/{meta, a/{b/{file}, tool}, link -> outside}.
class FileManagerACLTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directories(root_ + "/a/b");
    std::filesystem::create_directory(base_ + "/etc");
    writeFile(base_ + "/etc/passwd", "_system:x:499:499::/private/var/empty:/bin/false\n");
    writeGroups(true);
    platform::setDeviceRoot(base_);
    writeFile(root_ + "/a/b/file", "data");
    writeFile(root_ + "/a/tool", "#!/bin/sh\n", 0754);
    writeFile(root_ + "/" + kMetadataName, "meta", 0600);
    writeFile(base_ + "/outside", "outside");
    ASSERT_EQ(symlink((base_ + "/outside").c_str(), (root_ + "/link").c_str()), 0);
  }
  void TearDown() override { platform::setDeviceRoot("/"); }
  // The code of a call that must fail: 0 when it succeeded.
  int64_t codeOf(bool succeeded) const { return succeeded ? 0 : error ? error->code() : -1; }
  void writeGroups(bool withSystemUsers) {
    writeFile(base_ + "/etc/group", withSystemUsers ? "wheel:x:0:\nsystemusers:x:4242:_system\n" : "wheel:x:0:\n");
  }

  TempDir tmp_{"/tmp/qrt_acl_test"};
  std::string base_ = tmp_.path(), root_ = tmp_ / "tree";
  QRTFileManager& fm = QRTFileManager::defaultManager();
  QRTErrorRef error;
};

TEST_F(FileManagerACLTest, StampedTreeGivesTheGroupEverythingAndOthersNothing) {
  ASSERT_TRUE(fm.standardizeACLsAtURL(dirURL(root_), false, &error));
  EXPECT_FALSE(error);
  for (const char* item : {"", "/a", "/a/b", "/a/b/file", "/a/tool"}) {
    std::string path = root_ + item;
    EXPECT_EQ(aclText(path), kFullList) << item;
    const bool directory = S_ISDIR(lstatOf(path).st_mode);
    EXPECT_EQ(aclText(path, ACL_TYPE_DEFAULT), directory ? kFullList : "error 13") << item;
    EXPECT_EQ(ownerAndMode(path), std::tuple(kNobody, kNobody, 0070u)) << item;  // only the mask shows in the mode
  }

  // Items made later inherit the group's entry without the daemon.
  std::string later = root_ + "/a/b/later";
  close(open(later.c_str(), O_CREAT | O_WRONLY, 0600));
  EXPECT_NE(aclText(later).find("group:4242:rwx"), std::string::npos) << aclText(later);
  ASSERT_EQ(mkdir((root_ + "/a/newdir").c_str(), 0777), 0);
  EXPECT_EQ(aclText(root_ + "/a/newdir", ACL_TYPE_DEFAULT), kFullList);
}

TEST_F(FileManagerACLTest, SystemContainerKeepsItsTopOwnerAndLeavesMetadataAndLinksAlone) {
  ASSERT_EQ(chown(root_.c_str(), 499, 499), 0);
  ASSERT_EQ(chmod(root_.c_str(), 0750), 0);
  std::string meta = root_ + "/" + kMetadataName, metaACL = aclText(meta);
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(dirURL(root_), &error));

  EXPECT_EQ(ownerAndMode(root_), std::tuple(499u, 499u, 0770u));
  EXPECT_EQ(aclText(root_), "user::rwx,group::r-x,group:4242:-wx,mask::rwx,other::---");
  EXPECT_EQ(aclText(root_, ACL_TYPE_DEFAULT), kFullList);
  EXPECT_EQ(aclText(root_ + "/a"), kFullList);
  EXPECT_EQ(lstatOf(root_ + "/a/b/file").st_uid, kNobody);

  EXPECT_EQ(ownerAndMode(meta), std::tuple(0u, 0u, 0600u));
  EXPECT_EQ(aclText(meta), metaACL);
  EXPECT_EQ(lstatOf(root_ + "/link").st_uid, 0u);
  EXPECT_EQ(ownerAndMode(base_ + "/outside"), std::tuple(0u, 0u, 0644u));
  EXPECT_EQ(aclText(base_ + "/outside"), "user::rw-,group::r--,other::r--");
}

TEST_F(FileManagerACLTest, TopLevelACLAloneForOneOrEveryContainerAndRefusesMissingItems) {
  ASSERT_EQ(chmod(root_.c_str(), 0700), 0);
  const std::string inner = aclText(root_ + "/a");
  ASSERT_TRUE(fm.setTopLevelSystemContainerACLAtURL(dirURL(root_), nullptr));
  EXPECT_EQ(aclText(root_), "user::rwx,group::---,group:4242:-wx,mask::-wx,other::---");
  EXPECT_EQ(aclText(root_, ACL_TYPE_DEFAULT), kFullList);
  EXPECT_EQ(aclText(root_ + "/a"), inner);  // the top alone

  // Links are refused with the others in the hostile suite.
  EXPECT_EQ(codeOf(fm.setTopLevelSystemContainerACLAtURL(dirURL(base_ + "/missing"), &error)), 63);

  std::string classDir = base_ + "/Data/System";
  std::filesystem::create_directories(classDir + "/one/sub");
  std::filesystem::create_directories(classDir + "/two");
  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(dirURL(classDir), &error));
  for (const char* container : {"/one", "/two"})
    EXPECT_NE(aclText(classDir + container).find("group:4242:-wx"), std::string::npos) << container;
  EXPECT_EQ(aclText(classDir + "/one/sub"), kFullList);
  EXPECT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(dirURL(base_ + "/nothing"), &error));
}

TEST_F(FileManagerACLTest, WithoutTheGroupNothingIsChangedAndOwnershipResetSetsModesByKind) {
  writeGroups(false);
  const auto before = std::tuple(aclText(root_ + "/a/b/file"), ownerAndMode(root_ + "/a/b/file"));
  EXPECT_EQ(codeOf(fm.standardizeACLsAtURL(dirURL(root_), false, &error)), 63);
  EXPECT_EQ(error->domain(), QRTErrorDomain);
  error.reset();
  EXPECT_EQ(codeOf(fm.setTopLevelSystemContainerACLAtURL(dirURL(root_), &error)), 63);
  ASSERT_TRUE(error->underlying());
  EXPECT_EQ(error->underlying()->code(), 63);
  EXPECT_EQ(codeOf(fm.standardizeAllSystemContainerACLsAtURL(dirURL(base_), &error)), 63);

  EXPECT_EQ(std::tuple(aclText(root_ + "/a/b/file"), ownerAndMode(root_ + "/a/b/file")), before);
  EXPECT_EQ(aclText(root_, ACL_TYPE_DEFAULT), "none");

  ASSERT_EQ(chmod((root_ + "/a/b").c_str(), 0700), 0);
  ASSERT_EQ(chmod((root_ + "/a/b/file").c_str(), 0666), 0);
  ASSERT_TRUE(fm.standardizeOwnershipAtURL(dirURL(root_), 501, 502, &error));
  // Directories and executables 0755, other files 0644; the link itself changes hands.
  for (const auto& [item, mode] : {std::pair("/a/b", 0755u), {"/a/tool", 0755u}, {"/a/b/file", 0644u}})
    EXPECT_EQ(ownerAndMode(root_ + item), std::tuple(501u, 502u, mode)) << item;
  for (const char* item : {"", "/a", "/link"}) {
    const struct stat st = lstatOf(root_ + item);
    EXPECT_EQ(std::pair(st.st_uid, st.st_gid), std::pair(501u, 502u)) << item;
  }
  EXPECT_EQ(ownerAndMode(base_ + "/outside"), std::tuple(0u, 0u, 0644u));
  EXPECT_EQ(lstatOf(root_ + "/" + kMetadataName).st_uid, 0u);

  EXPECT_EQ(codeOf(fm.standardizeOwnershipAtURL(dirURL(base_ + "/missing"), 501, 501, &error)), ENOENT);
  EXPECT_EQ(error->domain(), QRTPOSIXErrorDomain);
}

}  // namespace
