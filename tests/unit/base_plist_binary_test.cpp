#include <gtest/gtest.h>

#include <fstream>
#include <numeric>

#include "base/PlistCodec.h"

namespace {

using plist::Array;
using plist::Data;
using plist::Date;
using plist::Dictionary;
using plist::Integer;
using plist::Value;

// Written by Python's plistlib (FMT_BINARY, sorted keys), another writer of the format:
// { d = 2020-05-17 12:34:56; f = false; t = true; u = <00..0f>; r = ( 0.5, -1.25e300 );
//   i = ( 0, 255, 256, 65536, 2^32, 2^63-1, -1, -2^63, 2^64-1 );
//   s = ( "", h\u00e9llo, "\U0001F600 astral", "fifteen letters" );
//   n = { a = S; b = ( S, { k = S; } ); e = { }; }; } where S = ( 1, 2, x ) is written once
// (fuzz/seeds/fuzz_plist_binary/foreign, also a seed of the round-trip fuzzer)
Data foreignFile() {
  std::ifstream in(QRT_TEST_SOURCE_DIR "/../fuzz/seeds/fuzz_plist_binary/foreign", std::ios::binary);
  return Data(std::istreambuf_iterator<char>(in), {});
}

std::optional<Value> parseData(const Data& bytes, std::string* error = nullptr) {
  return plist::parseBinary(bytes.data(), bytes.size(), error);
}

std::string refusal(const Data& bytes) {
  std::string error;
  auto v = parseData(bytes, &error);
  EXPECT_FALSE(v) << plist::describe(*v);
  EXPECT_FALSE(error.empty());
  return error;
}

void putBE(Data& out, uint64_t v, size_t width) {
  for (size_t i = width; i-- > 0;) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

// A binary plist around hand-made object encodings (references inside them
// already encoded with `refSize` bytes).
Data assemble(const std::vector<Data>& objects, uint8_t refSize = 1) {
  Data out = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint64_t> offsets;
  for (const Data& o : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), o.begin(), o.end());
  }
  const uint64_t table = out.size();
  const uint8_t offsetSize = table < 0x100 ? 1 : table < 0x10000 ? 2 : 4;
  for (uint64_t offset : offsets) putBE(out, offset, offsetSize);
  out.insert(out.end(), 6, 0);
  out.push_back(offsetSize);
  out.push_back(refSize);
  putBE(out, objects.size(), 8);
  putBE(out, 0, 8);
  putBE(out, table, 8);
  return out;
}

// An array object of `count` one-byte references to `ref`.
Data arrayOf(size_t count, uint8_t ref) {
  Data a{0xAF, 0x11, static_cast<uint8_t>(count >> 8), static_cast<uint8_t>(count)};
  a.insert(a.end(), count, ref);
  return a;
}

struct Trailer {
  uint8_t offsetSize, refSize;
  uint64_t objects;
};
Trailer trailerOf(const Data& d) {
  const uint8_t* t = d.data() + d.size() - 32;
  uint64_t count = 0;
  for (int i = 8; i < 16; ++i) count = (count << 8) | t[i];
  return {t[6], t[7], count};
}

TEST(PlistBinaryForeign, ReadsAnotherWritersFileExactly) {
  std::string error;
  auto v = parseData(foreignFile(), &error);
  ASSERT_TRUE(v) << error;
  Data uuid(16);
  std::iota(uuid.begin(), uuid.end(), 0);
  const Value shared(Array{1, 2, "x"});
  const Value expected(Dictionary{
      {"d", Date{611411696}},
      {"f", false},
      {"t", true},
      {"u", uuid},
      {"r", Array{0.5, -1.25e300}},
      {"i", Array{0, 255, 256, 65536, int64_t{1} << 32, INT64_MAX, -1, INT64_MIN, UINT64_MAX}},
      {"s", Array{"", "h\xc3\xa9llo", "\xf0\x9f\x98\x80 astral", "fifteen letters"}},
      {"n", Dictionary{{"a", shared}, {"b", Array{shared, Dictionary{{"k", shared}}}}, {"e", Dictionary{}}}},
  });
  // Equality includes each integer's signedness and data staying data.
  EXPECT_EQ(*v, expected);
}

