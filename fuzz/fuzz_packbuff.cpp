// Arbitrary bytes as a received packed buffer: read item by item the way the
// upcall server does, and printed. Every read must stay inside the buffer.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "packbuff/packbuff.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // The printer writes to standard output.
  if (!freopen("/dev/null", "w", stdout)) abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // An exact-size heap copy, so that ASan sees any byte read past the end.
  std::vector<uint8_t> copy(data, data + size);
  uint8_t* bytes = copy.empty() ? reinterpret_cast<uint8_t*>(&copy) : copy.data();
  sb_packbuff* pb = sb_packbuff_init_with_buffer(bytes, size, true, SB_PACKBUFF_DEALLOC_NONE);
  if (!pb) return 0;
  free(sb_packbuff_describe(pb));
  uint16_t type = 0;
  int rc = 0;
  while (rc == 0 && sb_packbuff_get_item_value_type(pb, &type)) {
    uint8_t* before = pb->item;
    switch (type % 4) {
      case 0: sb_packbuff_unpack_uint32(pb, &rc); break;
      case 1: {
        size_t length = 0;
        const char* s = sb_packbuff_unpack_string(pb, &length, &rc);
        if (s && strlen(s) != length) abort();
        break;
      }
      case 2: {
        size_t length = 0;
        const uint8_t* b = static_cast<const uint8_t*>(sb_packbuff_unpack_bytes(pb, &length, &rc));
        if (b && (b < bytes || b + length > bytes + size)) abort();
        break;
      }
      default: {
        const char *key = nullptr, *value = nullptr;
        uint16_t valueType = 0;
        size_t valueLength = 0;
        rc = sb_packbuff_unpack_key_with_string_value(pb, &key, &valueType, &value, &valueLength);
        break;
      }
    }
    // A read either moves forward by whole items or fails.
    if (rc == 0 && (pb->item <= before || (pb->item - before) % 8 != 0)) abort();
  }
  sb_packbuff_at_end(pb);
  sb_packbuff_free(pb);
  return 0;
}
