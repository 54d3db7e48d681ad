#include "packbuff/packbuff.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <variant>
#include <vector>

namespace {

struct PackBuffDeleter {
    void operator()(sb_packbuff_t* packbuff) const { sb_packbuff_free(packbuff); }
};
using PackBuff = std::unique_ptr<sb_packbuff_t, PackBuffDeleter>;

std::vector<uint8_t> Header(uint16_t item_type, uint16_t value_type, uint32_t value) {
    std::vector<uint8_t> bytes(8);
    std::memcpy(bytes.data(), &item_type, 2);
    std::memcpy(bytes.data() + 2, &value_type, 2);
    std::memcpy(bytes.data() + 4, &value, 4);
    return bytes;
}

std::vector<uint8_t> Concat(std::initializer_list<std::vector<uint8_t>> parts) {
    std::vector<uint8_t> all;
    for (const auto& part : parts) all.insert(all.end(), part.begin(), part.end());
    return all;
}

// Received bytes in a heap block of exactly their size, so that the address sanitizer
// catches any read past them.
struct Received {
    explicit Received(const std::vector<uint8_t>& bytes)
        : size(bytes.size()), data(new uint8_t[bytes.size() + 1]) {
        std::memcpy(data.get(), bytes.data(), bytes.size());
        buffer.reset(
            sb_packbuff_init_with_buffer(data.get(), size, true, SB_PACKBUFF_DEALLOC_NONE));
    }
    size_t size;
    std::unique_ptr<uint8_t[]> data;
    PackBuff buffer;
};

TEST(PackBuffCreate, BlockSizeBelowEightMeansDefault) {
    for (size_t requested : {0u, 7u, 8u}) {
        PackBuff buffer(sb_packbuff_new(requested));
        ASSERT_NE(buffer, nullptr);
        size_t expected = requested < 8 ? 256 : 8;
        EXPECT_EQ(buffer->block_size, expected);
        EXPECT_EQ(buffer->bytes_allocated, expected);
        EXPECT_EQ(buffer->bytes_used, 8u);
        EXPECT_EQ(buffer->bytes_remaining, expected - 8);
        EXPECT_EQ(buffer->item, buffer->item_buffer);
        EXPECT_EQ(std::vector<uint8_t>(buffer->item_buffer, buffer->item_buffer + 8),
                  std::vector<uint8_t>(8, 0));
        EXPECT_FALSE(sb_packbuff_get_item_value_type(buffer.get(), nullptr));
    }
}

TEST(PackBuffPack, StringAbIsOneSixteenByteItem) {
    PackBuff buffer(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 9, "ab", 2), 0);
    EXPECT_EQ(sb_packbuff_get_size(buffer.get()), 24u);
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(buffer.get()));
    std::vector<uint8_t> expected =
        Concat({Header(2, 9, 3), {'a', 'b', 0, 0, 0, 0, 0, 0}, std::vector<uint8_t>(8, 0)});
    EXPECT_EQ(std::vector<uint8_t>(bytes, bytes + 24), expected);
    EXPECT_EQ(buffer->item, buffer->item_buffer + 16);
}

TEST(PackBuffPack, GrowthAddsBlockAndRoundedNeed) {
    PackBuff buffer(sb_packbuff_new(8));
    // 8 + 101 + 3 padding = 112: more than one block, so the need is added too.
    std::string text(100, 'x');
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 1, text.c_str(), text.size()), 0);
    EXPECT_EQ(buffer->bytes_allocated, 8u + 8u + 112u);
    EXPECT_EQ(buffer->bytes_used, 120u);
    EXPECT_EQ(buffer->bytes_remaining, 8u);
    // Fits the last block exactly: no growth.
    ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), 2, 7), 0);
    EXPECT_EQ(buffer->bytes_allocated, 128u);
    ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), 2, 8), 0);
    EXPECT_EQ(buffer->bytes_allocated, 136u);
    EXPECT_EQ(buffer->bytes_remaining, 0u);
}