TEST(PlistBinaryEncodings, WriterUsesTheSmallestAndUniquesValuesReaderAcceptsOthers) {
  auto objectBytes = [](const Value& v) {
    Data d = plist::writeBinary(v);
    return Data(d.begin() + 8, d.end() - 32 - trailerOf(d).offsetSize);
  };
  EXPECT_EQ(objectBytes(Value(200)), (Data{0x10, 200}));
  EXPECT_EQ(objectBytes(Value(0x1234)), (Data{0x11, 0x12, 0x34}));
  EXPECT_EQ(objectBytes(Value(0x12345678)), (Data{0x12, 0x12, 0x34, 0x56, 0x78}));
  EXPECT_EQ(objectBytes(Value(-2)), (Data{0x13, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xfe}));
  Data umax{0x14};
  umax.resize(9, 0x00), umax.resize(17, 0xff);
  EXPECT_EQ(objectBytes(Value(UINT64_MAX)), umax);
  // The format cannot mark a small value unsigned; malformed UTF-8 is replaced, not fatal.
  EXPECT_EQ(objectBytes(Value(Integer{7, true})), (Data{0x10, 7}));
  EXPECT_EQ(objectBytes(Value(std::string("a\xff\xc3", 3))), (Data{0x63, 0, 'a', 0xff, 0xfd, 0xff, 0xfd}));

  Trailer t = trailerOf(plist::writeBinary(Value(Array{"k", "k", Dictionary{{"k", "k"}}, true, true})));
  EXPECT_EQ(t.objects, 4u);  // top array, "k", the dictionary, true
  EXPECT_EQ(t.refSize, 1);
  EXPECT_EQ(t.offsetSize, 1);
  Array big(300);
  for (int i = 0; i < 300; ++i) big[i] = Value(i);
  t = trailerOf(plist::writeBinary(Value(big)));
  EXPECT_EQ(t.refSize, 2);
  EXPECT_EQ(t.offsetSize, 2);

  // A 4-byte real, a negative value as a 16-byte integer, and a UTF-16 key.
  Data negative{0x14};
  negative.resize(16, 0xff), negative.push_back(0xfd);
  auto v =
      parseData(assemble({{0xD2, 1, 2, 3, 4}, {0x61, 0x00, 0x66}, {0x51, 'g'}, {0x22, 0x3f, 0xc0, 0, 0}, negative}));
  ASSERT_TRUE(v);
  EXPECT_EQ(*v, Value(Dictionary{{"f", 1.5}, {"g", Value(-3)}}));
}

