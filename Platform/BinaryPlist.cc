#include "Platform/BinaryPlist.h"

#include <cmath>
#include <cstring>

#include "Platform/PropertyList.h"

namespace tarn {

namespace {

constexpr size_t kHeaderBytes = 8;   // "bplist00"
constexpr size_t kTrailerBytes = 32;
// Same limit as the writer and the XML path.
constexpr int kMaxDepth = 256;
// Values a file may expand into through shared references beyond one per byte
// of the file: enough for any honest writer, too few to exhaust memory.
constexpr uint64_t kExtraValueBudget = uint64_t{1} << 16;

uint64_t bigEndian(const uint8_t* p, size_t width) {
    uint64_t v = 0;
    for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
    return v;
}

class Reader {
  public:
    Reader(const uint8_t* bytes, size_t length) : p_(bytes), n_(length) {}

    std::optional<PlistValue> run() {
        if (n_ < kHeaderBytes + kTrailerBytes || std::memcmp(p_, "bplist00", 8) != 0)
            return refuse("not a binary property list");
        const uint8_t* trailer = p_ + n_ - kTrailerBytes;
        offsetSize_ = trailer[6];
        refSize_ = trailer[7];
        count_ = bigEndian(trailer + 8, 8);
        const uint64_t root = bigEndian(trailer + 16, 8);
        tableAt_ = bigEndian(trailer + 24, 8);
        const uint64_t trailerAt = n_ - kTrailerBytes;
        if (offsetSize_ == 0 || offsetSize_ > 8 || refSize_ == 0 || refSize_ > 8)
            return refuse("bad offset or reference size");
        if (count_ == 0 || root >= count_) return refuse("bad object count or root");
        if (tableAt_ < kHeaderBytes || tableAt_ >= trailerAt ||
            count_ > (trailerAt - tableAt_) / offsetSize_)
            return refuse("offset table out of bounds");
        budget_ = n_ + kExtraValueBudget;
        PlistValue out;
        if (!parse(root, 0, out)) return std::nullopt;
        return out;
    }

    const char* why() const { return why_; }

  private:
    std::nullopt_t refuse(const char* why) {
        if (!why_) why_ = why;
        return std::nullopt;
    }
    bool fail(const char* why) {
        if (!why_) why_ = why;
        return false;
    }

    // Start of object `index`; objects live between the header and the table.
    bool objectAt(uint64_t index, uint64_t* at) {
        if (index >= count_) return fail("object reference out of range");
        *at = bigEndian(p_ + tableAt_ + index * offsetSize_, offsetSize_);
        if (*at < kHeaderBytes || *at >= tableAt_) return fail("object offset out of bounds");
        return true;
    }

    // The count that follows a marker: in its low nibble, or in an integer
    // object after it when the nibble is 0xF.
    bool count(uint8_t marker, uint64_t* cursor, uint64_t* out) {
        *out = marker & 0xF;
        if (*out != 0xF) return true;
        if (*cursor >= tableAt_ || (p_[*cursor] >> 4) != 0x1) return fail("bad length marker");
        const size_t width = size_t{1} << (p_[*cursor] & 0xF);
        if (width > 8 || width > tableAt_ - *cursor - 1) return fail("bad length marker");
        *out = bigEndian(p_ + *cursor + 1, width);
        *cursor += 1 + width;
        return true;
    }

    bool fits(uint64_t cursor, uint64_t bytes) const { return bytes <= tableAt_ - cursor; }