TEST(PackBuffPack, CallerBytesThatRunOutFailUnchanged) {
    uint8_t storage[32];
    std::memset(storage, 0xAA, sizeof storage);
    PackBuff buffer(
        sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
    ASSERT_NE(buffer, nullptr);
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 1, "abc", 3), 0);
    ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), 2, 5), 0);
    const sb_packbuff_t before = *buffer;
    std::vector<uint8_t> bytes_before(storage, storage + sizeof storage);

    EXPECT_EQ(sb_packbuff_pack_uint32(buffer.get(), 3, 6), SB_PACKBUFF_ENOTSUP);
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 3, "x", 1), SB_PACKBUFF_ENOTSUP);
    EXPECT_EQ(std::memcmp(&before, buffer.get(), sizeof before), 0);
    EXPECT_EQ(std::vector<uint8_t>(storage, storage + sizeof storage), bytes_before);
}

TEST(PackBuffPack, HeapBytesGrowOnlyWithBlockSize) {
    auto* bytes = static_cast<uint8_t*>(std::malloc(16));
    PackBuff buffer(sb_packbuff_init_with_buffer(bytes, 16, false, SB_PACKBUFF_DEALLOC_FREE));
    ASSERT_NE(buffer, nullptr);
    EXPECT_EQ(sb_packbuff_pack_string(buffer.get(), 1, "longer than eight", 17),
              SB_PACKBUFF_ENOTSUP);
    buffer->block_size = 16;
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 1, "longer than eight", 17), 0);
    buffer->item = buffer->item_buffer;
    int error = -1;
    EXPECT_STREQ(sb_packbuff_unpack_string(buffer.get(), nullptr, &error), "longer than eight");
    EXPECT_EQ(error, 0);
}

TEST(PackBuffPack, LengthsNearThe32BitLimit) {
    PackBuff buffer(sb_packbuff_new(0));
    const char small[] = "abc";
    // Rejected before the payload is touched, so a short source is enough.
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, small, 0x100000000ull), SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, small, 0xFFFFFFFFu), SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, small, 0xFFFFFFF8u), SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, small, 0xFFFFFFF1u), SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_pack_string(buffer.get(), 1, small, 0xFFFFFFFFu), SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_pack_string(buffer.get(), 1, small, 2), SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, nullptr, 1), SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_get_size(buffer.get()), 8u);

    // A growth whose size cannot be computed fails and keeps the area.
    buffer->block_size = SIZE_MAX - 4;
    ASSERT_EQ(sb_packbuff_pack_bytes(buffer.get(), 1, small, 3), 0);  // still fits
    buffer->bytes_remaining = 0;
    buffer->bytes_allocated = buffer->bytes_used;
    EXPECT_EQ(sb_packbuff_pack_uint32(buffer.get(), 1, 1), SB_PACKBUFF_ENOMEM);
    EXPECT_NE(sb_packbuff_get_bytes(buffer.get()), nullptr);
    EXPECT_EQ(sb_packbuff_get_size(buffer.get()), 24u);

    // An empty payload behind a null pointer is still an item.
    PackBuff empty(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_bytes(empty.get(), 4, nullptr, 0), 0);
    EXPECT_EQ(sb_packbuff_get_size(empty.get()), 16u);
}

TEST(PackBuffUnpack, WrongTypeFailsAndKeepsCursor) {
    PackBuff buffer(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 1, "ab", 2), 0);
    buffer->item = buffer->item_buffer;
    int error = 0;
    EXPECT_EQ(sb_packbuff_unpack_uint32(buffer.get(), &error), 0u);
    EXPECT_EQ(error, SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_unpack_bytes(buffer.get(), nullptr, &error), nullptr);
    EXPECT_EQ(error, SB_PACKBUFF_EINVAL);
    EXPECT_EQ(buffer->item, buffer->item_buffer);
    uint32_t length = 0;
    EXPECT_STREQ(sb_packbuff_unpack_string(buffer.get(), &length, &error), "ab");
    EXPECT_EQ(length, 2u);
    EXPECT_EQ(error, 0);
    EXPECT_EQ(sb_packbuff_skip_item(buffer.get()), SB_PACKBUFF_EINVAL);  // the end mark
}

