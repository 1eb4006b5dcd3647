#include <gtest/gtest.h>

#include "Daemon/store/QRTWhitelist.h"

namespace {

const QRTWhitelist& whitelist() { return QRTWhitelist::sharedWhitelist(); }

// Each list answers only for its own class, and only for the exact name.
TEST(WhitelistTest, EachListAnswersOnlyForItsClass) {
  const std::tuple<const char*, uint64_t, bool> cases[] = {
      {"com.norvane.mapsd", 12, true},  {"com.norvane.mapsd", 13, false},
      {"systemgroup.com.norvane.assetpacks", 13, true}, {"systemgroup.com.norvane.assetpacks", 12, false},
      {"com.norvane.MapsD", 12, false}, {"", 12, false},
  };
  for (const auto& [identifier, cls, known] : cases) {
    EXPECT_EQ(whitelist().containerIdIsWellknown(identifier, cls), known) << identifier << " " << cls;
    EXPECT_EQ(whitelist().wellknownContainerForId(identifier, cls),
              known ? std::optional<std::string>(identifier) : std::nullopt) << identifier << " " << cls;
  }
  for (uint64_t cls : {0, 2, 7, 14}) {
    EXPECT_FALSE(whitelist().containerIdIsWellknown("com.norvane.mapsd", cls)) << cls;
    EXPECT_FALSE(whitelist().containerIdIsWellknown("systemgroup.com.norvane.policysets", cls)) << cls;
  }
  EXPECT_FALSE(whitelist().systemContainerIdIsWellknown("systemgroup.com.norvane.assetpacks"));
  EXPECT_FALSE(whitelist().systemGroupContainerIdIsWellknown("SystemGroup.com.norvane.assetpacks"));
}

TEST(WhitelistTest, AnInstanceAnswersFromItsOwnMaps) {
  QRTWhitelist custom({{"a.b", "dir.a"}}, {{"systemgroup.x", "dir.x"}});
  EXPECT_EQ(custom.wellknownContainerForId("a.b", 12), "dir.a");
  EXPECT_EQ(custom.wellknownContainerForId("systemgroup.x", 13), "dir.x");
  EXPECT_FALSE(custom.containerIdIsWellknown("com.norvane.mapsd", 12));
}

}  // namespace