    bool parse(uint64_t index, int depth, PlistValue& out) {
        if (depth > kMaxDepth) return fail("property list nested too deeply");
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        // A reference back to an object still open above is a cycle.
        for (int i = 0; i < depth; ++i)
            if (path_[i] == index) return fail("object reference cycle");
        path_[depth] = index;

        uint64_t at;
        if (!objectAt(index, &at)) return false;
        const uint8_t marker = p_[at];
        const uint8_t info = marker & 0xF;
        uint64_t cursor = at + 1;
        switch (marker >> 4) {
            case 0x0:
                if (info == 0x8 || info == 0x9) {
                    out = PlistValue(info == 0x9);
                    return true;
                }
                return fail("unsupported null or fill object");
            case 0x1: {
                const size_t width = size_t{1} << info;
                if (width != 1 && width != 2 && width != 4 && width != 8 && width != 16)
                    return fail("bad integer size");
                if (!fits(cursor, width)) return fail("integer out of bounds");
                // 16-byte integers carry their value in the low 8 bytes.
                const uint64_t u = width == 16 ? bigEndian(p_ + cursor + 8, 8)
                                               : bigEndian(p_ + cursor, width);
                // Above INT64_MAX only from 8-byte negative integers.
                if (u > static_cast<uint64_t>(INT64_MAX))
                    out = PlistValue(static_cast<int64_t>(u));
                else
                    out = PlistValue(u);
                return true;
            }
            case 0x2: {
                double d;
                if (!real(info, cursor, &d)) return false;
                out = PlistValue(d);
                return true;
            }
            case 0x3: {
                double d;
                if (info != 0x3 || !real(info, cursor, &d)) return fail("bad date");
                out = PlistValue(PlistDate{clampedDate(d)});
                return true;
            }
            case 0x4: {
                uint64_t length;
                if (!count(marker, &cursor, &length)) return false;
                if (!fits(cursor, length)) return fail("data out of bounds");
                out = PlistValue(PlistData(p_ + cursor, p_ + cursor + length));
                return true;
            }
            case 0x5:
            case 0x6: {
                std::string s;
                if (!string(marker, cursor, &s)) return false;
                out = PlistValue(std::move(s));
                return true;
            }
            case 0x8: {
                const size_t width = size_t{info} + 1;
                if (!fits(cursor, width)) return fail("uid out of bounds");
                const uint64_t u = width > 8 ? bigEndian(p_ + cursor + width - 8, 8)
                                             : bigEndian(p_ + cursor, width);
                if (u > UINT32_MAX) return fail("uid too large");
                out = PlistValue(u);
                return true;
            }
            case 0xA:
            case 0xC: {
                uint64_t n;
                if (!count(marker, &cursor, &n)) return false;
                if (n > (tableAt_ - cursor) / refSize_) return fail("array out of bounds");
                PlistArray items(n);
                for (uint64_t i = 0; i < n; ++i) {
                    const uint64_t ref = bigEndian(p_ + cursor + i * refSize_, refSize_);
                    if (!parse(ref, depth + 1, items[i])) return false;
                }
                out = PlistValue(std::move(items));
                return true;
            }
            case 0xD: {
                uint64_t n;
                if (!count(marker, &cursor, &n)) return false;
                if (n > (tableAt_ - cursor) / refSize_ / 2) return fail("dictionary out of bounds");
                PlistDict items;
                const uint8_t* keys = p_ + cursor;
                const uint8_t* values = keys + n * refSize_;
                for (uint64_t i = 0; i < n; ++i) {
                    std::string key;
                    if (!dictKey(bigEndian(keys + i * refSize_, refSize_), &key)) return false;
                    PlistValue value;
                    if (!parse(bigEndian(values + i * refSize_, refSize_), depth + 1, value))
                        return false;
                    // Writers emit keys sorted, so the hint is nearly always right;
                    // a repeated key keeps its last value.
                    items.insert_or_assign(items.end(), std::move(key), std::move(value));
                }
                out = PlistValue(std::move(items));
                return true;
            }
            default: return fail("unknown object type");
        }
    }

    bool real(uint8_t info, uint64_t cursor, double* out) {
        if (info == 0x2) {
            if (!fits(cursor, 4)) return fail("real out of bounds");
            const uint32_t bits = static_cast<uint32_t>(bigEndian(p_ + cursor, 4));
            float f;
            std::memcpy(&f, &bits, 4);
            *out = f;
            return true;
        }
        if (info == 0x3) {
            if (!fits(cursor, 8)) return fail("real out of bounds");
            const uint64_t bits = bigEndian(p_ + cursor, 8);
            std::memcpy(out, &bits, 8);
            return true;
        }
        return fail("bad real size");
    }

    // Whole seconds within 32 bits plus whole microseconds, as dates have
    // always been kept here; out-of-range seconds are clamped, non-finite
    // values read as the epoch.
    static double clampedDate(double d) {
        if (!std::isfinite(d)) return 0;
        if (d >= 2147483648.0) return INT32_MAX;
        if (d <= -2147483649.0) return INT32_MIN;
        const int32_t seconds = static_cast<int32_t>(d);
        const int32_t micros = static_cast<int32_t>(std::fabs((d - seconds) * 1000000));
        return d < 0 ? seconds - micros / 1e6 : seconds + micros / 1e6;
    }

