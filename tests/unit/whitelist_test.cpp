#include <gtest/gtest.h>

#include "Daemon/store/QRTWhitelist.h"

namespace {

// Each list answers only for its own class, and only for the exact name.
TEST(WhitelistTest, EachListAnswersOnlyForItsClassAndTheExactName) {
  QRTWhitelist lists({{"a.b", "dir.a"}}, {{"systemgroup.x", "dir.x"}});
  const std::tuple<const char*, uint64_t, const char*> cases[] = {
      {"a.b", 12, "dir.a"},
      {"a.b", 13, nullptr},
      {"systemgroup.x", 13, "dir.x"},
      {"systemgroup.x", 12, nullptr},
      {"A.b", 12, nullptr},
      {"", 12, nullptr},
      {"a.b", 2, nullptr},
      {"systemgroup.x", 14, nullptr},
      {"SystemGroup.x", 13, nullptr},
  };
  for (const auto& [identifier, cls, directory] : cases) {
    EXPECT_EQ(lists.containerIdIsWellknown(identifier, cls), directory != nullptr) << identifier << " " << cls;
    EXPECT_EQ(lists.wellknownContainerForId(identifier, cls),
              directory ? std::optional<std::string>(directory) : std::nullopt)
        << identifier << " " << cls;
  }
  EXPECT_FALSE(lists.systemContainerIdIsWellknown("systemgroup.x"));
  EXPECT_FALSE(lists.systemGroupContainerIdIsWellknown("a.b"));
  // The shared instance carries the shipped lists.
  EXPECT_TRUE(QRTWhitelist::sharedWhitelist().containerIdIsWellknown("com.norvane.mapsd", 12));
}

}  // namespace
