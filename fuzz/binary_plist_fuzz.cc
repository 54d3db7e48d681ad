// The direct binary property-list reader against the property-list library's
// parser. Inputs that do not start with the binary magic get it prepended, so
// every run exercises the binary reader. Whatever the bytes:
//  - the direct reader refuses them, or
//  - the library accepts them too (or refuses them only for a NUL in an object
//    nothing refers to, which it alone looks at), with the same value, except
//    for dates the direct reader keeps signed, clamps or reads as 0 where the
//    library's are out of range;
//  - and an accepted value reads back the same once written.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "Platform/PropertyList.h"
#include "fuzz/PlistSame.h"

namespace {

bool same(const tarn::PlistValue& a, const tarn::PlistValue& b) {
    return tarn::fuzz::SamePlist(a, b, [](double x, double y) {
        return x == y || x < 0 || x >= INT32_MAX || y < 0 || y >= INT32_MAX;
    });
}

bool hasDateOrNaN(const tarn::PlistValue& v) {
    if (v.asDate()) return true;
    if (v.type() == tarn::PlistValue::Type::Real && std::isnan(*v.asReal())) return true;
    if (auto* a = v.asArray())
        for (auto& item : *a)
            if (hasDateOrNaN(item)) return true;
    if (auto* d = v.asDict())
        for (auto& [k, item] : *d)
            if (hasDateOrNaN(item)) return true;
    return false;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const bool magic = size >= 8 && std::memcmp(data, "bplist00", 8) == 0;
    // Slack after the bytes: the library reads a few bytes past short fields.
    std::vector<uint8_t> buf;
    buf.reserve(size + 8 + 32);
    if (!magic) buf.insert(buf.end(), {'b', 'p', 'l', 'i', 's', 't', '0', '0'});
    buf.insert(buf.end(), data, data + size);
    const size_t length = buf.size();
    buf.resize(length + 32);

    auto direct = tarn::PlistValue::fromBytes(buf.data(), length);
    if (!direct) return 0;
    std::string why;
    auto library = tarn::PlistValue::TEST_fromBytesViaLibrary(buf.data(), length, &why);
    if (!library) {
        if (why != "property list holds a string with a NUL character") std::abort();
        return 0;
    }
    if (!same(*direct, *library)) std::abort();
    if (!hasDateOrNaN(*direct)) {
        auto written = direct->toBinary();
        auto again = tarn::PlistValue::fromBytes(written.data(), written.size());
        if (written.empty() || !again || !same(*again, *direct)) std::abort();
    }
    return 0;
}
