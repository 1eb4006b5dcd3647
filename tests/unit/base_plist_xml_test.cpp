#include <gtest/gtest.h>

#include <cmath>
#include <random>
#include <string>

#include "base/PlistCodec.h"

using namespace plist;

namespace {

const char kHeader[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
    "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";

std::optional<Value> parseText(const std::string& text, std::string* error = nullptr) {
  return parseXML(text.data(), text.size(), error);
}

// Wraps one value in the usual header and root element.
std::optional<Value> parseBody(const std::string& body, std::string* error = nullptr) {
  return parseText(kHeader + body + "\n</plist>\n", error);
}

std::string nested(size_t levels) {
  std::string s;
  for (size_t i = 0; i < levels; ++i) s += "<array>";
  for (size_t i = 0; i < levels; ++i) s += "</array>";
  return s;
}

const char kInfoPlist[] = R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//Apple//DTD PLIST 1.0//EN" "http://www.apple.com/DTDs/PropertyList-1.0.dtd">
<plist version="1.0">
<dict>
	<key>CFBundleDisplayName</key>
	<string>Notes &amp; Lists</string>
	<key>CFBundleIdentifier</key>
	<string>com.example.notes</string>
	<key>CFBundleSupportedPlatforms</key>
	<array>
		<string>iPhoneOS</string>
	</array>
	<key>LSRequiresIPhoneOS</key>
	<true/>
	<key>MinimumOSVersion</key>
	<string>12.0</string>
	<key>UIDeviceFamily</key>
	<array>
		<integer>1</integer>
		<integer>2</integer>
	</array>
	<key>UIFileSharingEnabled</key>
	<false/>
</dict>
</plist>
)";

const char kEntitlements[] = R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//Apple//DTD PLIST 1.0//EN" "http://www.apple.com/DTDs/PropertyList-1.0.dtd">
<plist version="1.0">
<dict>
	<!-- written by the signing tool -->
	<key>application-identifier</key>
	<string>ABCDE12345.com.example.notes</string>
	<key>com.apple.security.application-groups</key>
	<array>
		<string>group.com.example.shared</string>
		<string>group.com.example.widgets</string>
	</array>
	<key>keychain-access-groups</key>
	<array/>
	<key>platform-application</key>
	<true/>
	<key>limits</key>
	<dict>
		<key>quota</key>
		<integer>1048576</integer>
		<key>ratio</key>
		<real>0.75</real>
		<key>since</key>
		<date>2020-06-22T17:00:00Z</date>
		<key>token</key>
		<data>
		AAECAwQF
		BgcICQ==
		</data>
	</dict>
</dict>
</plist>
)";

