// The root-entries reader against the whole-tree reader. Inputs that do not
// start with the binary magic get it prepended. Whatever the bytes, when the
// entries reader answers, fromBytes must accept them too, as a dictionary with
// exactly those keys and values (in file order, which writers keep sorted;
// the comparison is by key, so order does not matter here). When it declines,
// nothing is claimed: fromBytes may refuse or accept. Asked to decode one
// key's dictionary into a second list, it answers only when the plain call
// does, with the same entries and that dictionary's entries in the list.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "fuzz/PlistSame.h"

namespace {
// Both readers are ours and read the same bytes, so values must match to the
// bit, NaN reals and dates included. (Comparing written-out bytes instead is
// not canonical: the writer may lay out equal values differently.)
bool same(const tarn::PlistValue& a, const tarn::PlistValue& b) {
    return tarn::fuzz::SamePlist(a, b, tarn::fuzz::SameBits);
}
}  // namespace

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
    }
    std::optional<tarn::PlistValue> whole;
    if (answered) {
        whole = tarn::PlistValue::fromBytes(buf.data(), buf.size());
        if (!whole || !whole->isDict()) std::abort();
        const tarn::PlistDict& dict = *whole->asDict();
        if (dict.size() != entries.size()) std::abort();
        for (const auto& [key, value] : entries) {
            auto it = dict.find(key);
            if (it == dict.end()) std::abort();
            if (!same(it->second, value)) std::abort();
        }
    }

    // With one root key's dictionary decoded into a second list: the first
    // dictionary-valued key the plain reader found, or else a fixed name.
    std::string inlineKey = "UserIdentity";
    for (const auto& [key, value] : entries)
        if (value.isDict()) {
            inlineKey = std::string(key);
            break;
        }
    tarn::PlistEntries roots, inlined;
    roots.emplace_back("stale", tarn::PlistValue(uint64_t{1}));
    inlined.emplace_back("stale", tarn::PlistValue(uint64_t{2}));
    if (!tarn::PlistBinaryRootEntries(buf.data(), buf.size(), &roots, inlineKey, &inlined)) {
        if (!roots.empty() || !inlined.empty()) std::abort();
        return 0;
    }
    // Never an answer the plain reader declines.
    if (!answered || roots.size() != entries.size()) std::abort();
    bool sawInlined = false;
    for (size_t i = 0; i < roots.size(); ++i) {
        if (roots[i].first != entries[i].first) std::abort();
        if (roots[i].first == inlineKey && entries[i].second.isDict()) {
            sawInlined = true;
            if (!roots[i].second.isDict() || !roots[i].second.asDict()->empty()) std::abort();
            const tarn::PlistDict& nested = *entries[i].second.asDict();
            if (nested.size() != inlined.size()) std::abort();
            for (const auto& [key, value] : inlined) {
                auto it = nested.find(key);
                if (it == nested.end() || !same(it->second, value)) std::abort();
            }
        } else if (!same(roots[i].second, entries[i].second)) {
            std::abort();
        }
    }
    if (!sawInlined && !inlined.empty()) std::abort();
    return 0;
}
