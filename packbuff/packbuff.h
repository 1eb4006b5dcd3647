/* The packed buffer of the sandbox exchanges: 8-byte-aligned typed items
 * ended by an all-zero 8-byte marker. One object packs (growable, heap
 * owned) or, over a received buffer, unpacks with every offset checked
 * against the buffer before it is read. */
#ifndef QRT_PACKBUFF_H
#define QRT_PACKBUFF_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define BYTE_ALIGNMENT 8

enum {
  SB_PACKBUFF_ITEM_END = 0,
  SB_PACKBUFF_ITEM_INLINE = 1,
  SB_PACKBUFF_ITEM_STRING = 2,
  SB_PACKBUFF_ITEM_BYTES = 3,
};

enum {
  SB_PACKBUFF_DEALLOC_NONE = 0,
  SB_PACKBUFF_DEALLOC_FREE = 1,
  SB_PACKBUFF_DEALLOC_REGION = 2,
};

typedef struct sb_packbuff {
  size_t dealloc_type;
  size_t block_size;
  size_t bytes_allocated;
  size_t bytes_remaining;
  size_t bytes_used;
  uint8_t* item_buffer;
  uint8_t* item;
} sb_packbuff;

sb_packbuff* sb_packbuff_new(size_t block_size);
sb_packbuff* sb_packbuff_new_with_tag(size_t block_size);
sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* buffer, size_t size, bool holds_data, size_t dealloc_type);
sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, size_t size, bool holds_data, size_t dealloc_type);
void sb_packbuff_free(sb_packbuff* pb);

void* sb_packbuff_get_bytes(const sb_packbuff* pb);
size_t sb_packbuff_get_size(const sb_packbuff* pb);
void sb_packbuff_set_size(sb_packbuff* pb, size_t size);
bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type);
/* The cursor is on a whole, all-zero end marker inside the buffer: a reader
 * that stopped because get_item_value_type answered false checks this, so
 * that a cut buffer is not taken for a finished one. */
bool sb_packbuff_at_end(const sb_packbuff* pb);

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value);
int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string, size_t length);
int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length);
int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type, const char* key,
                                           uint16_t value_value_type, const char* value);

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error);
const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error);
const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error);
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key, uint16_t* value_type,
                                             const char** value, size_t* value_length);

// The buffer's fields and items as text, one line each, for diagnosis; the
// caller frees it. NULL when out of memory.
char* sb_packbuff_describe(const sb_packbuff* pb);

#ifdef __cplusplus
}
#endif

#endif