TEST(PlistBinaryReader, BoundsExpansionOfSharedReferencesAndNesting) {
  // Five levels of 50 references to the level below: ~320 bytes that would
  // expand to 50^5 objects.
  std::vector<Data> levels;
  for (uint8_t i = 1; i <= 5; ++i) levels.push_back(arrayOf(50, i));
  levels.push_back({0x51, 'x'});
  const Data bomb = assemble(levels);
  EXPECT_LT(bomb.size(), 340u);
  EXPECT_EQ(refusal(bomb), "too many objects");

  // 1 + 1000 * (1 + n) objects: every reference counts.
  auto wide = [](size_t n) { return assemble({arrayOf(1000, 1), arrayOf(n, 2), {0x51, 's'}}); };
  auto fits = parseData(wide(998));
  ASSERT_TRUE(fits);
  EXPECT_EQ(fits->array().size(), 1000u);
  EXPECT_EQ(fits->array()[999].array().size(), 998u);
  EXPECT_EQ(refusal(wide(999)), "too many objects");

  // 700,000 references to 100 bytes of data: few objects, 70 MB of data.
  Data blob{0x4F, 0x10, 100};
  blob.insert(blob.end(), 100, 0x55);
  EXPECT_EQ(refusal(assemble({arrayOf(1000, 1), arrayOf(700, 2), blob})), "too much data");

  // Under 4 KiB that would build 990,000 strings of 64 bytes: within the
  // object limit and under 64 MB of characters, yet over 100 MiB in memory.
  Data text{0x5F, 0x10, 64};
  text.insert(text.end(), 64, 'q');
  const Data small = assemble({arrayOf(1000, 1), arrayOf(990, 2), text});
  EXPECT_LT(small.size(), 4096u);
  EXPECT_EQ(refusal(small), "too much data");
  uint64_t footprint = 0;
  auto built = plist::parseBinary(wide(998).data(), wide(998).size(), nullptr, &footprint);
  ASSERT_TRUE(built);
  EXPECT_GE(footprint, 999'001u * sizeof(Value));
  EXPECT_LE(footprint, plist::kMaxFootprint);

  auto nested = [](size_t levels) {
    std::vector<Data> objects;
    for (size_t i = 0; i < levels; ++i) {
      objects.push_back({0xA1});
      putBE(objects.back(), i + 1, 4);
    }
    objects.push_back({0x51, 'x'});
    return assemble(objects, 4);
  };
  EXPECT_TRUE(parseData(nested(plist::kMaxDepth)));
  EXPECT_EQ(refusal(nested(plist::kMaxDepth + 1)), "nesting too deep");
  EXPECT_EQ(refusal(nested(100000)), "nesting too deep");
  // Depth reached through an already visited subtree counts too: the top
  // reaches a chain of 63 arrays directly, then once more through another array.
  std::vector<Data> objects{{0xA2, 2, 1}, {0xA1, 2}};
  for (size_t i = 2; i < plist::kMaxDepth + 1; ++i) objects.push_back({0xA1, static_cast<uint8_t>(i + 1)});
  objects.push_back({0x51, 'x'});
  EXPECT_EQ(refusal(assemble(objects)), "nesting too deep");
}

TEST(PlistBinaryReader, RefusesBadStructureAndUnsupportedOrInvalidObjects) {
  const Data good = assemble({{0xA1, 1}, {0x51, 'x'}});
  ASSERT_TRUE(parseData(good));
  for (size_t n = 0; n < good.size(); ++n) EXPECT_FALSE(plist::parseBinary(good.data(), n)) << n;
  auto patched = [&](size_t fromEnd, uint8_t byte) {
    Data d = good;
    d[d.size() - fromEnd] = byte;
    return d;
  };
  refusal(patched(good.size() - 7, '1'));                               // version
  EXPECT_EQ(refusal(patched(26, 0)), "bad integer sizes in trailer");   // offset size 0
  EXPECT_EQ(refusal(patched(25, 9)), "bad integer sizes in trailer");   // ref size 9
  EXPECT_EQ(refusal(patched(9, 2)), "bad object count in trailer");     // top object 2
  EXPECT_EQ(refusal(patched(1, 0xf0)), "offset table out of range");    // table offset
  EXPECT_EQ(refusal(patched(20, 0x01)), "too many objects");            // 2^24 objects claimed
  EXPECT_EQ(refusal(patched(17, 0x40)), "offset table out of range");   // 64 objects claimed
  EXPECT_EQ(refusal(patched(33, 0xf0)), "object offset out of range");  // second offset
  EXPECT_EQ(refusal(assemble({{0xA1, 7}})), "object reference out of range");
  EXPECT_EQ(refusal(assemble({{0xA1, 0}})), "cyclic reference");
  EXPECT_EQ(refusal(assemble({{0xA1, 1}, {0xD1, 2, 0}, {0x51, 'k'}})), "cyclic reference");
  // Counts larger than the bytes left, before anything is reserved.
  EXPECT_EQ(refusal(assemble({{0x4F, 0x13, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}})), "object out of range");
  EXPECT_EQ(refusal(assemble({{0xAF, 0x12, 0xff, 0xff, 0xff, 0xff, 0}})), "object out of range");
  EXPECT_EQ(refusal(assemble({{0xDF, 0x13, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}})), "object out of range");
  EXPECT_EQ(refusal(assemble({{0x13, 1, 2}})), "object out of range");
  EXPECT_EQ(refusal(assemble({{0x5F, 0x14, 0}})), "bad length marker");

  Data wide{0x14, 0, 0, 0, 0, 0, 0, 0, 1}, onesThenPositive{0x14};
  wide.resize(17, 0), onesThenPositive.resize(9, 0xff), onesThenPositive.resize(17, 0);
  const std::pair<std::vector<Data>, const char*> cases[] = {
      {{{0x00}}, "unsupported object type"},                  // null
      {{{0x80, 1}}, "unsupported object type"},               // UID
      {{{0xC1, 1}, {0x51, 'x'}}, "unsupported object type"},  // set
      {{{0x71, 'x'}}, "unsupported object type"},
      {{{0x15, 1}}, "bad integer size"},
      {{{0x21, 1, 2}}, "bad real size"},
      {{{0x32, 1, 2, 3, 4}}, "bad date"},
      {{wide}, "integer out of range"},
      {{onesThenPositive}, "integer out of range"},
      {{{0x52, 'a', 0x80}}, "non-ASCII byte in ASCII string"},
      {{{0x61, 0xd8, 0x3d}}, "invalid UTF-16 string"},  // lone high surrogate
      {{{0x61, 0xde, 0x00}}, "invalid UTF-16 string"},  // lone low surrogate
      {{{0x62, 0xd8, 0x3d, 0x00, 0x41}}, "invalid UTF-16 string"},
      {{{0x53, 'a', 0, 'b'}}, "NUL in string"},
      {{{0x61, 0, 0}}, "NUL in string"},
      {{{0xD1, 1, 2}, {0x52, 'k', 0}, {0x10, 1}}, "NUL in string"},  // a key
      {{{0xD1, 1, 1}, {0x10, 1}}, "dictionary key is not a string"},
      {{{0xD2, 1, 2, 3, 3}, {0x51, 'k'}, {0x61, 0, 'k'}, {0x10, 1}}, "duplicate dictionary key"},
  };
  for (const auto& [objects, error] : cases) EXPECT_EQ(refusal(assemble(objects)), error);
}

TEST(PlistParse, ChoosesFormatByLeadingBytes) {
  const Data binary = plist::writeBinary(Value(Array{1}));
  EXPECT_EQ(plist::parse(binary.data(), binary.size()), Value(Array{1}));
  std::string error;
  EXPECT_FALSE(plist::parse("hello", 5, &error));
  EXPECT_EQ(error, "unknown format");
  EXPECT_FALSE(plist::parse(nullptr, 0, &error));
  EXPECT_EQ(error, "unknown format");
  const std::string xml = "\xef\xbb\xbf \n<plist version=\"1.0\"><string>a</string></plist>";
  EXPECT_EQ(plist::parse(xml.data(), xml.size()), Value("a"));
}

}  // namespace
