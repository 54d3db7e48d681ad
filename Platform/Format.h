// One formatter for every message of the daemon. It takes format strings as
// they are written in the daemon's log texts: printf conversions, plus "%@"
// for an object's description. Arguments are type-checked at compile time and
// converted to what the conversion asks for, so a mismatched length modifier
// can never read garbage off the stack.
//
// Objects: anything with a `description()` member, a shared_ptr/optional of
// one (empty prints "(null)"), strings, numbers, PlistValue.
#pragma once

#include <concepts>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>

namespace tarn {

struct FormatArg {
    enum class Kind { Signed, Unsigned, Double, String, Pointer };
    Kind kind = Kind::String;
    int64_t i = 0;
    uint64_t u = 0;
    double d = 0;
    const void* p = nullptr;
    std::string s;
};

template <class T>
concept Describable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

template <class T>
FormatArg makeFormatArg(const T& v) {
    FormatArg a;
    using U = std::remove_cvref_t<T>;
    if constexpr (std::is_same_v<U, bool>) {
        a.kind = FormatArg::Kind::Signed;
        a.i = v ? 1 : 0;
        a.s = v ? "1" : "0";
    } else if constexpr (std::is_integral_v<U> && std::is_signed_v<U>) {
        a.kind = FormatArg::Kind::Signed;
        a.i = v;
        a.s = std::to_string(v);
    } else if constexpr (std::is_integral_v<U>) {
        a.kind = FormatArg::Kind::Unsigned;
        a.u = v;
        a.s = std::to_string(v);
    } else if constexpr (std::is_enum_v<U>) {
        a.kind = FormatArg::Kind::Signed;
        a.i = static_cast<int64_t>(v);
        a.s = std::to_string(a.i);
    } else if constexpr (std::is_floating_point_v<U>) {
        a.kind = FormatArg::Kind::Double;
        a.d = v;
        a.s = std::to_string(v);
    } else if constexpr (std::is_convertible_v<const U&, std::string_view>) {
        std::string_view sv(v);
        a.s.assign(sv.data(), sv.size());
        if constexpr (std::is_pointer_v<U>) {
            if (v == nullptr) a.s = "(null)";
        }
    } else if constexpr (Describable<U>) {
        a.s = v.description();
    } else if constexpr (requires { v.get(); *v; }) {  // smart pointers
        if (!v)
            a.s = "(null)";
        else
            a = makeFormatArg(*v);
        a.p = static_cast<const void*>(v.get());
    } else if constexpr (requires { v.has_value(); *v; }) {  // optional
        if (!v.has_value())
            a.s = "(null)";
        else
            a = makeFormatArg(*v);
    } else if constexpr (std::is_pointer_v<U>) {
        a.kind = FormatArg::Kind::Pointer;
        a.p = static_cast<const void*>(v);
        char buf[32];
        std::snprintf(buf, sizeof buf, "%p", a.p);
        a.s = buf;
    } else {
        static_assert(sizeof(U) == 0, "type cannot be formatted: give it description()");
    }
    return a;
}

std::string formatArgs(std::string_view fmt, const FormatArg* args, size_t count);

template <class... Args>
std::string Format(std::string_view fmt, const Args&... args) {
    if constexpr (sizeof...(Args) == 0) {
        return formatArgs(fmt, nullptr, 0);
    } else {
        const FormatArg list[] = {makeFormatArg(args)...};
        return formatArgs(fmt, list, sizeof...(Args));
    }
}

}  // namespace tarn
