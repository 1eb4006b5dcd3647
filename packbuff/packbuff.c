#include "packbuff/packbuff.h"

#include <assert.h>
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>

/* Lengths above this would overflow the 32-bit size of an item with its pad. */
#define MAX_ITEM_DATA 4294967287ull
#define HEADER_SIZE 8u

typedef struct {
  uint16_t item_type;
  uint16_t value_type;
  uint32_t value;
} item_header;

/* Received buffers carry no alignment promise: headers are copied, never cast. */
static item_header read_header(const uint8_t* at) {
  item_header h;
  memcpy(&h.item_type, at, 2);
  memcpy(&h.value_type, at + 2, 2);
  memcpy(&h.value, at + 4, 4);
  return h;
}

static void write_header(uint8_t* at, uint16_t item_type, uint16_t value_type, uint32_t value) {
  memcpy(at, &item_type, 2);
  memcpy(at + 2, &value_type, 2);
  memcpy(at + 4, &value, 4);
}

static size_t pad_for(uint64_t length) {
  return (length % BYTE_ALIGNMENT) ? BYTE_ALIGNMENT - (length % BYTE_ALIGNMENT) : 0;
}

/* Offset of the cursor when a whole header lies inside the allocation; the
 * cursor of a hostile or emptied object may lie anywhere. */
static bool cursor_offset(const sb_packbuff* pb, size_t* offset) {
  if (!pb || !pb->item_buffer || pb->item < pb->item_buffer) return false;
  size_t off = (size_t)(pb->item - pb->item_buffer);
  if (off > pb->bytes_allocated || pb->bytes_allocated - off < HEADER_SIZE) return false;
  *offset = off;
  return true;
}

static void write_end_marker(uint8_t* at) { memset(at, 0, HEADER_SIZE); }

static int grow(sb_packbuff* pb, size_t needed) {
  if (pb->block_size == 0 || pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE) return ENOTSUP;
  size_t allocated = pb->bytes_allocated + pb->block_size;
  if (allocated < pb->bytes_allocated) return ENOMEM;
  if (needed != 0) {
    size_t rounded = needed + pad_for(needed);
    if (allocated - pb->bytes_used < rounded) {
      if (allocated + rounded < allocated) return ENOMEM;
      allocated += rounded;
    }
  }
  uint8_t* buffer = realloc(pb->item_buffer, allocated);
  if (!buffer) {
    free(pb->item_buffer);
    pb->item_buffer = NULL;
    pb->item = NULL;
    pb->bytes_allocated = pb->bytes_used = pb->bytes_remaining = 0;
    return ENOMEM;
  }
  pb->item_buffer = buffer;
  pb->bytes_allocated = allocated;
  pb->bytes_remaining = allocated - pb->bytes_used;
  pb->item = pb->bytes_used ? buffer + pb->bytes_used - HEADER_SIZE : buffer;
  return 0;
}

sb_packbuff* sb_packbuff_new(size_t block_size) {
  sb_packbuff* pb = calloc(1, sizeof(*pb));
  if (!pb) return NULL;
  pb->block_size = block_size < BYTE_ALIGNMENT ? 256 : block_size;
  pb->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
  if (grow(pb, 0) != 0 || pb->bytes_allocated < HEADER_SIZE) {
    free(pb->item_buffer);
    free(pb);
    return NULL;
  }
  pb->bytes_used = HEADER_SIZE;
  pb->bytes_remaining -= HEADER_SIZE;
  pb->item = pb->item_buffer;
  write_end_marker(pb->item);
  return pb;
}

sb_packbuff* sb_packbuff_new_with_tag(size_t block_size) { return sb_packbuff_new(block_size); }

sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* buffer, size_t size, bool holds_data, size_t dealloc_type) {
  if (!buffer || (!holds_data && size < HEADER_SIZE)) return NULL;
  sb_packbuff* pb = calloc(1, sizeof(*pb));
  if (!pb) return NULL;
  pb->item_buffer = pb->item = buffer;
  pb->bytes_allocated = size;
  pb->dealloc_type = dealloc_type;
  if (holds_data) {
    pb->bytes_used = size;
  } else {
    write_end_marker(pb->item_buffer);
    pb->bytes_used = HEADER_SIZE;
  }
  pb->bytes_remaining = size - pb->bytes_used;
  return pb;
}

sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, size_t size, bool holds_data, size_t dealloc_type) {
  return sb_packbuff_init_with_buffer_and_tag(buffer, size, holds_data, dealloc_type);
}

void sb_packbuff_free(sb_packbuff* pb) {
  if (!pb) return;
  if (pb->dealloc_type == SB_PACKBUFF_DEALLOC_FREE) {
    free(pb->item_buffer);
  } else if (pb->dealloc_type == SB_PACKBUFF_DEALLOC_REGION && pb->item_buffer) {
    if (munmap(pb->item_buffer, pb->bytes_allocated) != 0)
      fprintf(stderr, "munmap() of packbuff region %p (size %zu) failed\n", (void*)pb->item_buffer,
              pb->bytes_allocated);
  }
  free(pb);
}