TEST(PackBuffUnpack, ItemEndingAtEndOfAreaCannotBeSteppedPast) {
    Received inline_item(Header(1, 3, 77));
    int error = 0;
    EXPECT_EQ(sb_packbuff_unpack_uint32(inline_item.buffer.get(), &error), 77u);
    EXPECT_EQ(error, SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_skip_item(inline_item.buffer.get()), SB_PACKBUFF_ERANGE);
    EXPECT_EQ(inline_item.buffer->item, inline_item.buffer->item_buffer);

    Received string_item(Concat({Header(2, 3, 3), {'a', 'b', 0, 0, 0, 0, 0, 0}}));
    uint32_t length = 9;
    EXPECT_EQ(sb_packbuff_unpack_string(string_item.buffer.get(), &length, &error), nullptr);
    EXPECT_EQ(error, SB_PACKBUFF_ERANGE);
    EXPECT_EQ(length, 0u);
    EXPECT_EQ(string_item.buffer->item, string_item.buffer->item_buffer);
}

TEST(PackBuffUnpack, MalformedItemsStayInsideTheArea) {
    int error = 0;
    // Payload length past the area, and one that would wrap a 32-bit step to 8.
    for (uint32_t length : {9u, 0xFFFFFFF9u, 0xFFFFFFFFu}) {
        Received item(Concat({Header(3, 1, length), std::vector<uint8_t>(16, 0)}));
        EXPECT_EQ(sb_packbuff_unpack_bytes(item.buffer.get(), nullptr, &error), nullptr);
        EXPECT_EQ(error, SB_PACKBUFF_ERANGE) << length;
        EXPECT_EQ(sb_packbuff_skip_item(item.buffer.get()), SB_PACKBUFF_ERANGE);
    }
    // Strings must be non-empty and end in a zero byte.
    Received empty_string(Concat({Header(2, 1, 0), std::vector<uint8_t>(8, 0)}));
    EXPECT_EQ(sb_packbuff_unpack_string(empty_string.buffer.get(), nullptr, &error), nullptr);
    EXPECT_EQ(error, SB_PACKBUFF_EINVAL);
    Received unterminated(Concat({Header(2, 1, 2), {'a', 'b', 0, 0, 0, 0, 0, 0}, Header(0, 0, 0)}));
    EXPECT_EQ(sb_packbuff_unpack_string(unterminated.buffer.get(), nullptr, &error), nullptr);
    EXPECT_EQ(error, SB_PACKBUFF_EINVAL);
    EXPECT_EQ(sb_packbuff_skip_item(unterminated.buffer.get()), 0);  // still a valid item
    // Unknown item types cannot be stepped over.
    Received unknown(Concat({Header(7, 1, 0), Header(0, 0, 0)}));
    uint16_t value_type = 0;
    EXPECT_TRUE(sb_packbuff_get_item_value_type(unknown.buffer.get(), &value_type));
    EXPECT_EQ(sb_packbuff_skip_item(unknown.buffer.get()), SB_PACKBUFF_EINVAL);
    // An area that ends inside the next header: it is neither an item nor readable.
    Received ragged(Concat({Header(1, 1, 5), {1, 0, 2, 0}}));
    EXPECT_EQ(sb_packbuff_unpack_uint32(ragged.buffer.get(), &error), 5u);
    EXPECT_EQ(error, 0);
    EXPECT_FALSE(sb_packbuff_get_item_value_type(ragged.buffer.get(), &value_type));
    EXPECT_EQ(sb_packbuff_unpack_uint32(ragged.buffer.get(), &error), 0u);
    EXPECT_EQ(error, SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_skip_item(ragged.buffer.get()), SB_PACKBUFF_ERANGE);
    // Too short for anything, and a cursor moved outside the area.
    Received tiny({1, 0, 1});
    EXPECT_FALSE(sb_packbuff_get_item_value_type(tiny.buffer.get(), nullptr));
    EXPECT_EQ(sb_packbuff_skip_item(tiny.buffer.get()), SB_PACKBUFF_ERANGE);
    tiny.buffer->item = tiny.buffer->item_buffer + 64;
    EXPECT_EQ(sb_packbuff_skip_item(tiny.buffer.get()), SB_PACKBUFF_ERANGE);
}

