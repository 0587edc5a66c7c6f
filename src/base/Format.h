#pragma once

// The printf-style formatter for the system's own texts: log lines and error messages are written exactly as the
// system words them ("client %d requested %{public}s", "removal complete for %@"). A literal format is checked
// against its argument types at compile time, so a string passed for %d, or one argument too few, does not build.
// Formats that are only known at run time go through formatPrintfRuntime, where every mistake renders a visible
// marker instead of undefined behaviour.
//
// Conversions: %d %i %u %x %X %o %c (integers), %f %F %e %E %g %G %a %A (numbers), %s (text), %@ (an object's
// description), %p (an address), %% (a percent sign); flags "-+ #0", a width and a precision, each also as "*",
// and the length modifiers hh h l ll q j z t L. An annotation in braces right after the percent sign
// ("%{public}s", "%{private}@") is accepted and does not change the rendering.
//
// Integers are never narrowed: the value is rendered in the conversion's signedness at the wider of the argument's
// own width and the length modifier's width, so "%u" of the int -1 gives 4294967295 and "%lu" of it
// 18446744073709551615, as printf would after the cast a careful caller writes.
//
// %@ takes: a Value (a string renders unquoted, null renders "(null)", anything else its description), an Error,
// any object with a description() member, a Uuid, a Date, text, a pointer or shared_ptr to any of those, an
// optional of any of those, a vector of them ("[a, b]"), and nullptr/nullopt, which render "(null)". %s takes text
// (a null const char* renders "(null)") and, for convenience, the same objects as %@.

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

