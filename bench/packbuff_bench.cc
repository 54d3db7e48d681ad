// Packing and unpacking one million mixed items, against memcpy of the same bytes measured
// in the same run. Rounds interleave floor and subjects so that machine noise hits all of
// them alike; the median round counts. Build with optimisation (CMAKE_BUILD_TYPE=Release).
#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

namespace {

constexpr size_t kItems = 1000000;
constexpr int kRounds = 9;
// The upcall answer's block size.
constexpr size_t kBlockSize = 4096;

enum class Kind : uint8_t { kUint32, kString, kBytes };

struct Item {
    Kind kind;
    uint16_t value_type;
    uint32_t value;
    std::string payload;  // a string's characters or the bytes
};

std::vector<Item> MakeItems() {
    std::mt19937 random(42);
    std::vector<Item> items(kItems);
    for (auto& item : items) {
        item.value_type = static_cast<uint16_t>(random() % 200);
        unsigned pick = random() % 10;
        if (pick < 5) {
            item.kind = Kind::kUint32;
            item.value = static_cast<uint32_t>(random());
        } else if (pick < 8) {
            // Paths and identifiers, like the upcall's answers.
            item.kind = Kind::kString;
            item.payload.assign(8 + random() % 56, 'a' + static_cast<char>(random() % 26));
        } else {
            item.kind = Kind::kBytes;
            item.payload.assign(random() % 64, static_cast<char>(random()));
        }
    }
    return items;
}

sb_packbuff_t* Pack(const std::vector<Item>& items) {
    sb_packbuff_t* buffer = sb_packbuff_new(kBlockSize);
    for (const auto& item : items) {
        int error = 0;
        switch (item.kind) {
            case Kind::kUint32:
                error = sb_packbuff_pack_uint32(buffer, item.value_type, item.value);
                break;
            case Kind::kString:
                error = sb_packbuff_pack_string(buffer, item.value_type, item.payload.c_str(),
                                                item.payload.size());
                break;
            case Kind::kBytes:
                error = sb_packbuff_pack_bytes(buffer, item.value_type, item.payload.data(),
                                               item.payload.size());
                break;
        }
        if (error != 0) {
            std::fprintf(stderr, "pack failed: %d\n", error);
            std::exit(1);
        }
    }
    return buffer;
}

uint64_t Unpack(sb_packbuff_t* buffer, const std::vector<Item>& items) {
    buffer->item = buffer->item_buffer;
    uint64_t sum = 0;
    for (const auto& item : items) {
        uint16_t value_type = 0;
        int error = 0;
        uint32_t length = 0;
        if (!sb_packbuff_get_item_value_type(buffer, &value_type)) std::exit(1);
        sum += value_type;
        switch (item.kind) {
            case Kind::kUint32:
                sum += sb_packbuff_unpack_uint32(buffer, &error);
                break;
            case Kind::kString:
                sum +=
                    reinterpret_cast<uintptr_t>(sb_packbuff_unpack_string(buffer, &length, &error));
                break;
            case Kind::kBytes:
                sum +=
                    reinterpret_cast<uintptr_t>(sb_packbuff_unpack_bytes(buffer, &length, &error));
                break;
        }
        sum += length;
        if (error != 0) {
            std::fprintf(stderr, "unpack failed: %d\n", error);
            std::exit(1);
        }
    }
    return sum;
}

template <typename F>
double Seconds(F&& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

double Median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

}  // namespace

int main() {
    const std::vector<Item> items = MakeItems();
    sb_packbuff_t* reference = Pack(items);
    const size_t size = sb_packbuff_get_size(reference);
    const auto* image = static_cast<const uint8_t*>(sb_packbuff_get_bytes(reference));
    // A receiver's copy of what was packed, end mark included, to unpack from.
    std::vector<uint8_t> received(image, image + size);
    sb_packbuff_t* reader = sb_packbuff_init_with_buffer(received.data(), received.size(), true,
                                                         SB_PACKBUFF_DEALLOC_NONE);
    // The floor's destination is touched up front: the floor is the copy alone.
    std::vector<uint8_t> destination(size, 1);

    std::vector<double> copy_times, pack_times, unpack_times;
    for (int round = 0; round < kRounds; round++) {
        copy_times.push_back(Seconds([&] {
            std::memcpy(destination.data(), image, size);
            benchmark::ClobberMemory();
        }));
        pack_times.push_back(Seconds([&] {
            sb_packbuff_t* buffer = Pack(items);
            benchmark::DoNotOptimize(buffer->item_buffer);
            sb_packbuff_free(buffer);
        }));
        unpack_times.push_back(Seconds([&] { benchmark::DoNotOptimize(Unpack(reader, items)); }));
    }

    const double copy = Median(copy_times);
    const double pack = Median(pack_times);
    const double unpack = Median(unpack_times);
    std::printf("packbuff: %zu items, %zu bytes, block size %zu, median of %d rounds\n", kItems,
                size, kBlockSize, kRounds);
    std::printf("memcpy (floor): %8.3f ms\n", copy * 1e3);
    std::printf("pack:           %8.3f ms  (%.1f ns/item, growth included)\n", pack * 1e3,
                pack * 1e9 / kItems);
    std::printf("unpack:         %8.3f ms  (%.1f ns/item)\n", unpack * 1e3, unpack * 1e9 / kItems);
    std::printf("pack/memcpy ratio: %.2f\n", pack / copy);
    std::printf("unpack/memcpy ratio: %.2f\n", unpack / copy);

    sb_packbuff_free(reader);
    sb_packbuff_free(reference);
    return 0;
}
