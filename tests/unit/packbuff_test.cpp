#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

namespace {

using Bytes = std::vector<uint8_t>;

// One item: its header, then (when given) its data and padding.
Bytes item(uint16_t itemType, uint16_t valueType, uint32_t value, const std::string& s = "", size_t pad = 0) {
  Bytes b(8 + s.size() + pad);
  memcpy(b.data(), &itemType, 2);
  memcpy(b.data() + 2, &valueType, 2);
  memcpy(b.data() + 4, &value, 4);
  if (!s.empty()) memcpy(b.data() + 8, s.data(), s.size());
  return b;
}
const Bytes kEnd(8, 0);
Bytes cat(std::initializer_list<Bytes> parts) {
  Bytes b;
  for (const Bytes& p : parts) b.insert(b.end(), p.begin(), p.end());
  return b;
}

// Reads every item the way the upcall server does (value type 0 inline,
// 1 string, 2 bytes) and answers 0 only when a whole end marker was reached.
int readAll(Bytes bytes, std::vector<std::string>* strings = nullptr) {
  // One byte off alignment: received regions promise none.
  Bytes shifted(bytes.size() + 1);
  if (!bytes.empty()) memcpy(shifted.data() + 1, bytes.data(), bytes.size());
  sb_packbuff* pb = sb_packbuff_init_with_buffer(shifted.data() + 1, bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  if (!pb) return ENOMEM;
  int rc = 0;
  uint16_t type = 0;
  while (rc == 0 && sb_packbuff_get_item_value_type(pb, &type)) {
    if (type == 0) {
      sb_packbuff_unpack_uint32(pb, &rc);
    } else if (type == 1) {
      const char* s = sb_packbuff_unpack_string(pb, nullptr, &rc);
      if (s && strings) strings->push_back(s);
    } else {
      size_t n = 0;
      sb_packbuff_unpack_bytes(pb, &n, &rc);
    }
  }
  if (rc == 0 && !sb_packbuff_at_end(pb)) rc = ERANGE;
  sb_packbuff_free(pb);
  return rc;
}

TEST(Packbuff, HostileBuffersAreRefused) {
  const std::string six("abcde\0", 6);
  const struct {
    const char* name;
    Bytes bytes;
    int expected;
  } cases[] = {
      {"empty", {}, ERANGE},
      {"half an end marker", Bytes(4, 0), ERANGE},
      {"header only", item(2, 1, 6), ERANGE},
      {"data cut short", item(2, 1, 6, "abc"), ERANGE},
      {"no end marker", item(2, 1, 6, six, 2), ERANGE},
      {"end marker cut", cat({item(2, 1, 6, six, 2), Bytes(4, 0)}), ERANGE},
      {"length over the end marker", cat({item(2, 1, 16, std::string("abcdefg\0", 8)), kEnd}), ERANGE},
      {"length near 4 GiB", cat({item(3, 2, 0xFFFFFFFFu), kEnd}), ERANGE},
      {"inline then cut", item(1, 0, 7), ERANGE},
      {"string without NUL", cat({item(2, 1, 3, "abc", 5), kEnd}), EINVAL},
      {"empty string", cat({item(2, 1, 0), kEnd}), EINVAL},
      {"inner NUL", cat({item(2, 1, 4, std::string("a\0b\0", 4), 4), kEnd}), EINVAL},
      {"unknown item type", cat({item(9, 1, 0), kEnd}), EINVAL},
      {"inline read as string", cat({item(1, 1, 5), kEnd}), EINVAL},
      // Bytes after the end marker are not read.
      {"valid", cat({item(1, 0, 42), item(2, 1, 6, six, 2), item(3, 2, 0), kEnd, {1, 2, 3}}), 0},
  };
  for (const auto& c : cases) EXPECT_EQ(readAll(c.bytes), c.expected) << c.name;
}

TEST(Packbuff, PackedLayoutGrowthAndReadBack) {
  sb_packbuff* pb = sb_packbuff_new(8);  // small blocks: each item grows the buffer
  ASSERT_NE(pb, nullptr);
  EXPECT_EQ(sb_packbuff_get_size(pb), 8u);  // the end marker alone
  ASSERT_EQ(sb_packbuff_pack_string(pb, 7, "hello", 5), 0);
  ASSERT_EQ(sb_packbuff_pack_string(pb, 8, "abcdefgh", 8), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 9, 0xdeadbeef), 0);
  EXPECT_EQ(sb_packbuff_pack_string(pb, 1, "abc", 2), EINVAL);  // no NUL at the length
  const Bytes expected = cat({item(2, 7, 6, std::string("hello\0", 6), 2),
                              item(2, 8, 9, std::string("abcdefgh\0", 9), 7), item(1, 9, 0xdeadbeef), kEnd});
  ASSERT_EQ(sb_packbuff_get_size(pb), expected.size());
  EXPECT_GE(pb->bytes_allocated, expected.size());
  EXPECT_EQ(Bytes(static_cast<uint8_t*>(sb_packbuff_get_bytes(pb)),
                  static_cast<uint8_t*>(sb_packbuff_get_bytes(pb)) + expected.size()),
            expected);
  sb_packbuff_free(pb);

  // Caller memory does not grow.
  uint8_t memory[24];
  pb = sb_packbuff_init_with_buffer(memory, sizeof memory, false, SB_PACKBUFF_DEALLOC_NONE);
  EXPECT_EQ(sb_packbuff_pack_uint32(pb, 0, 1), 0);
  EXPECT_EQ(sb_packbuff_pack_uint32(pb, 0, 2), 0);
  EXPECT_EQ(sb_packbuff_pack_uint32(pb, 0, 3), ENOTSUP);
  sb_packbuff_free(pb);

  sb_packbuff* out = sb_packbuff_new(0);  // 0: the default block size
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(out, 3, "group.one", 4, "/g/one"), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(out, 0, 1), 0);
  Bytes copy(static_cast<uint8_t*>(sb_packbuff_get_bytes(out)),
             static_cast<uint8_t*>(sb_packbuff_get_bytes(out)) + sb_packbuff_get_size(out));
  sb_packbuff_free(out);

  sb_packbuff* in = sb_packbuff_init_with_buffer(copy.data(), copy.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  int rc = 0;
  // The wrong item type fails without moving the cursor.
  EXPECT_EQ(sb_packbuff_unpack_uint32(in, &rc), 0u);
  EXPECT_EQ(rc, EINVAL);
  const char *key = nullptr, *value = nullptr;
  uint16_t valueType = 0;
  size_t valueLength = 0;
  ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(in, &key, &valueType, &value, &valueLength), 0);
  EXPECT_STREQ(key, "group.one");
  EXPECT_STREQ(value, "/g/one");
  EXPECT_EQ(valueType, 4);
  EXPECT_EQ(valueLength, 6u);
  EXPECT_EQ(sb_packbuff_unpack_uint32(in, &rc), 1u);
  EXPECT_EQ(rc, 0);
  EXPECT_FALSE(sb_packbuff_get_item_value_type(in, &valueType));
  EXPECT_TRUE(sb_packbuff_at_end(in));

  sb_packbuff_set_size(in, copy.size() - 12);  // cut into the value string
  char* text = sb_packbuff_describe(in);
  std::string printed = text ? text : "";
  free(text);
  EXPECT_NE(printed.find("`group.one'"), std::string::npos) << printed;
  EXPECT_NE(printed.find(">> item pointer exceeds end of buffer. <<"), std::string::npos) << printed;
  sb_packbuff_free(in);
}

}  // namespace