void* sb_packbuff_get_bytes(const sb_packbuff* pb) { return pb->item_buffer; }
size_t sb_packbuff_get_size(const sb_packbuff* pb) { return pb->bytes_used; }

void sb_packbuff_set_size(sb_packbuff* pb, size_t size) {
  if (size > pb->bytes_allocated) size = pb->bytes_allocated;
  pb->bytes_used = size;
  pb->bytes_remaining = pb->bytes_allocated - size;
}

bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type) {
  size_t off;
  if (!cursor_offset(pb, &off)) return false;
  item_header h = read_header(pb->item_buffer + off);
  if (h.item_type == SB_PACKBUFF_ITEM_END) return false;
  if (value_type) *value_type = h.value_type;
  return true;
}

bool sb_packbuff_at_end(const sb_packbuff* pb) {
  size_t off;
  if (!cursor_offset(pb, &off)) return false;
  static const uint8_t zero[HEADER_SIZE];
  return memcmp(pb->item_buffer + off, zero, HEADER_SIZE) == 0;
}

static int pack_item(sb_packbuff* pb, uint16_t item_type, uint16_t value_type, uint32_t inline_value, const void* data,
                     size_t length) {
  if (!pb || !pb->item_buffer) return EINVAL;
  if (item_type > SB_PACKBUFF_ITEM_BYTES || item_type == SB_PACKBUFF_ITEM_END) return EINVAL;
  if (item_type == SB_PACKBUFF_ITEM_INLINE) {
    assert(length == 0 && "extra_bytes_needed == 0");
  } else {
    assert((data || length == 0) && "additional_bytes != NULL");
    if (!data && length) return EINVAL;
  }
  size_t pad = 0, needed = HEADER_SIZE;
  if (length > 0) {
    pad = pad_for(length);
    if ((uint64_t)length + pad > MAX_ITEM_DATA) return ERANGE;
    needed += length + pad;
  }
  if (needed > pb->bytes_remaining) {
    int rc = grow(pb, needed);
    if (rc) return rc;
  }
  uint8_t* at = pb->item;
  if (item_type == SB_PACKBUFF_ITEM_INLINE) {
    write_header(at, item_type, value_type, inline_value);
  } else {
    write_header(at, item_type, value_type, (uint32_t)length);
    if (length) memcpy(at + HEADER_SIZE, data, length);
    memset(at + HEADER_SIZE + length, 0, pad);
  }
  assert((needed % BYTE_ALIGNMENT) == 0 && "(bytes_to_advance % BYTE_ALIGNMENT) == 0");
  pb->bytes_remaining -= needed;
  pb->bytes_used += needed;
  pb->item = at + needed;
  write_end_marker(pb->item);
  return 0;
}

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value) {
  return pack_item(pb, SB_PACKBUFF_ITEM_INLINE, value_type, value, NULL, 0);
}

int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string, size_t length) {
  if (!string || length == SIZE_MAX || string[length] != '\0') return EINVAL;
  return pack_item(pb, SB_PACKBUFF_ITEM_STRING, value_type, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length) {
  return pack_item(pb, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data, length);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type, const char* key,
                                           uint16_t value_value_type, const char* value) {
  if (!key || !value) return EINVAL;
  int rc = sb_packbuff_pack_string(pb, key_value_type, key, strlen(key));
  if (rc) return rc;
  return sb_packbuff_pack_string(pb, value_value_type, value, strlen(value));
}

/* Reads the item at the cursor as item_type and moves past it. The item
 * must lie wholly inside the buffer and be followed by a whole header:
 * a buffer cut anywhere, or whose lengths point past it, is refused with
 * ERANGE and the cursor stays. */
static int unpack_item(sb_packbuff* pb, uint16_t item_type, uint32_t* value, const uint8_t** data, size_t* length) {
  size_t off;
  if (!cursor_offset(pb, &off)) return ERANGE;
  item_header h = read_header(pb->item_buffer + off);
  if (h.item_type != item_type) return EINVAL;
  uint64_t size = HEADER_SIZE;
  if (item_type == SB_PACKBUFF_ITEM_INLINE) {
    if (!value) return EINVAL;
  } else {
    if (!data || !length) return EINVAL;
    size += (uint64_t)h.value + pad_for(h.value);
  }
  uint64_t next = (uint64_t)off + size;
  if (next >= pb->bytes_allocated || pb->bytes_allocated - next < HEADER_SIZE) return ERANGE;
  if (item_type == SB_PACKBUFF_ITEM_INLINE) {
    *value = h.value;
  } else {
    *data = pb->item_buffer + off + HEADER_SIZE;
    *length = h.value;
  }
  pb->item = pb->item_buffer + next;
  return 0;
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error) {
  uint32_t value = 0;
  int rc = unpack_item(pb, SB_PACKBUFF_ITEM_INLINE, &value, NULL, NULL);
  if (error) *error = rc;
  return rc ? 0 : value;
}

const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error) {
  const uint8_t* data = NULL;
  size_t len = 0;
  uint8_t* saved = pb ? pb->item : NULL;
  int rc = unpack_item(pb, SB_PACKBUFF_ITEM_STRING, NULL, &data, &len);
  /* An inner NUL would cut the identifier a caller reads from it. */
  if (rc == 0 && (len == 0 || data[len - 1] != '\0' || memchr(data, '\0', len - 1))) {
    pb->item = saved;
    rc = EINVAL;
  }
  if (error) *error = rc;
  if (rc) return NULL;
  if (length) *length = len - 1;
  return (const char*)data;
}

