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

// Numbers and pointers keep their value only; their text is made when a
// conversion asks for text (%@, %s), so a log line pays for what it prints.
// Text arguments are viewed, not copied: a FormatArg lives only inside one
// Format() call, while its arguments do. Text made here (a description) is
// kept in `owned` and viewed from there.
struct FormatArg {
    enum class Kind { Signed, Unsigned, Double, String, Pointer };
    Kind kind = Kind::String;
    int64_t i = 0;
    uint64_t u = 0;
    double d = 0;
    const void* p = nullptr;
    std::string_view s;
    std::string owned;

    FormatArg() = default;
    FormatArg(const FormatArg&) = delete;
    FormatArg& operator=(const FormatArg&) = delete;
    FormatArg(FormatArg&& o) noexcept { *this = std::move(o); }
    FormatArg& operator=(FormatArg&& o) noexcept {
        kind = o.kind;
        i = o.i;
        u = o.u;
        d = o.d;
        p = o.p;
        const bool own = o.s.data() == o.owned.data();
        owned = std::move(o.owned);
        s = own ? std::string_view(owned) : o.s;
        return *this;
    }
    void own(std::string text) {
        owned = std::move(text);
        s = owned;
    }
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
    } else if constexpr (std::is_integral_v<U> && std::is_signed_v<U>) {
        a.kind = FormatArg::Kind::Signed;
        a.i = v;
    } else if constexpr (std::is_integral_v<U>) {
        a.kind = FormatArg::Kind::Unsigned;
        a.u = v;
    } else if constexpr (std::is_enum_v<U>) {
        a.kind = FormatArg::Kind::Signed;
        a.i = static_cast<int64_t>(v);
    } else if constexpr (std::is_floating_point_v<U>) {
        a.kind = FormatArg::Kind::Double;
        a.d = v;
    } else if constexpr (std::is_convertible_v<const U&, std::string_view>) {
        if constexpr (std::is_pointer_v<U>) {
            a.s = v == nullptr ? std::string_view("(null)") : std::string_view(v);
        } else {
            a.s = std::string_view(v);
        }
    } else if constexpr (Describable<U>) {
        a.own(v.description());
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
