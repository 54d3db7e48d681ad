#include "Platform/Format.h"

#include <cctype>
#include <charconv>
#include <cstdio>

namespace tarn {

namespace {

enum class Length { Int, Long, Short, Char };

void appendInteger(std::string* out, std::string_view directive, char conv, const FormatArg& a, Length len) {
    // Reproduce C's truncation for the length modifier, then print at 64 bits.
    bool isSigned = conv == 'd' || conv == 'i';
    uint64_t raw = a.kind == FormatArg::Kind::Signed     ? static_cast<uint64_t>(a.i)
                   : a.kind == FormatArg::Kind::Unsigned ? a.u
                   : a.kind == FormatArg::Kind::Double   ? static_cast<uint64_t>(a.d)
                   : a.kind == FormatArg::Kind::Pointer  ? reinterpret_cast<uintptr_t>(a.p)
                                                         : 0;
    if (a.kind == FormatArg::Kind::String) {
        // A string where a number was asked for: print the text rather than guess.
        out->append(a.s);
        return;
    }
    char buf[80];
    if (directive.size() == 1 && conv != 'o') {
        // The common case, without building a printf format.
        uint64_t v = raw;
        bool negative = false;
        if (isSigned) {
            int64_t sv = static_cast<int64_t>(raw);
            if (len == Length::Int) sv = static_cast<int32_t>(raw);
            if (len == Length::Short) sv = static_cast<int16_t>(raw);
            if (len == Length::Char) sv = static_cast<int8_t>(raw);
            negative = sv < 0;
            v = negative ? 0 - static_cast<uint64_t>(sv) : static_cast<uint64_t>(sv);
        } else {
            if (len == Length::Int) v = static_cast<uint32_t>(raw);
            if (len == Length::Short) v = static_cast<uint16_t>(raw);
            if (len == Length::Char) v = static_cast<uint8_t>(raw);
        }
        char* p = buf;
        if (negative) *p++ = '-';
        const int base = conv == 'x' || conv == 'X' ? 16 : 10;
        char* end = std::to_chars(p, buf + sizeof buf, v, base).ptr;
        if (conv == 'X')
            for (char* q = p; q < end; ++q) *q = static_cast<char>(std::toupper(static_cast<unsigned char>(*q)));
        out->append(buf, end);
        return;
    }
    const std::string f = std::string(directive) + "ll" + conv;
    if (isSigned) {
        int64_t v = static_cast<int64_t>(raw);
        if (len == Length::Int) v = static_cast<int32_t>(raw);
        if (len == Length::Short) v = static_cast<int16_t>(raw);
        if (len == Length::Char) v = static_cast<int8_t>(raw);
        std::snprintf(buf, sizeof buf, f.c_str(), static_cast<long long>(v));
    } else {
        uint64_t v = raw;
        if (len == Length::Int) v = static_cast<uint32_t>(raw);
        if (len == Length::Short) v = static_cast<uint16_t>(raw);
        if (len == Length::Char) v = static_cast<uint8_t>(raw);
        std::snprintf(buf, sizeof buf, f.c_str(), static_cast<unsigned long long>(v));
    }
    out->append(buf);
}

// What %@ and %s print for an argument.
std::string argumentText(const FormatArg& a) {
    char buf[32];
    switch (a.kind) {
        case FormatArg::Kind::String:
            return std::string(a.s);
        case FormatArg::Kind::Signed:
            return std::string(buf, std::to_chars(buf, buf + sizeof buf, a.i).ptr);
        case FormatArg::Kind::Unsigned:
            return std::string(buf, std::to_chars(buf, buf + sizeof buf, a.u).ptr);
        case FormatArg::Kind::Double:
            return std::to_string(a.d);
        case FormatArg::Kind::Pointer:
            std::snprintf(buf, sizeof buf, "%p", a.p);
            return buf;
    }
    return std::string(a.s);
}

}  // namespace

std::string formatArgs(std::string_view fmt, const FormatArg* args, size_t count) {
    std::string out;
    out.reserve(fmt.size() + 32);
    size_t next = 0;
    for (size_t i = 0; i < fmt.size(); ++i) {
        // Literal text up to the next directive in one piece: most of a log
        // line is its format's own words.
        const size_t percent = fmt.find('%', i);
        if (percent != i) {
            out.append(fmt.substr(i, percent - i));
            if (percent == std::string_view::npos) break;
            i = percent;
        }
        if (i + 1 < fmt.size() && fmt[i + 1] == '%') {
            out += '%';
            ++i;
            continue;
        }
        // %[flags][width][.precision][length]conversion; `directive` is the
        // part printf needs besides the length ("%" alone when plain).
        size_t j = i + 1;
        while (j < fmt.size() && std::string_view("-+ #0'").find(fmt[j]) != std::string_view::npos) ++j;
        while (j < fmt.size() && std::isdigit(static_cast<unsigned char>(fmt[j]))) ++j;
        if (j < fmt.size() && fmt[j] == '.') {
            ++j;
            while (j < fmt.size() && std::isdigit(static_cast<unsigned char>(fmt[j]))) ++j;
        }
        const std::string_view directive = fmt.substr(i, j - i);
        const bool plain = directive.size() == 1;
        Length len = Length::Int;
        while (j < fmt.size() && std::string_view("hlqjztL").find(fmt[j]) != std::string_view::npos) {
            char m = fmt[j++];
            if (m == 'h') len = len == Length::Short ? Length::Char : Length::Short;
            else len = Length::Long;
        }
        if (j >= fmt.size()) {
            out.append(fmt.substr(i));
            break;
        }
        char conv = fmt[j];
        i = j;
        if (next >= count) {
            out += "(missing)";
            continue;
        }
        const FormatArg& a = args[next++];
        char buf[512];
        switch (conv) {
            case '@':
                if (a.kind == FormatArg::Kind::String) out += a.s;
                else out += argumentText(a);
                break;
            case 's': {
                // Width and precision apply as printf would apply them.
                if (plain && a.kind == FormatArg::Kind::String) {
                    out += a.s;
                } else {
                    std::snprintf(buf, sizeof buf, (std::string(directive) + "s").c_str(), argumentText(a).c_str());  // NUL-ended copy
                    out += buf;
                }
                break;
            }
            case 'd': case 'i': case 'u': case 'x': case 'X': case 'o': case 'c':
                if (conv == 'c') {
                    out += static_cast<char>(a.kind == FormatArg::Kind::Signed ? a.i : a.u);
                } else {
                    appendInteger(&out, directive, conv, a, len);
                }
                break;
            case 'f': case 'F': case 'g': case 'G': case 'e': case 'E': {
                double v = a.kind == FormatArg::Kind::Double     ? a.d
                           : a.kind == FormatArg::Kind::Signed   ? static_cast<double>(a.i)
                           : a.kind == FormatArg::Kind::Unsigned ? static_cast<double>(a.u)
                                                                 : 0.0;
                std::snprintf(buf, sizeof buf, (std::string(directive) + conv).c_str(), v);
                out += buf;
                break;
            }
            case 'p': {
                std::snprintf(buf, sizeof buf, "%p", a.p);
                out += buf;
                break;
            }
            default:
                // Unknown conversion: keep the text so the line still says something.
                out.append(fmt.substr(i - directive.size(), directive.size() + 1));
                --next;
                break;
        }
    }
    return out;
}

}  // namespace tarn
