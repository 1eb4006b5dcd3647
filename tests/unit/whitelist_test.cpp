#include <gtest/gtest.h>

#include <algorithm>

#include "Daemon/store/QRTWhitelist.h"

namespace {

const QRTWhitelist& whitelist() { return QRTWhitelist::sharedWhitelist(); }

TEST(WhitelistTest, EachListAnswersOnlyForItsClass) {
  EXPECT_TRUE(whitelist().containerIdIsWellknown("com.norvane.mapsd", 12));
  EXPECT_FALSE(whitelist().containerIdIsWellknown("com.norvane.mapsd", 13));
  EXPECT_EQ(whitelist().wellknownContainerForId("com.norvane.mapsd", 12), "com.norvane.mapsd");
  EXPECT_EQ(whitelist().wellknownContainerForId("com.norvane.mapsd", 13), std::nullopt);

  EXPECT_TRUE(whitelist().containerIdIsWellknown("systemgroup.com.norvane.assetpacks", 13));
  EXPECT_FALSE(whitelist().containerIdIsWellknown("systemgroup.com.norvane.assetpacks", 12));
  EXPECT_EQ(whitelist().wellknownSystemGroupContainerForId("systemgroup.com.norvane.assetpacks"),
            "systemgroup.com.norvane.assetpacks");
  EXPECT_FALSE(whitelist().systemContainerIdIsWellknown("systemgroup.com.norvane.assetpacks"));
}

TEST(WhitelistTest, OtherClassesAndCaseVariantsAreNeverWellKnown) {
  for (uint64_t containerClass : {0, 2, 7, 14}) {
    EXPECT_FALSE(whitelist().containerIdIsWellknown("com.norvane.mapsd", containerClass)) << containerClass;
    EXPECT_FALSE(whitelist().containerIdIsWellknown("systemgroup.com.norvane.policysets", containerClass));
    EXPECT_EQ(whitelist().wellknownContainerForId("com.norvane.lazyloadd", containerClass), std::nullopt);
  }
  EXPECT_FALSE(whitelist().containerIdIsWellknown("com.norvane.MapsD", 12));
  EXPECT_FALSE(whitelist().systemGroupContainerIdIsWellknown("SystemGroup.com.norvane.assetpacks"));
  EXPECT_FALSE(whitelist().containerIdIsWellknown("", 12));
}

TEST(WhitelistTest, ListsHoldTheFixedIdentifiers) {
  auto system = whitelist().wellknownSystemContainers();
  std::sort(system.begin(), system.end());
  EXPECT_EQ(system, (std::vector<std::string>{"com.norvane.lazyloadd", "com.norvane.mapsd"}));
  auto groups = whitelist().wellknownSystemGroupContainers();
  EXPECT_EQ(groups.size(), 5u);
  for (const std::string& identifier : groups)
    EXPECT_EQ(whitelist().wellknownSystemGroupContainerForId(identifier), identifier);
}

TEST(WhitelistTest, AnInstanceAnswersFromItsOwnMaps) {
  QRTWhitelist custom({{"a.b", "dir.a"}}, {{"systemgroup.x", "dir.x"}});
  EXPECT_EQ(custom.wellknownContainerForId("a.b", 12), "dir.a");
  EXPECT_EQ(custom.wellknownContainerForId("systemgroup.x", 13), "dir.x");
  EXPECT_FALSE(custom.containerIdIsWellknown("com.norvane.mapsd", 12));
}

}  // namespace