namespace bexil {

class Value;
class Error;
class Uuid;
struct Date;

namespace format_detail {

// What an argument can turn out to be once it is rendered; a type may produce several (an optional string is
// text or null).
enum Category : unsigned {
    kInteger = 1u << 0,
    kFloating = 1u << 1,
    kText = 1u << 2,
    kObject = 1u << 3,
    kNull = 1u << 4,
    kPointer = 1u << 5,
};

template <class T>
concept Describable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

template <class T>
concept TextLike = std::same_as<T, std::string> || std::same_as<T, std::string_view> || std::same_as<T, const char*> ||
    std::same_as<T, char*>;

template <class T>
struct IsOptional : std::false_type {};
template <class T>
struct IsOptional<std::optional<T>> : std::true_type {};
template <class T>
struct IsSharedPtr : std::false_type {};
template <class T>
struct IsSharedPtr<std::shared_ptr<T>> : std::true_type {};
template <class T>
struct IsVector : std::false_type {};
template <class T, class A>
struct IsVector<std::vector<T, A>> : std::true_type {};

// A type that %@ can describe (before decaying pointers and wrappers).
template <class T>
constexpr bool isObjectType() {
    // The known types first, so that Describable is never asked of one of them while it is still incomplete.
    if constexpr (std::same_as<T, Value> || std::same_as<T, Error> || std::same_as<T, Uuid> || std::same_as<T, Date>)
        return true;
    else
        return Describable<T>;
}

template <class Raw>
constexpr unsigned categoriesOf() {
    using T = std::decay_t<Raw>;
    if constexpr (std::same_as<T, bool> || std::is_integral_v<T> || std::is_enum_v<T>) {
        return kInteger;
    } else if constexpr (std::is_floating_point_v<T>) {
        return kFloating;
    } else if constexpr (TextLike<T>) {
        // A char pointer may be null, which renders "(null)".
        return std::is_pointer_v<T> ? (kText | kNull) : kText;
    } else if constexpr (std::same_as<T, std::nullptr_t> || std::same_as<T, std::nullopt_t>) {
        return kNull;
    } else if constexpr (std::same_as<T, Value>) {
        return kText | kObject | kNull;
    } else if constexpr (isObjectType<T>()) {
        return kObject;
    } else if constexpr (IsOptional<T>::value) {
        return categoriesOf<typename T::value_type>() | kNull;
    } else if constexpr (IsSharedPtr<T>::value) {
        using E = std::remove_cv_t<typename T::element_type>;
        if constexpr (isObjectType<E>())
            return kObject | kNull;
        else
            return kPointer | kNull;
    } else if constexpr (std::is_pointer_v<T>) {
        using E = std::remove_cv_t<std::remove_pointer_t<T>>;
        if constexpr (isObjectType<E>())
            return kObject | kNull;
        else
            return kPointer | kNull;
    } else if constexpr (IsVector<T>::value) {
        constexpr unsigned element = categoriesOf<typename T::value_type>();
        return (element & (kText | kObject | kNull)) != 0 && (element & ~(kText | kObject | kNull)) == 0 ? kObject : 0u;
    } else {
        return 0u;
    }
}

// The categories a conversion character accepts.
constexpr unsigned acceptedBy(char conversion) {
    switch (conversion) {
        case 'd':
        case 'i':
        case 'u':
        case 'x':
        case 'X':
        case 'o':
        case 'c':
            return kInteger;
        case 'f':
        case 'F':
        case 'e':
        case 'E':
        case 'g':
        case 'G':
        case 'a':
        case 'A':
            return kInteger | kFloating;
        case 's':
        case '@':
            return kText | kObject | kNull;
        case 'p':
            return kPointer | kObject | kNull;
        default:
            return 0u;
    }
}

// Widths and precisions beyond this are cut to it, so that no format can ask for gigabytes of padding.
inline constexpr int kMaxWidth = 4096;

// One parsed conversion. `end` is the offset just past it.
struct Conversion {
    bool ok = false;
    bool percent = false;  // "%%"
    bool leftAlign = false, plus = false, space = false, alternate = false, zeroPad = false;
    bool widthStar = false, precisionStar = false;
    int width = -1, precision = -1;
    int lengthBytes = 0;  // 0: none (int); 1, 2, 4, 8; 16 for L
    char conversion = 0;
    size_t end = 0;
};

// Parses the conversion that starts at text[start] == '%'. Shared by the compile-time check and the renderer.
constexpr Conversion parseConversion(std::string_view text, size_t start) {
    Conversion s;
    size_t i = start + 1;
    auto at = [&](size_t k) { return k < text.size() ? text[k] : '\0'; };
    if (at(i) == '{') {
        size_t close = text.find('}', i);
        if (close == std::string_view::npos) {
            s.end = text.size();
            return s;
        }
        i = close + 1;
    }
    for (;; ++i) {
        char c = at(i);
        if (c == '-')
            s.leftAlign = true;
        else if (c == '+')
            s.plus = true;
        else if (c == ' ')
            s.space = true;
        else if (c == '#')
            s.alternate = true;
        else if (c == '0')
            s.zeroPad = true;
        else
            break;
    }
    if (at(i) == '*') {
        s.widthStar = true;
        ++i;
    } else {
        while (at(i) >= '0' && at(i) <= '9') {
            s.width = (s.width < 0 ? 0 : s.width) * 10 + (at(i) - '0');
            if (s.width > kMaxWidth) s.width = kMaxWidth;
            ++i;
        }
    }
    if (at(i) == '.') {
        ++i;
        s.precision = 0;
        if (at(i) == '*') {
            s.precisionStar = true;
            ++i;
        } else {
            while (at(i) >= '0' && at(i) <= '9') {
                s.precision = s.precision * 10 + (at(i) - '0');
                if (s.precision > kMaxWidth) s.precision = kMaxWidth;
                ++i;
            }
        }
    }
    char c = at(i);
    if (c == 'h') {
        s.lengthBytes = at(i + 1) == 'h' ? 1 : 2;
        i += at(i + 1) == 'h' ? 2 : 1;
    } else if (c == 'l') {
        s.lengthBytes = 8;
        i += at(i + 1) == 'l' ? 2 : 1;
    } else if (c == 'q' || c == 'j' || c == 'z' || c == 't') {
        s.lengthBytes = 8;
        ++i;
    } else if (c == 'L') {
        s.lengthBytes = 16;
        ++i;
    }
    s.conversion = at(i);
    s.end = i < text.size() ? i + 1 : text.size();
    if (s.conversion == '%') {
        s.percent = true;
        s.ok = true;
        return s;
    }
    unsigned accepted = acceptedBy(s.conversion);
    if (accepted == 0) return s;
    // Length modifiers belong to numbers; "%ls" and "%lc" would mean wide characters, which we do not take.
    bool numeric = (accepted & (kInteger | kFloating)) != 0 && s.conversion != 'c';
    if (s.lengthBytes != 0 && !numeric) return s;
    if (s.lengthBytes == 16 && (accepted & kFloating) == 0) return s;
    s.ok = true;
    return s;
}

// Called only while checking a literal format at compile time: reaching one of these is the compiler's error
// message, so their names say what is wrong.
void format_has_a_malformed_conversion();
void format_argument_has_the_wrong_kind_for_its_conversion();
void format_has_more_conversions_than_arguments();
void format_has_more_arguments_than_conversions();
void format_width_or_precision_star_needs_an_integer();

template <class... Args>
consteval void checkFormat(const char* format) {
    if (format == nullptr) {
        if (sizeof...(Args) != 0) format_has_more_arguments_than_conversions();
        return;
    }
    constexpr unsigned kinds[] = {categoriesOf<Args>()..., 0u};
    std::string_view text(format);
    size_t next = 0;
    enum class Slot { Star, Value };
    auto take = [&](unsigned accepted, Slot slot) {
        if (next >= sizeof...(Args)) format_has_more_conversions_than_arguments();
        unsigned kind = kinds[next++];
        if (kind == 0 || (kind & ~accepted) != 0) {
            if (slot == Slot::Star) format_width_or_precision_star_needs_an_integer();
            format_argument_has_the_wrong_kind_for_its_conversion();
        }
    };
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') continue;
        Conversion s = parseConversion(text, i);
        if (!s.ok) format_has_a_malformed_conversion();
        i = s.end - 1;
        if (s.percent) continue;
        if (s.widthStar) take(kInteger, Slot::Star);
        if (s.precisionStar) take(kInteger, Slot::Star);
        take(acceptedBy(s.conversion), Slot::Value);
    }
    if (next != sizeof...(Args)) format_has_more_arguments_than_conversions();
}

}  // namespace format_detail