const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error) {
  const uint8_t* data = NULL;
  size_t len = 0;
  int rc = unpack_item(pb, SB_PACKBUFF_ITEM_BYTES, NULL, &data, &len);
  if (error) *error = rc;
  if (rc) return NULL;
  if (length) *length = len;
  return data;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key, uint16_t* value_type,
                                             const char** value, size_t* value_length) {
  int rc = 0;
  const char* k = sb_packbuff_unpack_string(pb, NULL, &rc);
  if (rc) return rc;
  uint16_t type = 0;
  if (!sb_packbuff_get_item_value_type(pb, &type)) return ERANGE;
  size_t len = 0;
  const char* v = sb_packbuff_unpack_string(pb, &len, &rc);
  if (rc) return rc;
  if (key) *key = k;
  if (value_type) *value_type = type;
  if (value) *value = v;
  if (value_length) *value_length = len;
  return 0;
}

static const char* dealloc_name(size_t type) {
  switch (type) {
    case SB_PACKBUFF_DEALLOC_NONE: return "None";
    case SB_PACKBUFF_DEALLOC_FREE: return "free";
    case SB_PACKBUFF_DEALLOC_REGION: return "munmap";
    default: return "<Unknown>";
  }
}

static void describe(FILE* out, const sb_packbuff* pb) {
  fprintf(out, "packbuff: %p\n", (const void*)pb);
  if (!pb) return;
  fprintf(out, "  block_size:      %zu\n", pb->block_size);
  fprintf(out, "  dealloc_type:    %s\n", dealloc_name(pb->dealloc_type));
  fprintf(out, "  bytes_allocated: %zu\n", pb->bytes_allocated);
  fprintf(out, "  bytes_used:      %zu\n", pb->bytes_used);
  fprintf(out, "  bytes_remaining: %zu\n", pb->bytes_remaining);
  fprintf(out, "  item_buffer %p, item: %p\n", (void*)pb->item_buffer, (void*)pb->item);
  fprintf(out, "\n");
  if (!pb->item_buffer) return;
  /* Walks only what is in use and in the allocation, whatever the lengths say. */
  size_t limit = pb->bytes_used < pb->bytes_allocated ? pb->bytes_used : pb->bytes_allocated;
  size_t off = 0;
  for (int index = 0;; ++index) {
    if (off > limit || limit - off < HEADER_SIZE) {
      fprintf(out, ">> item pointer exceeds end of buffer. <<\n");
      return;
    }
    const uint8_t* at = pb->item_buffer + off;
    const char* marker = at == pb->item ? "*" : " ";
    item_header h = read_header(at);
    if (h.item_type == SB_PACKBUFF_ITEM_END) {
      fprintf(out, "%s%3d: %p -- END\n", marker, index, (const void*)at);
      return;
    }
    fprintf(out, "%s%3d:%p -- value type %u -- ", marker, index, (const void*)at, h.value_type);
    uint64_t size = HEADER_SIZE;
    unsigned pad = (unsigned)pad_for(h.value);
    switch (h.item_type) {
      case SB_PACKBUFF_ITEM_INLINE: fprintf(out, "inline value: %u\n", h.value); break;
      case SB_PACKBUFF_ITEM_BYTES:
        size += (uint64_t)h.value + pad;
        fprintf(out, "bytes (%p, %u pad bytes, size: %u)\n", (const void*)(at + HEADER_SIZE), pad, h.value);
        break;
      case SB_PACKBUFF_ITEM_STRING: {
        size += (uint64_t)h.value + pad;
        fprintf(out, "string (%p, %u pad bytes, size: %u): \n", (const void*)(at + HEADER_SIZE), pad, h.value);
        size_t room = limit - off - HEADER_SIZE;
        size_t shown = h.value < room ? h.value : room;
        const void* nul = memchr(at + HEADER_SIZE, '\0', shown);
        if (nul) shown = (size_t)((const uint8_t*)nul - (at + HEADER_SIZE));
        fprintf(out, "     `%.*s'\n", (int)shown, (const char*)(at + HEADER_SIZE));
        break;
      }
      default: fprintf(out, "*Unknown item type* %u\n", h.item_type); break;
    }
    if (off + size < off) {
      fprintf(out, ">> item pointer overflow. <<\n");
      return;
    }
    off += (size_t)size;
  }
}

char* sb_packbuff_describe(const sb_packbuff* pb) {
  char* text = NULL;
  size_t length = 0;
  FILE* out = open_memstream(&text, &length);
  if (!out) return NULL;
  describe(out, pb);
  if (fclose(out) != 0) {
    free(text);
    return NULL;
  }
  return text;
}