TEST(PackBuffUnpack, KeyWithStringValue) {
    PackBuff buffer(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_key_with_string_value(buffer.get(), 3, "group", 4, "/path"), 0);
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 3, "key only", 8), 0);
    ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), 4, 1), 0);
    buffer->item = buffer->item_buffer;

    const char* key = nullptr;
    const char* value = nullptr;
    uint16_t value_type = 0;
    uint32_t value_length = 0;
    ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(buffer.get(), &key, &value_type, &value,
                                                       &value_length),
              0);
    EXPECT_STREQ(key, "group");
    EXPECT_STREQ(value, "/path");
    EXPECT_EQ(value_type, 4u);
    EXPECT_EQ(value_length, 5u);
    // The value is not a string: the key is consumed, the uint32 is not.
    EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(buffer.get(), &key, &value_type, &value,
                                                       &value_length),
              SB_PACKBUFF_EINVAL);
    int error = 0;
    EXPECT_EQ(sb_packbuff_unpack_uint32(buffer.get(), &error), 1u);
    EXPECT_EQ(error, 0);
}

TEST(PackBuffWrap, RejectsWhatCannotBeAnArea) {
    uint8_t storage[8] = {};
    EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 8, true, 0), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(storage, 7, false, 0), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(storage, 8, false, 3), nullptr);
    PackBuff buffer(sb_packbuff_init_with_buffer(storage, 8, false, 0));
    ASSERT_NE(buffer, nullptr);
    EXPECT_EQ(sb_packbuff_set_size(buffer.get(), 9), SB_PACKBUFF_ERANGE);
    EXPECT_EQ(sb_packbuff_get_size(buffer.get()), 8u);
}

TEST(PackBuffRoundTrip, RandomItemSequences) {
    using Item = std::variant<uint32_t, std::string, std::vector<uint8_t>>;
    std::mt19937 random(20240607);
    for (size_t block_size : {0u, 8u, 24u, 4096u}) {
        for (int round = 0; round < 50; round++) {
            std::vector<std::pair<uint16_t, Item>> items;
            PackBuff buffer(sb_packbuff_new(block_size));
            size_t expected_size = 8;
            int count = static_cast<int>(random() % 40);
            for (int i = 0; i < count; i++) {
                auto value_type = static_cast<uint16_t>(random());
                size_t length = random() % 50;
                switch (random() % 3) {
                    case 0: {
                        auto value = static_cast<uint32_t>(random());
                        ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), value_type, value), 0);
                        items.emplace_back(value_type, value);
                        expected_size += 8;
                        break;
                    }
                    case 1: {
                        std::string text(length, '\0');
                        for (auto& c : text) c = static_cast<char>(1 + random() % 255);
                        ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), value_type, text.c_str(),
                                                          text.size()),
                                  0);
                        items.emplace_back(value_type, text);
                        expected_size += 8 + (length + 1 + 7) / 8 * 8;
                        break;
                    }
                    default: {
                        std::vector<uint8_t> bytes(length);
                        for (auto& b : bytes) b = static_cast<uint8_t>(random());
                        ASSERT_EQ(sb_packbuff_pack_bytes(buffer.get(), value_type, bytes.data(),
                                                         bytes.size()),
                                  0);
                        items.emplace_back(value_type, bytes);
                        expected_size += 8 + (length + 7) / 8 * 8;
                        break;
                    }
                }
            }
            ASSERT_EQ(sb_packbuff_get_size(buffer.get()), expected_size);
            ASSERT_EQ(buffer->bytes_remaining, buffer->bytes_allocated - expected_size);

            // Read back what a receiver gets: exactly the used bytes.
            const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(buffer.get()));
            Received received(std::vector<uint8_t>(bytes, bytes + expected_size));
            sb_packbuff_t* reader = received.buffer.get();
            for (const auto& [value_type, item] : items) {
                uint16_t seen_type = 0;
                ASSERT_TRUE(sb_packbuff_get_item_value_type(reader, &seen_type));
                EXPECT_EQ(seen_type, value_type);
                int error = -1;
                uint32_t length = 0;
                if (const auto* value = std::get_if<uint32_t>(&item)) {
                    EXPECT_EQ(sb_packbuff_unpack_uint32(reader, &error), *value);
                } else if (const auto* text = std::get_if<std::string>(&item)) {
                    const char* chars = sb_packbuff_unpack_string(reader, &length, &error);
                    ASSERT_NE(chars, nullptr);
                    EXPECT_EQ(std::string(chars, length), *text);
                } else {
                    const auto& expected = std::get<std::vector<uint8_t>>(item);
                    const auto* data = static_cast<const uint8_t*>(
                        sb_packbuff_unpack_bytes(reader, &length, &error));
                    ASSERT_NE(data, nullptr);
                    EXPECT_EQ(std::vector<uint8_t>(data, data + length), expected);
                }
                ASSERT_EQ(error, 0);
            }
            EXPECT_FALSE(sb_packbuff_get_item_value_type(reader, nullptr));

            reader->item = reader->item_buffer;
            size_t skipped = 0;
            while (sb_packbuff_skip_item(reader) == 0) skipped++;
            EXPECT_EQ(skipped, items.size());
        }
    }
}