// A format text whose conversions have been checked against Args at compile time. A null text is allowed (it
// stands for "no message" where an API takes one) and takes no arguments.
template <class... Args>
class FormatString {
  public:
    consteval FormatString(const char* text) : text_(text) { format_detail::checkFormat<Args...>(text_); }

    constexpr const char* text() const { return text_; }

  private:
    const char* text_;
};

// One argument of a run-time format, holding a reference to (or the value of) what the caller passed. It must not
// outlive the expression that made it.
class FormatArg {
  public:
    enum class Kind : uint8_t { Signed, Unsigned, Real, Text, Object, Null, Pointer };

    template <class T>
    requires(!std::same_as<std::remove_cvref_t<T>, FormatArg>) FormatArg(const T& value) { assign(value); }

    Kind kind() const { return kind_; }
    // The name used in the markers of a mismatched argument: "integer", "string", ...
    const char* kindName() const;

    int64_t signedValue() const { return integer_.s; }
    uint64_t unsignedValue() const { return integer_.u; }
    // Width in bytes of an integer argument's own type.
    int integerBytes() const { return integerBytes_; }
    long double realValue() const { return real_; }
    std::string_view text() const { return text_; }
    // The address of an object or pointer argument.
    const void* address() const { return address_; }
    // The rendering of an Object argument (%@).
    std::string describe() const { return describe_(address_); }

  private:
    template <class T>
    static std::string describeAs(const void* p) {
        return describeObject(*static_cast<const T*>(p));
    }
    template <class T>
    static std::string describeVector(const void* p);

    static std::string describeObject(const Value& v);
    static std::string describeObject(const Error& e);
    static std::string describeObject(const Uuid& u);
    static std::string describeObject(const Date& d);
    template <format_detail::Describable T>
    requires(!std::same_as<T, Value> && !std::same_as<T, Error>) static std::string describeObject(const T& t) {
        return std::string(t.description());
    }

    void assignValue(const Value& v);

