#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

namespace {

using Bytes = std::vector<uint8_t>;

void header(Bytes& b, uint16_t itemType, uint16_t valueType, uint32_t value) {
  uint8_t h[8];
  memcpy(h, &itemType, 2);
  memcpy(h + 2, &valueType, 2);
  memcpy(h + 4, &value, 4);
  b.insert(b.end(), h, h + 8);
}
void data(Bytes& b, const std::string& s, size_t pad) {
  b.insert(b.end(), s.begin(), s.end());
  b.insert(b.end(), pad, 0);
}
void end(Bytes& b) { header(b, 0, 0, 0); }

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
  struct Case {
    const char* name;
    Bytes bytes;
    int expected;
  };
  std::vector<Case> cases;
  auto add = [&](const char* name, int expected, auto build) {
    Bytes b;
    build(b);
    cases.push_back({name, b, expected});
  };
  add("empty", ERANGE, [](Bytes&) {});
  add("half an end marker", ERANGE, [](Bytes& b) { b.assign(4, 0); });
  add("header only", ERANGE, [](Bytes& b) { header(b, 2, 1, 6); });
  add("data cut short", ERANGE, [](Bytes& b) {
    header(b, 2, 1, 6);
    data(b, "abc", 0);
  });
  add("no end marker", ERANGE, [](Bytes& b) {
    header(b, 2, 1, 6);
    data(b, std::string("abcde\0", 6), 2);
  });
  add("end marker cut", ERANGE, [](Bytes& b) {
    header(b, 2, 1, 6);
    data(b, std::string("abcde\0", 6), 2);
    b.insert(b.end(), 4, 0);
  });
  add("length over the end marker", ERANGE, [](Bytes& b) {
    header(b, 2, 1, 16);
    data(b, std::string("abcdefg\0", 8), 0);
    end(b);
  });
  add("length near 4 GiB", ERANGE, [](Bytes& b) {
    header(b, 3, 2, 0xFFFFFFFFu);
    end(b);
  });
  add("inline then cut", ERANGE, [](Bytes& b) { header(b, 1, 0, 7); });
  add("string without NUL", EINVAL, [](Bytes& b) {
    header(b, 2, 1, 3);
    data(b, "abc", 5);
    end(b);
  });
  add("empty string", EINVAL, [](Bytes& b) {
    header(b, 2, 1, 0);
    end(b);
  });
  add("inner NUL", EINVAL, [](Bytes& b) {
    header(b, 2, 1, 4);
    data(b, std::string("a\0b\0", 4), 4);
    end(b);
  });
  add("unknown item type", EINVAL, [](Bytes& b) {
    header(b, 9, 1, 0);
    end(b);
  });
  add("inline read as string", EINVAL, [](Bytes& b) {
    header(b, 1, 1, 5);
    end(b);
  });
  add("valid", 0, [](Bytes& b) {
    header(b, 1, 0, 42);
    header(b, 2, 1, 6);
    data(b, std::string("abcde\0", 6), 2);
    header(b, 3, 2, 0);
    end(b);
    b.insert(b.end(), {1, 2, 3});  // bytes after the end marker are not read
  });
  for (const Case& c : cases) EXPECT_EQ(readAll(c.bytes), c.expected) << c.name;
}

TEST(Packbuff, PackedLayoutAndGrowth) {
  struct Case {
    size_t blockSize;
    size_t expectedBlock;
  };
  for (Case c : {Case{0, 256}, Case{1, 256}, Case{7, 256}, Case{8, 8}}) {
    sb_packbuff* pb = sb_packbuff_new(c.blockSize);
    ASSERT_NE(pb, nullptr);
    EXPECT_EQ(pb->block_size, c.expectedBlock);
    EXPECT_EQ(sb_packbuff_get_size(pb), 8u);
    std::string twenty(20, 'x');
    ASSERT_EQ(sb_packbuff_pack_string(pb, 1, twenty.c_str(), twenty.size()), 0);
    EXPECT_EQ(sb_packbuff_get_size(pb), 8u + 32u);
    EXPECT_GE(pb->bytes_allocated, 40u);
    sb_packbuff_free(pb);
  }

  sb_packbuff* pb = sb_packbuff_new(0);
  ASSERT_EQ(sb_packbuff_pack_string(pb, 7, "hello", 5), 0);
  ASSERT_EQ(sb_packbuff_pack_string(pb, 8, "abcdefgh", 8), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 9, 0xdeadbeef), 0);
  EXPECT_EQ(sb_packbuff_pack_string(pb, 1, "abc", 2), EINVAL);  // no NUL at the length
  Bytes expected;
  header(expected, 2, 7, 6);
  data(expected, std::string("hello\0", 6), 2);
  header(expected, 2, 8, 9);
  data(expected, std::string("abcdefgh\0", 9), 7);
  header(expected, 1, 9, 0xdeadbeef);
  end(expected);
  ASSERT_EQ(sb_packbuff_get_size(pb), expected.size());
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
}

TEST(Packbuff, ReadBackKeysAndCursor) {
  sb_packbuff* out = sb_packbuff_new(16);
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
