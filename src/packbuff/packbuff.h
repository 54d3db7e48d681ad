/*
 * Pack buffer: a flat sequence of typed items exchanged with the kernel sandbox.
 *
 * Wire layout (native byte order). Every item starts on an 8-byte boundary counted from
 * the start of the buffer:
 *
 *   offset 0   uint16  item type (SB_PACKBUFF_ITEM_*)
 *   offset 2   uint16  value type, chosen by the protocol that uses the buffer
 *   offset 4   uint32  inline value (item type 1) or payload length (item types 2 and 3)
 *   offset 8   payload (types 2 and 3; a string's payload includes its zero byte)
 *   then zero padding up to the next multiple of 8.
 *
 * The items are closed by an end mark: 8 zero bytes. An empty buffer is one end mark.
 *
 * Errors are returned as system error numbers with the values of the platform this format
 * comes from (see SB_PACKBUFF_E*); 0 is success. SB_PACKBUFF_ENOTSUP is 45, which is NOT
 * Linux's ENOTSUP, so compare against these constants and never against <errno.h>.
 *
 * Unpacking is safe on bytes from another process: whatever the bytes say, no operation
 * reads or writes outside [item_buffer, item_buffer + bytes_allocated). Unpacked strings
 * and bytes point into the buffer and live as long as its area.
 *
 * A buffer is not synchronised: use it from one thread at a time.
 */
#ifndef TARN_PACKBUFF_PACKBUFF_H
#define TARN_PACKBUFF_PACKBUFF_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

enum {
    SB_PACKBUFF_ENOMEM = 12,  /* the area could not be grown; the buffer has lost its area */
    SB_PACKBUFF_EINVAL = 22,  /* wrong item type, string without zero byte, length too large */
    SB_PACKBUFF_ERANGE = 34,  /* cursor or next item outside the area, padded length too large */
    SB_PACKBUFF_ENOTSUP = 45, /* growth of a buffer without an owned heap area or block size */
};

enum {
    SB_PACKBUFF_ITEM_END = 0,
    SB_PACKBUFF_ITEM_UINT32 = 1,
    SB_PACKBUFF_ITEM_STRING = 2,
    SB_PACKBUFF_ITEM_BYTES = 3,
};

/* How the byte area is released by sb_packbuff_free(). */
enum {
    SB_PACKBUFF_DEALLOC_NONE = 0,   /* the caller owns the bytes */
    SB_PACKBUFF_DEALLOC_FREE = 1,   /* heap area, released with free(); the only kind that grows */
    SB_PACKBUFF_DEALLOC_MUNMAP = 2, /* mapped region of bytes_allocated bytes, munmap() */
};

enum { SB_PACKBUFF_DEFAULT_BLOCK_SIZE = 256 };

/* Allocation type tag of the *_with_tag constructors. The Linux heap does not segregate
 * allocations by type, so the tag is accepted and ignored. */
typedef uint64_t sb_packbuff_tag_t;

typedef struct sb_packbuff {
    uint32_t dealloc_type;  /* SB_PACKBUFF_DEALLOC_* */
    size_t block_size;      /* growth step; 0 means the buffer cannot grow */
    size_t bytes_allocated; /* capacity of the byte area */
    size_t bytes_remaining; /* bytes_allocated - bytes_used */
    size_t bytes_used;      /* bytes of the items plus the 8-byte end mark */
    uint8_t* item_buffer;   /* start of the byte area */
    uint8_t* item;          /* cursor: the end mark while packing, the next item while unpacking */
} sb_packbuff_t;

/* New heap-owned buffer holding only an end mark. A block size below 8 means the default
 * (256). Returns NULL when memory is short. Release with sb_packbuff_free(). */
sb_packbuff_t* sb_packbuff_new_with_tag(size_t block_size, sb_packbuff_tag_t tag);
sb_packbuff_t* sb_packbuff_new(size_t block_size);

