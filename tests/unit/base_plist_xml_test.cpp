#include <gtest/gtest.h>

#include <cmath>
#include <fstream>
#include <string>

#include "base/PlistCodec.h"

using namespace plist;

namespace {

const char kHeader[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Norvane//DTD PLIST 1.0//EN\" "
    "\"https://dtd.norvane.example/plist-1.0.dtd\">\n"
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

// A signing tool's document (also a seed of the reader's fuzzer).
std::string entitlementsFile() {
  std::ifstream in(QRT_TEST_SOURCE_DIR "/../fuzz/seeds/fuzz_plist_xml/entitlements.plist");
  return std::string(std::istreambuf_iterator<char>(in), {});
}

TEST(PlistXMLTest, ReadsSigningToolDocumentEveryElementTypeAndDecodesTextLikeXML) {
  std::string error;
  auto v = parseText(entitlementsFile(), &error);
  ASSERT_TRUE(v) << error;
  EXPECT_EQ(*v, Value(Dictionary{
                    {"DisplayName", "Notes & Lists"},
                    {"application-groups", Array{"group.com.example.shared", "group.com.example.widgets"}},
                    {"credential-store-groups", Array{}},
                    {"system-program", true},
                    {"shares-files", false},
                    {"limits", Dictionary{{"family", Array{1, 2}},
                                          {"ratio", 0.75},
                                          {"since", Date{614538000}},
                                          {"token", Data{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}}}},
                }));

  const std::pair<std::string, Value> cases[] = {
      {"<string/>", ""},
      {"<string>  keeps\n spaces </string>", "  keeps\n spaces "},
      {"<dict></dict>", Dictionary{}},
      {"<dict><key/><string>empty key</string></dict>", Dictionary{{"", "empty key"}}},
      {"<array></array>", Array{}},
      {"<true></true>", true},
      {"<data></data>", Data{}},
      {"<data>AQI</data>", Data{1, 2}},  // padding optional
      {"<real>-2.5e3</real>", -2500.0},
      {"<real> 1 </real>", 1.0},
      {"<real>+infinity</real>", INFINITY},
      {"<real>-inf</real>", -INFINITY},
      {"<date>1970-01-01T00:00:00Z</date>", Date{-978307200}},
      {"<date>2024-02-29T23:59:59Z</date>", Date{730943999}},
      {"<date>0001-01-01T00:00:00Z</date>", Date{-63113904000}},
      {"<date>2001-01-01T00:00:00.5Z</date>", Date{0.5}},
      // Equality includes the integer's signedness.
      {"<integer>18446744073709551615</integer>", Integer{UINT64_MAX, true}},
      {"<integer>9223372036854775808</integer>", Integer{1ull << 63, true}},
      {"<integer>9223372036854775807</integer>", Integer{INT64_MAX, false}},
      {"<integer>-9223372036854775808</integer>", Integer{1ull << 63, false}},
      {"<integer> -42 </integer>", Integer{uint64_t(-42), false}},
      {"<integer>+7</integer>", Integer{7, false}},
      {"<integer>-0</integer>", Integer{0, false}},
      {"<integer>0x1F</integer>", Integer{31, false}},
      {"<integer>0xFFFFFFFFFFFFFFFF</integer>", Integer{UINT64_MAX, true}},
  };
  for (const auto& [body, value] : cases) EXPECT_EQ(parseBody(body), value) << body;
  EXPECT_TRUE(std::isnan(parseBody("<real>nan</real>")->real()));
  EXPECT_TRUE(parseBody("<date>99999-12-31T23:59:59Z</date>"));  // no range limit
  for (const char* bad :
       {"<real>1.5x</real>", "<real></real>", "<date>2023-02-29T00:00:00Z</date>", "<date>2001-13-01T00:00:00Z</date>",
        "<date>2001-01-01T24:00:00Z</date>", "<date>2001-01-01 00:00:00Z</date>", "<date>2001-01-01T00:00:00</date>",
        "<date>01-01-01T00:00:00Z</date>", "<date></date>"})
    EXPECT_FALSE(parseBody(bad)) << bad;
  for (const char* bad : {"18446744073709551616", "-9223372036854775809", "0x10000000000000000", "", "-", "0x", "1.0",
                          "12a", "1 2", "--1"})
    EXPECT_FALSE(parseBody(std::string("<integer>") + bad + "</integer>")) << bad;

  // Text is decoded as XML decodes it.
  EXPECT_EQ(parseBody("<string>&lt;&gt;&amp;&quot;&apos;</string>"), Value("<>&\"'"));
  EXPECT_EQ(parseBody("<string>&#65;&#x42;&#x1F600;</string>"), Value("AB\xF0\x9F\x98\x80"));
  EXPECT_EQ(parseBody("<string><![CDATA[<b>&amp;</b>]]> after</string>"), Value("<b>&amp;</b> after"));
  EXPECT_EQ(parseBody("<string>a<!-- hidden -->b</string>"), Value("ab"));
  EXPECT_EQ(parseBody("<string>Größe 日本語 🎉</string>"), Value("Größe 日本語 🎉"));
  EXPECT_EQ(parseBody("<dict><key>k&amp;y</key><integer>&#49;</integer></dict>"), Value(Dictionary{{"k&y", Value(1)}}));
  for (const char* bad : {"&#0;", "&#xD800;", "&#x110000;", "&#99999999999;", "&nbsp;", "&#;", "&#xZ;", "&amp", "&"})
    EXPECT_FALSE(parseBody(std::string("<string>") + bad + "</string>")) << bad;
}

TEST(PlistXMLTest, RefusesMalformedAndHostileDocumentsAndEnforcesLimits) {
  const std::string documents[] = {
      "<?xml version=\"1.0\"?><!DOCTYPE plist [<!ENTITY x \"boom\">]><plist><string>&x;</string></plist>",
      "<?xml version=\"1.0\"?><!ENTITY x SYSTEM \"file:///etc/passwd\"><plist><string/></plist>",
      "<!DOCTYPE html><plist><string/></plist>",
      "<dict></dict>",
      "",
      kHeader + std::string("<string>a</string></plist><plist/>"),
  };
  // Each after the usual header, before "</plist>".
  const std::string bodies[] = {
      "<data>AAE*</data>",
      "<data>A===</data>",
      "<data>AA==AA</data>",
      "<string>\xC0\xAF</string>",
      "<string>\xED\xA0\x80</string>",
      "<string>abc\xE2\x82</string>",
      std::string("<string>a\0b</string>", 20),
      "<array><string>x</string>",
      "<array></dict>",
      "<string>a</string><string>b</string>",
      "",
      "<key>a</key>",
      "<dict><key>a</key></dict>",
      "<dict><string>a</string><true/></dict>",
      "<dict><key>a</key><true/><key>a</key><false/></dict>",
      "<array>text<true/></array>",
      "<set><true/></set>",
      "<true>yes</true>",
      "<string>a<b/></string>",
      "<string>a<!-- open</string>",
      "<array attr=oops></array>",
  };
  std::vector<std::string> all(std::begin(documents), std::end(documents));
  for (const std::string& body : bodies) all.push_back(kHeader + body + "</plist>");
  for (const std::string& text : all) {
    std::string error;
    EXPECT_FALSE(parseText(text, &error)) << text;
    EXPECT_FALSE(error.empty()) << text;
  }

  EXPECT_TRUE(parseBody(nested(kMaxDepth)));
  std::string error;
  EXPECT_FALSE(parseBody(nested(kMaxDepth + 1), &error));
  EXPECT_NE(error.find("nesting"), std::string::npos) << error;
  // Far deeper than any stack would allow if the reader recursed per level.
  EXPECT_FALSE(parseBody(nested(100000)));

  // The array itself plus its elements.
  std::string items;
  for (size_t i = 0; i < kMaxObjects - 1; ++i) items += "<true/>";
  auto full = parseBody("<array>" + items + "</array>");
  ASSERT_TRUE(full);
  EXPECT_EQ(full->array().size(), kMaxObjects - 1);
  EXPECT_FALSE(parseBody("<array>" + items + "<true/></array>", &error));
  EXPECT_NE(error.find("too many objects"), std::string::npos) << error;
}

}  // namespace