TEST(PlistXMLTest, ReadsAppleStyleDocuments) {
  std::string error;
  auto info = parseText(kInfoPlist, &error);
  ASSERT_TRUE(info) << error;
  const Dictionary& d = info->dictionary();
  EXPECT_EQ(d.size(), 7u);
  EXPECT_EQ(find(d, "CFBundleDisplayName")->string(), "Notes & Lists");
  EXPECT_EQ(*find(d, "CFBundleSupportedPlatforms"), Value(Array{"iPhoneOS"}));
  EXPECT_EQ(*find(d, "UIDeviceFamily"), Value(Array{1, 2}));
  EXPECT_TRUE(find(d, "LSRequiresIPhoneOS")->boolean());
  EXPECT_FALSE(find(d, "UIFileSharingEnabled")->boolean());

  auto ent = parseText(kEntitlements, &error);
  ASSERT_TRUE(ent) << error;
  EXPECT_EQ(*find(ent->dictionary(), "keychain-access-groups"), Value(Array{}));
  EXPECT_EQ(find(ent->dictionary(), "com.apple.security.application-groups")->array().size(), 2u);
  const Dictionary& limits = find(ent->dictionary(), "limits")->dictionary();
  EXPECT_EQ(find(limits, "quota")->integer(), (Integer{1048576, false}));
  EXPECT_EQ(find(limits, "ratio")->real(), 0.75);
  EXPECT_EQ(find(limits, "since")->date().seconds, 614538000.0);
  EXPECT_EQ(find(limits, "token")->data(), (Data{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));

  // The generic entry point picks the XML reader; a BOM and no DOCTYPE are fine.
  std::string bare = "\xEF\xBB\xBF<plist><string>x</string></plist>";
  EXPECT_EQ(parse(bare.data(), bare.size()), Value("x"));
}

TEST(PlistXMLTest, ReadsEveryElementType) {
  EXPECT_EQ(parseBody("<string/>"), Value(""));
  EXPECT_EQ(parseBody("<dict/>"), Value(Dictionary{}));
  EXPECT_EQ(parseBody("<dict></dict>"), Value(Dictionary{}));
  EXPECT_EQ(parseBody("<array></array>"), Value(Array{}));
  EXPECT_EQ(parseBody("<true></true>"), Value(true));
  EXPECT_EQ(parseBody("<data></data>"), Value(Data{}));
  EXPECT_EQ(parseBody("<data>AQI</data>"), Value(Data{1, 2}));  // padding optional
  EXPECT_EQ(parseBody("<dict><key/><string>empty key</string></dict>"),
            Value(Dictionary{{"", Value("empty key")}}));
  EXPECT_EQ(parseBody("<string>  keeps\n spaces </string>"), Value("  keeps\n spaces "));

  EXPECT_EQ(parseBody("<real>-2.5e3</real>")->real(), -2500.0);
  EXPECT_EQ(parseBody("<real> 1 </real>")->real(), 1.0);
  EXPECT_TRUE(std::isnan(parseBody("<real>nan</real>")->real()));
  EXPECT_EQ(parseBody("<real>+infinity</real>")->real(), INFINITY);
  EXPECT_EQ(parseBody("<real>-inf</real>")->real(), -INFINITY);
  EXPECT_FALSE(parseBody("<real>1.5x</real>"));
  EXPECT_FALSE(parseBody("<real></real>"));

  EXPECT_EQ(parseBody("<date>2001-01-01T00:00:00Z</date>")->date().seconds, 0.0);
  EXPECT_EQ(parseBody("<date>1970-01-01T00:00:00Z</date>")->date().seconds, -978307200.0);
  EXPECT_EQ(parseBody("<date>2024-02-29T23:59:59Z</date>")->date().seconds, 730943999.0);
  EXPECT_EQ(parseBody("<date>0001-01-01T00:00:00Z</date>")->date().seconds, -63113904000.0);
  EXPECT_EQ(parseBody("<date>2001-01-01T00:00:00.5Z</date>")->date().seconds, 0.5);
  EXPECT_TRUE(parseBody("<date>99999-12-31T23:59:59Z</date>"));  // no range limit
  for (const char* bad : {"2023-02-29T00:00:00Z", "2001-13-01T00:00:00Z", "2001-01-01T24:00:00Z",
                          "2001-01-01 00:00:00Z", "2001-01-01T00:00:00", "01-01-01T00:00:00Z", ""})
    EXPECT_FALSE(parseBody(std::string("<date>") + bad + "</date>")) << bad;
}

TEST(PlistXMLTest, IntegerRange) {
  auto integer = [](const std::string& text) {
    auto v = parseBody("<integer>" + text + "</integer>");
    return v ? std::optional<Integer>(v->integer()) : std::nullopt;
  };
  EXPECT_EQ(integer("18446744073709551615"), (Integer{UINT64_MAX, true}));
  EXPECT_EQ(integer("9223372036854775808"), (Integer{1ull << 63, true}));
  EXPECT_EQ(integer("9223372036854775807"), (Integer{INT64_MAX, false}));
  EXPECT_EQ(integer("-9223372036854775808")->asSigned(), INT64_MIN);
  EXPECT_FALSE(integer("-9223372036854775808")->isUnsigned);
  EXPECT_EQ(integer(" -42 ")->asSigned(), -42);
  EXPECT_EQ(integer("+7")->asSigned(), 7);
  EXPECT_EQ(integer("-0"), (Integer{0, false}));
  EXPECT_EQ(integer("0x1F")->asSigned(), 31);
  EXPECT_EQ(integer("0xFFFFFFFFFFFFFFFF"), (Integer{UINT64_MAX, true}));
  for (const char* bad : {"18446744073709551616", "-9223372036854775809", "0x10000000000000000", "", "-",
                          "0x", "1.0", "12a", "1 2", "--1"})
    EXPECT_FALSE(integer(bad)) << bad;
}

TEST(PlistXMLTest, DecodesTextLikeXML) {
  EXPECT_EQ(parseBody("<string>&lt;&gt;&amp;&quot;&apos;</string>"), Value("<>&\"'"));
  EXPECT_EQ(parseBody("<string>&#65;&#x42;&#x1F600;</string>"), Value("AB\xF0\x9F\x98\x80"));
  EXPECT_EQ(parseBody("<string><![CDATA[<b>&amp;</b>]]> after</string>"), Value("<b>&amp;</b> after"));
  EXPECT_EQ(parseBody("<string>a<!-- hidden -->b</string>"), Value("ab"));
  EXPECT_EQ(parseBody("<string>Größe 日本語 🎉</string>"), Value("Größe 日本語 🎉"));
  EXPECT_EQ(parseBody("<dict><key>k&amp;y</key><integer>&#49;</integer></dict>"),
            Value(Dictionary{{"k&y", Value(1)}}));
  for (const char* bad : {"&#0;", "&#xD800;", "&#x110000;", "&#99999999999;", "&nbsp;", "&#;", "&#xZ;",
                          "&amp", "&"})
    EXPECT_FALSE(parseBody(std::string("<string>") + bad + "</string>")) << bad;
}

TEST(PlistXMLTest, RefusesMalformedAndHostileDocuments) {
  const std::string header = kHeader;
  const std::pair<std::string, const char*> cases[] = {
      {"<?xml version=\"1.0\"?><!DOCTYPE plist [<!ENTITY x \"boom\">]><plist><string>&x;</string></plist>",
       "internal subset"},
      {"<?xml version=\"1.0\"?><!ENTITY x SYSTEM \"file:///etc/passwd\"><plist><string/></plist>", "entity"},
      {"<!DOCTYPE html><plist><string/></plist>", "doctype"},
      {header + "<data>AAE*</data></plist>", "bad base64"},
      {header + "<data>A===</data></plist>", "bad padding"},
      {header + "<data>AA==AA</data></plist>", "data after padding"},
      {header + "<string>\xC0\xAF</string></plist>", "overlong UTF-8"},
      {header + "<string>\xED\xA0\x80</string></plist>", "encoded surrogate"},
      {header + "<string>\x80</string></plist>", "stray continuation"},
      {header + "<string>abc\xE2\x82</string></plist>", "truncated UTF-8"},
      {header + std::string("<string>a\0b</string></plist>", 28), "NUL"},
      {header + "<array><string>x</string>", "unclosed array"},
      {header + "<string>x</plist>", "unclosed string"},
      {header + "<array></dict></plist>", "mismatched end tag"},
      {header + "<string>a</string><string>b</string></plist>", "two values"},
      {header + "</plist>", "empty plist"},
      {header + "<string>a</string></plist><plist/>", "trailing content"},
      {"<dict></dict>", "not a plist root"},
      {header + "<key>a</key></plist>", "key outside dict"},
      {header + "<dict><key>a</key></dict></plist>", "key without value"},
      {header + "<dict><string>a</string><true/></dict></plist>", "value without key"},
      {header + "<dict><key>a</key><true/><key>a</key><false/></dict></plist>", "duplicate key"},
      {header + "<array>text<true/></array></plist>", "text in array"},
      {header + "<set><true/></set></plist>", "unknown element"},
      {header + "<true>yes</true></plist>", "content in true"},
      {header + "<string>a<b/></string></plist>", "element inside string"},
      {header + "<string>a<!-- open</string></plist>", "unterminated comment"},
      {header + "<array attr=oops></array></plist>", "bad attribute"},
      {"", "empty document"},
  };
  for (const auto& [text, why] : cases) {
    std::string error;
    EXPECT_FALSE(parseText(text, &error)) << why;
    EXPECT_FALSE(error.empty()) << why;
  }
}

TEST(PlistXMLTest, EnforcesNestingAndObjectLimits) {
  EXPECT_TRUE(parseBody(nested(kMaxDepth)));
  std::string error;
  EXPECT_FALSE(parseBody(nested(kMaxDepth + 1), &error));
  EXPECT_NE(error.find("nesting"), std::string::npos) << error;
  // Far deeper than any stack would allow if the reader recursed per level.
  EXPECT_FALSE(parseBody(nested(100000)));
  std::string unclosed(100000 * 6, ' ');
  for (size_t i = 0; i < unclosed.size(); i += 6) unclosed.replace(i, 6, "<dict>");
  EXPECT_FALSE(parseBody(unclosed));

  // The array itself plus its elements.
  std::string items;
  for (size_t i = 0; i < kMaxObjects - 1; ++i) items += "<true/>";
  auto full = parseBody("<array>" + items + "</array>");
  ASSERT_TRUE(full);
  EXPECT_EQ(full->array().size(), kMaxObjects - 1);
  EXPECT_FALSE(parseBody("<array>" + items + "<true/></array>", &error));
  EXPECT_NE(error.find("too many objects"), std::string::npos) << error;
}

TEST(PlistXMLTest, RandomMutationsNeverCrash) {
  const std::string sample = kEntitlements;
  std::mt19937 rng(20240611);
  size_t accepted = 0;
  for (int round = 0; round < 20000; ++round) {
    std::string text = sample;
    const int edits = 1 + static_cast<int>(rng() % 4);
    for (int e = 0; e < edits && !text.empty(); ++e) {
      size_t at = rng() % text.size();
      switch (rng() % 4) {
        case 0: text[at] = static_cast<char>(rng()); break;
        case 1: text.erase(at, 1 + rng() % 16); break;
        case 2: text.insert(at, 1, "<>&/;![]\"x0"[rng() % 11]); break;
        case 3: text.insert(at, text.substr(rng() % text.size(), rng() % 64)); break;
      }
    }
    std::string error;
    auto v = parseText(text, &error);
    if (v) ++accepted;
    else EXPECT_FALSE(error.empty());
  }
  EXPECT_GT(accepted, 0u);  // the mutations also reach the success paths
}

}  // namespace
