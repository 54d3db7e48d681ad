// The root-entries reader against the whole-tree reader. Inputs that do not
// start with the binary magic get it prepended. Whatever the bytes, when the
// entries reader answers, fromBytes must accept them too, as a dictionary with
// exactly those keys and values (in file order, which writers keep sorted;
// the comparison is by key, so order does not matter here). When it declines,
// nothing is claimed: fromBytes may refuse or accept.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "Platform/PropertyList.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const bool magic = size >= 8 && std::memcmp(data, "bplist00", 8) == 0;
    std::vector<uint8_t> buf;
    buf.reserve(size + 8);
    if (!magic) buf.insert(buf.end(), {'b', 'p', 'l', 'i', 's', 't', '0', '0'});
    buf.insert(buf.end(), data, data + size);

    tarn::PlistEntries entries;
    // Reused lists start from whatever they held.
    entries.emplace_back("stale", tarn::PlistValue(uint64_t{1}));
    const bool answered = tarn::PlistBinaryRootEntries(buf.data(), buf.size(), &entries);
    if (!answered) {
        if (!entries.empty()) std::abort();
        return 0;
    }
    auto whole = tarn::PlistValue::fromBytes(buf.data(), buf.size());
    if (!whole || !whole->isDict()) std::abort();
    const tarn::PlistDict& dict = *whole->asDict();
    if (dict.size() != entries.size()) std::abort();
    for (const auto& [key, value] : entries) {
        auto it = dict.find(key);
        if (it == dict.end()) std::abort();
        // Compared as written out: NaN reals are equal to themselves there.
        if (!(it->second == value) && it->second.toBinary() != value.toBinary()) std::abort();
    }
    return 0;
}
