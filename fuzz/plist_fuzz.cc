// Property-list decoding: files on disk (metadata, host configuration,
// registry entries, legacy imports) and code-signing blobs from the store.
// Whatever the bytes, decoding either refuses them or yields a value that
// reads back the same once written (dates lose sub-microsecond digits on the
// first write, and NaN never equals itself, so descriptions are compared).
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "Daemon/TarnCodeSigningEntry.h"
#include "Platform/PropertyList.h"

// The file library moves negative dates by whole seconds on each write; the
// daemon never writes dates, so values holding one are only decoded.
static bool containsDate(const tarn::PlistValue& v) {
    if (v.asDate()) return true;
    if (auto* a = v.asArray())
        for (auto& item : *a)
            if (containsDate(item)) return true;
    if (auto* d = v.asDict())
        for (auto& [k, item] : *d)
            if (containsDate(item)) return true;
    return false;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string why;
    auto value = tarn::PlistValue::fromBytes(data, size, &why);
    if (!value) return 0;
    (void)value->description();
    if (!value->isNull() && !containsDate(*value)) {
        auto first = value->toBinary();
        auto again = tarn::PlistValue::fromBytes(first.data(), first.size());
        if (!again) std::abort();
        auto second = again->toBinary();
        auto third = tarn::PlistValue::fromBytes(second.data(), second.size());
        if (!third || third->description() != again->description()) std::abort();
    }
    // Code-signing blobs are decoded the same way and then interpreted.
    if (auto entry = tarn::TarnCodeSigningEntry::initWithSerializedDictionary(*value)) {
        (void)entry->description();
        (void)entry->serialize();
    }
    return 0;
}
