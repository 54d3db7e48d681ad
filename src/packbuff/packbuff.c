#include "packbuff/packbuff.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>

#define BYTE_ALIGNMENT 8
#define ITEM_HEADER_SIZE 8
#define END_MARK_SIZE 8
/* Padded payloads stay below this so that a whole item (header + payload) fits in 32 bits. */
#define MAX_PADDED_LENGTH 0xFFFFFFF8u

/* Invariants are programming errors in this file, never the result of input bytes. */
#define PACKBUFF_INVARIANT(condition)                             \
    do {                                                          \
        if (!(condition)) invariant_failed(#condition, __LINE__); \
    } while (0)

static void invariant_failed(const char* condition, int line) {
    fprintf(stderr, "packbuff: invariant violated at line %d: %s\n", line, condition);
    abort();
}

typedef struct {
    uint16_t item_type;
    uint16_t value_type;
    uint32_t value; /* inline value or payload length */
} item_header;

/* The area may sit at any address (caller bytes), so fields go through memcpy. */
static item_header read_header(const uint8_t* at) {
    item_header header;
    memcpy(&header.item_type, at, sizeof header.item_type);
    memcpy(&header.value_type, at + 2, sizeof header.value_type);
    memcpy(&header.value, at + 4, sizeof header.value);
    return header;
}

static void write_header(uint8_t* at, uint16_t item_type, uint16_t value_type, uint32_t value) {
    memcpy(at, &item_type, sizeof item_type);
    memcpy(at + 2, &value_type, sizeof value_type);
    memcpy(at + 4, &value, sizeof value);
}

static uint32_t padding_for(uint32_t length) {
    uint32_t rest = length % BYTE_ALIGNMENT;
    return rest == 0 ? 0 : BYTE_ALIGNMENT - rest;
}

/* Offset of the cursor inside the area. Computed on integers: the cursor may have been set
 * by anyone, and comparing unrelated pointers is undefined. */
static bool cursor_offset(const sb_packbuff_t* packbuff, size_t* offset) {
    if (packbuff->item_buffer == NULL || packbuff->item == NULL) return false;
    uintptr_t start = (uintptr_t)packbuff->item_buffer;
    uintptr_t at = (uintptr_t)packbuff->item;
    if (at < start || at - start >= packbuff->bytes_allocated) return false;
    *offset = (size_t)(at - start);
    return true;
}

static int grow(sb_packbuff_t* packbuff, size_t needed) {
    if (packbuff->dealloc_type != SB_PACKBUFF_DEALLOC_FREE || packbuff->block_size == 0) {
        return SB_PACKBUFF_ENOTSUP;
    }
    /* A size that cannot even be computed cannot be allocated; the area is kept. */
    size_t allocated;
    if (__builtin_add_overflow(packbuff->bytes_allocated, packbuff->block_size, &allocated)) {
        return SB_PACKBUFF_ENOMEM;
    }
    size_t rounded;
    if (__builtin_add_overflow(needed, BYTE_ALIGNMENT - 1, &rounded)) return SB_PACKBUFF_ENOMEM;
    rounded &= ~(size_t)(BYTE_ALIGNMENT - 1);
    /* bytes_used <= bytes_allocated <= allocated: set_size and the constructors keep it. */
    if (rounded > allocated - packbuff->bytes_used &&
        __builtin_add_overflow(allocated, rounded, &allocated)) {
        return SB_PACKBUFF_ENOMEM;
    }

    uint8_t* area = realloc(packbuff->item_buffer, allocated);
    if (area == NULL) {
        /* The items are lost either way; leave an empty, consistent object behind. */
        free(packbuff->item_buffer);
        packbuff->item_buffer = NULL;
        packbuff->item = NULL;
        packbuff->bytes_allocated = 0;
        packbuff->bytes_used = 0;
        packbuff->bytes_remaining = 0;
        return SB_PACKBUFF_ENOMEM;
    }
    packbuff->item_buffer = area;
    packbuff->bytes_allocated = allocated;
    packbuff->bytes_remaining = allocated - packbuff->bytes_used;
    packbuff->item =
        area + (packbuff->bytes_used >= END_MARK_SIZE ? packbuff->bytes_used - END_MARK_SIZE : 0);
    return 0;
}

sb_packbuff_t* sb_packbuff_new_with_tag(size_t block_size, sb_packbuff_tag_t tag) {
    (void)tag; /* see sb_packbuff_tag_t */
    sb_packbuff_t* packbuff = calloc(1, sizeof *packbuff);
    if (packbuff == NULL) return NULL;
    packbuff->block_size =
        block_size < BYTE_ALIGNMENT ? SB_PACKBUFF_DEFAULT_BLOCK_SIZE : block_size;
    packbuff->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
    if (grow(packbuff, 0) != 0) {
        free(packbuff);
        return NULL;
    }
    packbuff->bytes_used = END_MARK_SIZE;
    packbuff->bytes_remaining -= END_MARK_SIZE;
    memset(packbuff->item, 0, END_MARK_SIZE);
    return packbuff;
}

sb_packbuff_t* sb_packbuff_new(size_t block_size) {
    return sb_packbuff_new_with_tag(block_size, 0);
}

sb_packbuff_t* sb_packbuff_init_with_buffer_and_tag(void* bytes, size_t size, bool has_content,
                                                    uint32_t dealloc_type, sb_packbuff_tag_t tag) {
    (void)tag; /* see sb_packbuff_tag_t */
    if (bytes == NULL || dealloc_type > SB_PACKBUFF_DEALLOC_MUNMAP) return NULL;
    if (!has_content && size < END_MARK_SIZE) return NULL;
    sb_packbuff_t* packbuff = calloc(1, sizeof *packbuff);
    if (packbuff == NULL) return NULL;
    packbuff->dealloc_type = dealloc_type;
    packbuff->bytes_allocated = size;
    packbuff->item_buffer = bytes;
    packbuff->item = bytes;
    if (has_content) {
        packbuff->bytes_used = size;
    } else {
        memset(bytes, 0, END_MARK_SIZE);
        packbuff->bytes_used = END_MARK_SIZE;
    }
    packbuff->bytes_remaining = size - packbuff->bytes_used;
    return packbuff;
}

sb_packbuff_t* sb_packbuff_init_with_buffer(void* bytes, size_t size, bool has_content,
                                            uint32_t dealloc_type) {
    return sb_packbuff_init_with_buffer_and_tag(bytes, size, has_content, dealloc_type, 0);
}

void sb_packbuff_free(sb_packbuff_t* packbuff) {
    if (packbuff == NULL) return;
    switch (packbuff->dealloc_type) {
        case SB_PACKBUFF_DEALLOC_MUNMAP:
            if (packbuff->item_buffer != NULL &&
                munmap(packbuff->item_buffer, packbuff->bytes_allocated) != 0) {
                fprintf(stderr, "failed: munmap(%p, %zu)\n", (void*)packbuff->item_buffer,
                        packbuff->bytes_allocated);
            }
            break;
        case SB_PACKBUFF_DEALLOC_FREE:
            free(packbuff->item_buffer);
            break;
        default:
            break;
    }
    free(packbuff);
}

void* sb_packbuff_get_bytes(const sb_packbuff_t* packbuff) {
    return packbuff == NULL ? NULL : packbuff->item_buffer;
}

size_t sb_packbuff_get_size(const sb_packbuff_t* packbuff) {
    return packbuff == NULL ? 0 : packbuff->bytes_used;
}

int sb_packbuff_set_size(sb_packbuff_t* packbuff, size_t used_size) {
    if (packbuff == NULL) return SB_PACKBUFF_EINVAL;
    if (used_size > packbuff->bytes_allocated) return SB_PACKBUFF_ERANGE;
    packbuff->bytes_used = used_size;
    packbuff->bytes_remaining = packbuff->bytes_allocated - used_size;
    return 0;
}

static int sb_packbuff_pack_item(sb_packbuff_t* packbuff, uint16_t item_type, uint16_t value_type,
                                 uint32_t inline_value, const void* additional_bytes,
                                 uint32_t length) {
    if (item_type < SB_PACKBUFF_ITEM_UINT32 || item_type > SB_PACKBUFF_ITEM_BYTES) {
        return SB_PACKBUFF_EINVAL;
    }
    /* After a failed growth the area is gone; there is nothing left to append to. */
    if (packbuff->item_buffer == NULL) return SB_PACKBUFF_ENOMEM;

    uint32_t extra_bytes_needed = padding_for(length);
    uint64_t padded_length = (uint64_t)length + extra_bytes_needed;
    if (padded_length >= MAX_PADDED_LENGTH) return SB_PACKBUFF_ERANGE;
    size_t item_size = (size_t)padded_length + ITEM_HEADER_SIZE;

    if (packbuff->bytes_remaining < item_size) {
        int error = grow(packbuff, item_size);
        if (error != 0) return error;
    }
    /* The counters say there is room; check the bytes themselves as well, since the cursor
     * may have been moved by unpacking or the counters set by the caller. */
    size_t offset;
    if (!cursor_offset(packbuff, &offset)) return SB_PACKBUFF_ERANGE;
    size_t room = packbuff->bytes_allocated - offset;
    if (room < END_MARK_SIZE || room - END_MARK_SIZE < item_size) return SB_PACKBUFF_ERANGE;

    uint8_t* at = packbuff->item;
    if (item_type == SB_PACKBUFF_ITEM_UINT32) {
        PACKBUFF_INVARIANT(extra_bytes_needed == 0);
        write_header(at, item_type, value_type, inline_value);
    } else {
        PACKBUFF_INVARIANT(additional_bytes != NULL);
        write_header(at, item_type, value_type, length);
        memcpy(at + ITEM_HEADER_SIZE, additional_bytes, length);
        memset(at + ITEM_HEADER_SIZE + length, 0, extra_bytes_needed);
    }

    size_t bytes_to_advance = item_size;
    PACKBUFF_INVARIANT((bytes_to_advance % BYTE_ALIGNMENT) == 0);
    packbuff->bytes_remaining -= bytes_to_advance;
    packbuff->bytes_used += bytes_to_advance;
    packbuff->item += bytes_to_advance;
    memset(packbuff->item, 0, END_MARK_SIZE);
    return 0;
}

int sb_packbuff_pack_uint32(sb_packbuff_t* packbuff, uint16_t value_type, uint32_t value) {
    if (packbuff == NULL) return SB_PACKBUFF_EINVAL;
    return sb_packbuff_pack_item(packbuff, SB_PACKBUFF_ITEM_UINT32, value_type, value, NULL, 0);
}

int sb_packbuff_pack_string(sb_packbuff_t* packbuff, uint16_t value_type, const char* string,
                            size_t length) {
    if (packbuff == NULL || string == NULL) return SB_PACKBUFF_EINVAL;
    if (length >= UINT32_MAX || string[length] != '\0') return SB_PACKBUFF_EINVAL;
    return sb_packbuff_pack_item(packbuff, SB_PACKBUFF_ITEM_STRING, value_type, 0, string,
                                 (uint32_t)length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff_t* packbuff, uint16_t value_type, const void* bytes,
                           size_t length) {
    static const uint8_t no_bytes[1];
    if (packbuff == NULL || length > UINT32_MAX) return SB_PACKBUFF_EINVAL;
    if (bytes == NULL) {
        /* An empty container's data pointer is often NULL; that is still an empty item. */
        if (length != 0) return SB_PACKBUFF_EINVAL;
        bytes = no_bytes;
    }
    return sb_packbuff_pack_item(packbuff, SB_PACKBUFF_ITEM_BYTES, value_type, 0, bytes,
                                 (uint32_t)length);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff_t* packbuff, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value) {
    if (key == NULL || value == NULL) return SB_PACKBUFF_EINVAL;
    int error = sb_packbuff_pack_string(packbuff, key_value_type, key, strlen(key));
    if (error != 0) return error;
    return sb_packbuff_pack_string(packbuff, value_value_type, value, strlen(value));
}

/* The item at the cursor as read from the area; `next` is only valid without error. */
typedef struct {
    size_t offset;
    item_header header;
    size_t next;
} item_view;

enum { ANY_ITEM_TYPE = -1 };

/* Locates the item at the cursor and the one after it without moving the cursor. Every
 * check is made against the area, so no byte outside it is read. When only the successor
 * lies outside, `view->header` is filled and SB_PACKBUFF_ERANGE returned. */
static int sb_packbuff_unpack_item(const sb_packbuff_t* packbuff, int expected_type,
                                   item_view* view) {
    size_t offset;
    if (!cursor_offset(packbuff, &offset)) return SB_PACKBUFF_ERANGE;
    size_t available = packbuff->bytes_allocated - offset;
    if (available < ITEM_HEADER_SIZE) return SB_PACKBUFF_ERANGE;

    item_header header = read_header(packbuff->item_buffer + offset);
    uint64_t bytes_to_advance;
    switch (header.item_type) {
        case SB_PACKBUFF_ITEM_UINT32:
            bytes_to_advance = ITEM_HEADER_SIZE;
            break;
        case SB_PACKBUFF_ITEM_STRING:
        case SB_PACKBUFF_ITEM_BYTES:
            /* 64-bit: a length near 2^32 must not wrap to a small step. */
            bytes_to_advance =
                ITEM_HEADER_SIZE + (uint64_t)header.value + padding_for(header.value);
            break;
        default:
            return SB_PACKBUFF_EINVAL;
    }
    if (expected_type != ANY_ITEM_TYPE && header.item_type != expected_type) {
        return SB_PACKBUFF_EINVAL;
    }
    PACKBUFF_INVARIANT((bytes_to_advance % BYTE_ALIGNMENT) == 0);

    view->offset = offset;
    view->header = header;
    /* The next item must start strictly inside the area, which also puts the whole payload
     * inside it. */
    if (bytes_to_advance >= available) return SB_PACKBUFF_ERANGE;
    view->next = offset + (size_t)bytes_to_advance;
    return 0;
}

static void set_error(int* error, int value) {
    if (error != NULL) *error = value;
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff_t* packbuff, int* error) {
    if (packbuff == NULL) {
        set_error(error, SB_PACKBUFF_EINVAL);
        return 0;
    }
    item_view view;
    view.header.item_type = SB_PACKBUFF_ITEM_END;
    int result = sb_packbuff_unpack_item(packbuff, SB_PACKBUFF_ITEM_UINT32, &view);
    set_error(error, result);
    if (result == 0) {
        packbuff->item = packbuff->item_buffer + view.next;
        return view.header.value;
    }
    /* The item itself was readable; only its successor is out of the area. */
    if (result == SB_PACKBUFF_ERANGE && view.header.item_type == SB_PACKBUFF_ITEM_UINT32) {
        return view.header.value;
    }
    return 0;
}

/* Payload of a string or bytes item; the cursor moves only when everything checks out. */
static const uint8_t* unpack_payload(sb_packbuff_t* packbuff, uint16_t item_type, uint32_t* length,
                                     int* error) {
    const uint8_t* payload = NULL;
    uint32_t payload_length = 0;
    int result = SB_PACKBUFF_EINVAL;
    item_view view;
    if (packbuff != NULL) result = sb_packbuff_unpack_item(packbuff, item_type, &view);
    if (result == 0) {
        payload = packbuff->item_buffer + view.offset + ITEM_HEADER_SIZE;
        payload_length = view.header.value;
        if (item_type == SB_PACKBUFF_ITEM_STRING) {
            if (payload_length == 0 || payload[payload_length - 1] != '\0') {
                result = SB_PACKBUFF_EINVAL;
                payload = NULL;
                payload_length = 0;
            } else {
                payload_length -= 1;
            }
        }
    }
    if (result == 0) packbuff->item = packbuff->item_buffer + view.next;
    if (length != NULL) *length = payload_length;
    set_error(error, result);
    return payload;
}

const char* sb_packbuff_unpack_string(sb_packbuff_t* packbuff, uint32_t* length, int* error) {
    return (const char*)unpack_payload(packbuff, SB_PACKBUFF_ITEM_STRING, length, error);
}

const void* sb_packbuff_unpack_bytes(sb_packbuff_t* packbuff, uint32_t* length, int* error) {
    return unpack_payload(packbuff, SB_PACKBUFF_ITEM_BYTES, length, error);
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff_t* packbuff, const char** key,
                                             uint16_t* value_type, const char** value,
                                             uint32_t* value_length) {
    int error;
    const char* key_string = sb_packbuff_unpack_string(packbuff, NULL, &error);
    if (error != 0) return error;
    if (key != NULL) *key = key_string;
    uint16_t next_value_type;
    if (sb_packbuff_get_item_value_type(packbuff, &next_value_type) && value_type != NULL) {
        *value_type = next_value_type;
    }
    uint32_t length;
    const char* value_string = sb_packbuff_unpack_string(packbuff, &length, &error);
    if (error != 0) return error;
    if (value != NULL) *value = value_string;
    if (value_length != NULL) *value_length = length;
    return 0;
}

int sb_packbuff_skip_item(sb_packbuff_t* packbuff) {
    if (packbuff == NULL) return SB_PACKBUFF_EINVAL;
    item_view view;
    int error = sb_packbuff_unpack_item(packbuff, ANY_ITEM_TYPE, &view);
    if (error != 0) return error;
    packbuff->item = packbuff->item_buffer + view.next;
    return 0;
}

bool sb_packbuff_get_item_value_type(const sb_packbuff_t* packbuff, uint16_t* value_type) {
    size_t offset;
    if (packbuff == NULL || !cursor_offset(packbuff, &offset)) return false;
    if (packbuff->bytes_allocated - offset < ITEM_HEADER_SIZE) return false;
    item_header header = read_header(packbuff->item_buffer + offset);
    if (header.item_type == SB_PACKBUFF_ITEM_END) return false;
    if (value_type != NULL) *value_type = header.value_type;
    return true;
}

static const char* dealloc_type_name(uint32_t dealloc_type) {
    switch (dealloc_type) {
        case SB_PACKBUFF_DEALLOC_NONE:
            return "None";
        case SB_PACKBUFF_DEALLOC_FREE:
            return "free()";
        case SB_PACKBUFF_DEALLOC_MUNMAP:
            return "munmap()";
        default:
            return "<Unknown>";
    }
}

void sb_packbuff_print(const sb_packbuff_t* packbuff) {
    printf("packbuff: %p\n", (const void*)packbuff);
    if (packbuff == NULL) return;
    printf("  block_size:      %zu\n", packbuff->block_size);
    printf("  dealloc_type:    %s\n", dealloc_type_name(packbuff->dealloc_type));
    printf("  bytes_allocated: %zu\n", packbuff->bytes_allocated);
    printf("  bytes_used:      %zu\n", packbuff->bytes_used);
    printf("  bytes_remaining: %zu\n", packbuff->bytes_remaining);
    printf("  item_buffer %p, item: %p\n", (void*)packbuff->item_buffer, (void*)packbuff->item);
    printf("\n");

    /* The walk trusts nothing in the items: it is for looking at bad buffers too. */
    const uint8_t* start = packbuff->item_buffer;
    size_t allocated = start == NULL ? 0 : packbuff->bytes_allocated;
    size_t offset = 0;
    for (unsigned index = 0;; index++) {
        if (allocated - offset < ITEM_HEADER_SIZE) {
            printf(">> item pointer exceeds end of buffer. <<\n");
            return;
        }
        const uint8_t* at = start + offset;
        const char* mark = at == packbuff->item ? " " : "";
        item_header header = read_header(at);
        if (header.item_type == SB_PACKBUFF_ITEM_END) {
            printf("%s%3d: %p -- END\n", mark, (int)index, (const void*)at);
            return;
        }
        printf("%s%3d:%p -- value type %u --", mark, (int)index, (const void*)at,
               header.value_type);
        uint32_t pad = padding_for(header.value);
        const uint8_t* payload = at + ITEM_HEADER_SIZE;
        uint64_t bytes_to_advance = ITEM_HEADER_SIZE + (uint64_t)header.value + pad;
        switch (header.item_type) {
            case SB_PACKBUFF_ITEM_UINT32:
                printf("inline value: %u\n", header.value);
                bytes_to_advance = ITEM_HEADER_SIZE;
                break;
            case SB_PACKBUFF_ITEM_STRING: {
                /* Print only what lies inside the area, terminated or not. */
                size_t inside = allocated - offset - ITEM_HEADER_SIZE;
                size_t shown = header.value < inside ? header.value : inside;
                if (shown > INT32_MAX) shown = INT32_MAX;
                printf("string (%p, %u pad bytes, size: %u): \n     `%.*s'\n", (const void*)payload,
                       pad, header.value, (int)shown, (const char*)payload);
                break;
            }
            case SB_PACKBUFF_ITEM_BYTES:
                printf("bytes (%p, %u pad bytes, size: %u)\n", (const void*)payload, pad,
                       header.value);
                break;
            default:
                /* Its size is unknown, so there is no next item to find. */
                printf("*Unknown item type* %u\n", header.item_type);
                return;
        }
        uintptr_t next_address;
        if (__builtin_add_overflow((uintptr_t)at, bytes_to_advance, &next_address)) {
            printf(">> item pointer overflow. <<\n");
            return;
        }
        if (bytes_to_advance >= allocated - offset) {
            printf(">> item pointer exceeds end of buffer. <<\n");
            return;
        }
        offset += (size_t)bytes_to_advance;
    }
}