    template <class Raw>
    void assign(const Raw& value) {
        using T = std::decay_t<Raw>;
        if constexpr (std::same_as<T, bool>) {
            setUnsigned(value ? 1u : 0u, 1);
        } else if constexpr (std::is_enum_v<T>) {
            assign(static_cast<std::underlying_type_t<T>>(value));
        } else if constexpr (std::is_integral_v<T>) {
            if constexpr (std::is_signed_v<T>) {
                kind_ = Kind::Signed;
                integer_.s = value;
            } else {
                setUnsigned(value, sizeof(T));
            }
            integerBytes_ = sizeof(T);
        } else if constexpr (std::is_floating_point_v<T>) {
            kind_ = Kind::Real;
            real_ = value;
        } else if constexpr (std::same_as<T, const char*> || std::same_as<T, char*>) {
            const char* p = value;
            if (p == nullptr) {
                kind_ = Kind::Null;
            } else {
                kind_ = Kind::Text;
                text_ = p;
            }
        } else if constexpr (std::same_as<T, std::string> || std::same_as<T, std::string_view>) {
            kind_ = Kind::Text;
            text_ = value;
        } else if constexpr (std::same_as<T, std::nullptr_t> || std::same_as<T, std::nullopt_t>) {
            kind_ = Kind::Null;
        } else if constexpr (std::same_as<T, Value>) {
            assignValue(value);
        } else if constexpr (format_detail::isObjectType<T>()) {
            kind_ = Kind::Object;
            address_ = &value;
            describe_ = &describeAs<T>;
        } else if constexpr (format_detail::IsOptional<T>::value) {
            if (value)
                assign(*value);
            else
                kind_ = Kind::Null;
        } else if constexpr (format_detail::IsSharedPtr<T>::value) {
            if (value)
                assignPointee(value.get());
            else
                kind_ = Kind::Null;
        } else if constexpr (std::is_pointer_v<T>) {
            if (value == nullptr)
                kind_ = Kind::Null;
            else
                assignPointee(value);
        } else if constexpr (format_detail::IsVector<T>::value) {
            kind_ = Kind::Object;
            address_ = &value;
            describe_ = &describeVector<T>;
        } else {
            static_assert(sizeof(T) == 0, "this type cannot be a format argument");
        }
    }

    template <class E>
    void assignPointee(E* p) {
        using Plain = std::remove_cv_t<E>;
        if constexpr (std::same_as<Plain, Value>) {
            assignValue(*p);
        } else if constexpr (format_detail::isObjectType<Plain>()) {
            kind_ = Kind::Object;
            address_ = p;
            describe_ = &describeAs<Plain>;
        } else {
            kind_ = Kind::Pointer;
            address_ = const_cast<const void*>(static_cast<const volatile void*>(p));
        }
    }

    void setUnsigned(uint64_t v, int bytes) {
        kind_ = Kind::Unsigned;
        integer_.u = v;
        integerBytes_ = bytes;
    }

    Kind kind_ = Kind::Null;
    int integerBytes_ = 8;
    union {
        int64_t s;
        uint64_t u;
    } integer_{0};
    long double real_ = 0;
    std::string_view text_;
    const void* address_ = nullptr;
    std::string (*describe_)(const void*) = nullptr;
};

template <class T>
std::string FormatArg::describeVector(const void* p) {
    const T& items = *static_cast<const T*>(p);
    std::string out = "[";
    bool first = true;
    for (const auto& item : items) {
        if (!first) out += ", ";
        first = false;
        FormatArg arg(item);
        switch (arg.kind()) {
            case Kind::Text:
                out += arg.text();
                break;
            case Kind::Object:
                out += arg.describe();
                break;
            default:
                out += "(null)";
                break;
        }
    }
    out += "]";
    return out;
}

// Renders a format known only at run time. Never undefined behaviour: an argument of the wrong kind renders
// "<%d: string?>", a missing one "<%d: missing>", a malformed conversion "<bad conversion %k>", and arguments left
// over are listed at the end as " <unused arguments: N>".
std::string formatPrintfRuntime(std::string_view format, std::span<const FormatArg> args);

// Renders a literal format checked at compile time. A null format renders as the empty text.
template <class... Args>
std::string formatPrintf(FormatString<std::type_identity_t<Args>...> format, Args&&... args) {
    if (format.text() == nullptr) return {};
    if constexpr (sizeof...(Args) == 0) {
        return formatPrintfRuntime(format.text(), {});
    } else {
        const FormatArg packed[] = {FormatArg(args)...};
        return formatPrintfRuntime(format.text(), packed);
    }
}

}  // namespace bexil