TEST(PackBuffPrint, DumpsItemsAndStopsAtBadOnes) {
    PackBuff buffer(sb_packbuff_new(0));
    ASSERT_EQ(sb_packbuff_pack_uint32(buffer.get(), 3, 42), 0);
    ASSERT_EQ(sb_packbuff_pack_string(buffer.get(), 1, "ab", 2), 0);
    testing::internal::CaptureStdout();
    sb_packbuff_print(buffer.get());
    std::string dump = testing::internal::GetCapturedStdout();
    EXPECT_NE(dump.find("  dealloc_type:    free()\n"), std::string::npos) << dump;
    EXPECT_NE(dump.find("  bytes_used:      32\n"), std::string::npos) << dump;
    EXPECT_NE(dump.find("  0:"), std::string::npos) << dump;
    EXPECT_NE(dump.find(" -- value type 3 --inline value: 42\n"), std::string::npos) << dump;
    EXPECT_NE(dump.find(" -- value type 1 --string ("), std::string::npos) << dump;
    EXPECT_NE(dump.find("5 pad bytes, size: 3): \n     `ab'\n"), std::string::npos) << dump;
    // The end mark is where the cursor stands: marked with a blank.
    EXPECT_NE(dump.find("\n   2: "), std::string::npos) << dump;
    EXPECT_NE(dump.find(" -- END\n"), std::string::npos) << dump;

    Received truncated(Concat({Header(2, 1, 20), {'a', 'b', 'c', 'd'}}));
    testing::internal::CaptureStdout();
    sb_packbuff_print(truncated.buffer.get());
    dump = testing::internal::GetCapturedStdout();
    EXPECT_NE(dump.find("  dealloc_type:    None\n"), std::string::npos) << dump;
    EXPECT_NE(dump.find("`abcd'\n>> item pointer exceeds end of buffer. <<\n"), std::string::npos)
        << dump;
}

TEST(PackBuffFree, FailedUnmapIsLoggedAndTheObjectStillFreed) {
    std::vector<uint8_t> storage(64);
    // Not page-aligned, so the unmap fails without touching any mapping.
    PackBuff buffer(
        sb_packbuff_init_with_buffer(storage.data() + 1, 16, false, SB_PACKBUFF_DEALLOC_MUNMAP));
    ASSERT_NE(buffer, nullptr);
    testing::internal::CaptureStderr();
    buffer.reset();
    std::string log = testing::internal::GetCapturedStderr();
    EXPECT_NE(log.find("failed: munmap("), std::string::npos) << log;
    EXPECT_NE(log.find(", 16)"), std::string::npos) << log;
}

}  // namespace
