// Treats the input as a pack buffer received from another process and walks it with every
// unpack and skip operation. Reads outside the bytes are left to the address sanitizer;
// the checks here are the promises the upcall service relies on.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "packbuff/packbuff.h"

namespace {

void Check(bool condition) {
    if (!condition) std::abort();
}

bool Inside(const sb_packbuff_t* buffer, const void* pointer, size_t length) {
    auto start = reinterpret_cast<uintptr_t>(buffer->item_buffer);
    auto at = reinterpret_cast<uintptr_t>(pointer);
    return at >= start && at - start <= buffer->bytes_allocated &&
           length <= buffer->bytes_allocated - (at - start);
}

// After an operation: a failed one left the cursor alone, a successful one moved it forward
// by a multiple of 8 and kept it strictly inside the area.
void CheckStep(const sb_packbuff_t* buffer, uint8_t* before, int error) {
    if (error != 0) {
        Check(buffer->item == before);
        return;
    }
    Check(buffer->item > before);
    Check((buffer->item - before) % 8 == 0);
    Check(Inside(buffer, buffer->item, 1));
}

void Walk(uint8_t* bytes, size_t size) {
    sb_packbuff_t* buffer =
        sb_packbuff_init_with_buffer(bytes, size, true, SB_PACKBUFF_DEALLOC_NONE);
    Check(buffer != nullptr);
    sb_packbuff_print(buffer);

    for (;;) {
        uint8_t* position = buffer->item;
        uint16_t value_type = 0;
        (void)sb_packbuff_get_item_value_type(buffer, &value_type);

        int error = -1;
        uint32_t value = sb_packbuff_unpack_uint32(buffer, &error);
        CheckStep(buffer, position, error);
        Check(error == 0 || error == SB_PACKBUFF_EINVAL || error == SB_PACKBUFF_ERANGE);
        if (error != 0 && error != SB_PACKBUFF_ERANGE) Check(value == 0);
        buffer->item = position;

        uint32_t length = 0;
        const char* string = sb_packbuff_unpack_string(buffer, &length, &error);
        CheckStep(buffer, position, error);
        if (error == 0) {
            Check(Inside(buffer, string, size_t{length} + 1));
            Check(string[length] == '\0');
        } else {
            Check(string == nullptr);
        }
        buffer->item = position;

        const void* data = sb_packbuff_unpack_bytes(buffer, &length, &error);
        CheckStep(buffer, position, error);
        if (error == 0) Check(Inside(buffer, data, length));
        buffer->item = position;

        const char* key = nullptr;
        const char* key_value = nullptr;
        uint32_t key_value_length = 0;
        error = sb_packbuff_unpack_key_with_string_value(buffer, &key, &value_type, &key_value,
                                                         &key_value_length);
        if (error == 0) {
            Check(Inside(buffer, key_value, size_t{key_value_length} + 1));
            Check(key_value[key_value_length] == '\0');
        }
        buffer->item = position;

        error = sb_packbuff_skip_item(buffer);
        CheckStep(buffer, position, error);
        if (error != 0) break;
    }
    sb_packbuff_free(buffer);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // The dump is exercised for its walk, not read.
    Check(std::freopen("/dev/null", "w", stdout) != nullptr);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // Both copies end exactly where the input ends; the second starts at an odd address.
    std::unique_ptr<uint8_t[]> aligned(new uint8_t[size]);
    if (size != 0) std::memcpy(aligned.get(), data, size);
    Walk(aligned.get(), size);

    std::unique_ptr<uint8_t[]> odd(new uint8_t[size + 1]);
    if (size != 0) std::memcpy(odd.get() + 1, data, size);
    Walk(odd.get() + 1, size);
    return 0;
}
