#include <gtest/gtest.h>

#include <cerrno>
#include <iterator>

#include "TempDir.h"
#include "platform/DeviceRoot.h"
#include "platform/SandboxMappings.h"

namespace fs = std::filesystem;

namespace {

class SandboxMappingsTest : public ::testing::Test {
 protected:
  void SetUp() override { platform::setDeviceRoot(root_); }
  void TearDown() override { platform::setDeviceRoot("/"); }

  std::string linkPath(uint32_t user, uint64_t type, const std::string& identifier) const {
    return root_ + "/run/sandbox/mappings/" + std::to_string(user) + "/" + std::to_string(type) + "/" + identifier;
  }
  // Names in an item-type directory, temporary ones included.
  size_t entryCount(uint32_t user, uint64_t type) const {
    return static_cast<size_t>(std::distance(fs::directory_iterator(linkPath(user, type, "")), {}));
  }

  TempDir tmp_{"/tmp/qrt-mappings"};
  const std::string& root_ = tmp_.path();
};

TEST_F(SandboxMappingsTest, SetCreatesOrReplacesALinkToThePath) {
  ASSERT_EQ(platform::sandboxSetStateItem(501, 1, "com.example.app", "/data/one"), 0);
  ASSERT_EQ(platform::sandboxSetStateItem(501, 1, "com.example.app", "/data/two"), 0);
  EXPECT_EQ(fs::read_symlink(linkPath(501, 1, "com.example.app")), "/data/two");
  EXPECT_EQ(platform::sandboxStateItem(501, 1, "com.example.app"), "/data/two");
  EXPECT_EQ(entryCount(501, 1), 1u) << "no leftovers";
  // Users and item types are kept apart.
  EXPECT_FALSE(platform::sandboxStateItem(0, 1, "com.example.app"));
  EXPECT_FALSE(platform::sandboxStateItem(501, 2, "com.example.app"));
}

TEST_F(SandboxMappingsTest, RemoveDeletesAndToleratesAbsence) {
  // Nothing was ever written, not even the directories.
  EXPECT_EQ(platform::sandboxSetStateItem(501, 1, "com.example.app", nullptr), 0);

  ASSERT_EQ(platform::sandboxSetStateItem(501, 2, "group.com.example", "/data/group"), 0);
  ASSERT_EQ(platform::sandboxSetStateItem(501, 2, "group.com.other", "/data/other"), 0);
  EXPECT_EQ(platform::sandboxSetStateItem(501, 2, "group.com.example", nullptr), 0);
  EXPECT_FALSE(fs::exists(fs::symlink_status(linkPath(501, 2, "group.com.example"))));
  EXPECT_FALSE(platform::sandboxStateItem(501, 2, "group.com.example"));
  EXPECT_EQ(platform::sandboxStateItem(501, 2, "group.com.other"), "/data/other");
  EXPECT_EQ(platform::sandboxSetStateItem(501, 2, "group.com.example", nullptr), 0);
}

TEST_F(SandboxMappingsTest, BadIdentifiersAreRefused) {
  for (const std::string& bad : {std::string(), std::string("."), std::string(".."), std::string("a/b"),
                                 std::string("/abs"), std::string("nul\0byte", 8)}) {
    EXPECT_EQ(platform::sandboxSetStateItem(501, 1, bad, "/data/x"), EINVAL) << bad;
    EXPECT_EQ(platform::sandboxSetStateItem(501, 1, bad, nullptr), EINVAL) << bad;
    EXPECT_FALSE(platform::sandboxStateItem(501, 1, bad));
  }
  EXPECT_FALSE(fs::exists(root_ + "/run/sandbox"));
}

TEST_F(SandboxMappingsTest, ADirectoryInTheWayFailsCleanly) {
  fs::create_directories(linkPath(501, 1, "com.example.app") + "/inner");
  EXPECT_NE(platform::sandboxSetStateItem(501, 1, "com.example.app", "/data/one"), 0);
  EXPECT_NE(platform::sandboxSetStateItem(501, 1, "com.example.app", nullptr), 0);
  EXPECT_EQ(entryCount(501, 1), 1u);
}

}  // namespace