    // A dictionary key: a string object, referenced from the dictionary. Keys
    // are leaves, so they need neither the depth nor the cycle check.
    bool dictKey(uint64_t index, std::string* out) {
        uint64_t at;
        if (!objectAt(index, &at)) return false;
        const uint8_t kind = p_[at] >> 4;
        if (kind != 0x5 && kind != 0x6) return fail("dictionary key is not a string");
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        return string(p_[at], at + 1, out);
    }

    bool string(uint8_t marker, uint64_t cursor, std::string* out) {
        uint64_t length;
        if (!count(marker, &cursor, &length)) return false;
        const uint8_t* s = p_ + cursor;
        if ((marker >> 4) == 0x5) {
            if (!fits(cursor, length)) return fail("string out of bounds");
            bool ascii = true;
            for (uint64_t i = 0; i < length; ++i) {
                if (s[i] == 0) return fail("property list holds a string with a NUL character");
                ascii &= s[i] < 0x80;
            }
            out->assign(reinterpret_cast<const char*>(s), length);
            if (!ascii && !PlistIsValidUtf8(*out)) return fail("string is not valid UTF-8");
            return true;
        }
        if (length > (tableAt_ - cursor) / 2) return fail("string out of bounds");
        // Writers put an empty string in the one-byte form; the UTF-16 form
        // with no units has always been refused here.
        if (length == 0) return fail("empty UTF-16 string");
        out->clear();
        out->reserve(length);
        for (uint64_t i = 0; i < length; ++i) {
            uint32_t c = (uint32_t{s[2 * i]} << 8) | s[2 * i + 1];
            if (c == 0) return fail("property list holds a string with a NUL character");
            if (c >= 0xDC00 && c <= 0xDFFF) return fail("string is not valid UTF-16");
            if (c >= 0xD800 && c <= 0xDBFF) {
                if (i + 1 == length) return fail("string is not valid UTF-16");
                const uint32_t low = (uint32_t{s[2 * i + 2]} << 8) | s[2 * i + 3];
                if (low < 0xDC00 || low > 0xDFFF) return fail("string is not valid UTF-16");
                c = 0x10000 + ((c - 0xD800) << 10) + (low - 0xDC00);
                ++i;
            }
            if (c < 0x80) {
                out->push_back(static_cast<char>(c));
            } else if (c < 0x800) {
                out->push_back(static_cast<char>(0xC0 | (c >> 6)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            } else if (c < 0x10000) {
                out->push_back(static_cast<char>(0xE0 | (c >> 12)));
                out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            } else {
                out->push_back(static_cast<char>(0xF0 | (c >> 18)));
                out->push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            }
        }
        return true;
    }

    const uint8_t* const p_;
    const size_t n_;
    uint64_t tableAt_ = 0;
    uint64_t count_ = 0;
    size_t offsetSize_ = 0;
    size_t refSize_ = 0;
    uint64_t budget_ = 0;
    uint64_t path_[kMaxDepth + 1] = {};  // object index open at each depth
    const char* why_ = nullptr;
};

}  // namespace

std::optional<PlistValue> ParseBinaryPlist(const uint8_t* bytes, size_t length, std::string* why) {
    Reader reader(bytes, length);
    auto out = reader.run();
    if (!out && why) *why = reader.why() ? reader.why() : "malformed property list";
    return out;
}

bool PlistIsValidUtf8(std::string_view s) {
    size_t i = 0, n = s.size();
    while (i < n) {
        unsigned char c = static_cast<unsigned char>(s[i]);
        size_t extra;
        if (c < 0x80) extra = 0;
        else if ((c >> 5) == 0x6) extra = 1;
        else if ((c >> 4) == 0xE) extra = 2;
        else if ((c >> 3) == 0x1E) extra = 3;
        else return false;
        if (extra > n - i - 1) return false;
        uint32_t cp = extra == 0 ? c : c & (0x3F >> extra);
        for (size_t k = 1; k <= extra; ++k) {
            unsigned char d = static_cast<unsigned char>(s[i + k]);
            if ((d >> 6) != 0x2) return false;
            cp = (cp << 6) | (d & 0x3F);
        }
        // Overlong forms, surrogates and values past the last code point.
        if ((extra == 1 && cp < 0x80) || (extra == 2 && cp < 0x800) ||
            (extra == 3 && cp < 0x10000) || (cp >= 0xD800 && cp <= 0xDFFF) || cp > 0x10FFFF)
            return false;
        i += extra + 1;
    }
    return true;
}

}  // namespace tarn