/* Buffer over existing bytes. With has_content the `size` bytes are items to unpack
 * (bytes_used = size, cursor at the first item); without, the area is reset to one end
 * mark. dealloc_type says how sb_packbuff_free() releases the bytes: with
 * SB_PACKBUFF_DEALLOC_NONE they stay the caller's and must outlive the buffer. block_size
 * starts at 0, so the buffer cannot grow unless it owns a heap area and the caller sets
 * block_size. Returns NULL when bytes is NULL, the dealloc type is unknown,
 * an empty area has no room for its end mark, or memory is short. */
sb_packbuff_t* sb_packbuff_init_with_buffer_and_tag(void* bytes, size_t size, bool has_content,
                                                    uint32_t dealloc_type, sb_packbuff_tag_t tag);
sb_packbuff_t* sb_packbuff_init_with_buffer(void* bytes, size_t size, bool has_content,
                                            uint32_t dealloc_type);

/* Releases the area as dealloc_type says, then the object. NULL is ignored. */
void sb_packbuff_free(sb_packbuff_t* packbuff);

void* sb_packbuff_get_bytes(const sb_packbuff_t* packbuff);
size_t sb_packbuff_get_size(const sb_packbuff_t* packbuff);

/* Sets bytes_used (after the caller wrote into the area itself). A size beyond
 * bytes_allocated fails with SB_PACKBUFF_ERANGE and changes nothing. */
int sb_packbuff_set_size(sb_packbuff_t* packbuff, size_t used_size);

/* Pack operations append one item at the cursor and move the end mark behind it. On error
 * no item is added; SB_PACKBUFF_ENOMEM with sb_packbuff_get_bytes() == NULL means the
 * area is gone and every later pack fails. */
int sb_packbuff_pack_uint32(sb_packbuff_t* packbuff, uint16_t value_type, uint32_t value);
/* `length` excludes the zero byte, which must stand at string[length]. */
int sb_packbuff_pack_string(sb_packbuff_t* packbuff, uint16_t value_type, const char* string,
                            size_t length);
int sb_packbuff_pack_bytes(sb_packbuff_t* packbuff, uint16_t value_type, const void* bytes,
                           size_t length);
/* Two string items, key then value. On a value error the key item stays packed. */
int sb_packbuff_pack_key_with_string_value(sb_packbuff_t* packbuff, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value);

/* True, with the item's value type, when the cursor is on an item; false on the end mark
 * or when no item header fits at the cursor. */
bool sb_packbuff_get_item_value_type(const sb_packbuff_t* packbuff, uint16_t* value_type);

/* Unpack operations read the item at the cursor and advance past it. *error (when given)
 * is always written, 0 on success. On error the cursor does not move and the result is
 * 0/NULL, except that a uint32 whose successor lies outside the area is still returned,
 * together with SB_PACKBUFF_ERANGE. */
uint32_t sb_packbuff_unpack_uint32(sb_packbuff_t* packbuff, int* error);
/* *length (when given) excludes the zero byte. The characters may hold further zero
 * bytes; the last payload byte is always zero. */
const char* sb_packbuff_unpack_string(sb_packbuff_t* packbuff, uint32_t* length, int* error);
const void* sb_packbuff_unpack_bytes(sb_packbuff_t* packbuff, uint32_t* length, int* error);
/* A key string, then a value string; *value_type is the value item's value type. Returns
 * the first error; after a value error the key has been consumed. */
int sb_packbuff_unpack_key_with_string_value(sb_packbuff_t* packbuff, const char** key,
                                             uint16_t* value_type, const char** value,
                                             uint32_t* value_length);

/* Steps over the item at the cursor. The end mark and unknown item types fail with
 * SB_PACKBUFF_EINVAL. */
int sb_packbuff_skip_item(sb_packbuff_t* packbuff);

/* Diagnostic dump of the object and every item to standard output. */
void sb_packbuff_print(const sb_packbuff_t* packbuff);

#ifdef __cplusplus
}
#endif

#endif /* TARN_PACKBUFF_PACKBUFF_H */
