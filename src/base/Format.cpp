#include "base/Format.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>

#include "base/Error.h"
#include "bexil/Value.h"

// The renderer walks the format once. Numbers go through snprintf with a conversion we build ourselves from the
// parsed pieces and with an argument of exactly the type that conversion names, so flags, width and precision
// behave as every C programmer expects while the caller's argument types can be anything the compile-time check
// allowed. Text, objects and addresses are padded here.

namespace bexil {

using format_detail::Conversion;

const char* FormatArg::kindName() const {
    switch (kind_) {
        case Kind::Signed:
        case Kind::Unsigned:
            return "integer";
        case Kind::Real:
            return "real";
        case Kind::Text:
            return "string";
        case Kind::Object:
            return "object";
        case Kind::Null:
            return "null";
        case Kind::Pointer:
            return "pointer";
    }
    return "unknown";
}

std::string FormatArg::describeObject(const Value& v) {
    if (v.isString()) return std::string(v.stringView());
    if (v.isNull()) return "(null)";
    return v.description();
}
std::string FormatArg::describeObject(const Error& e) { return e.description(); }
std::string FormatArg::describeObject(const Uuid& u) { return u.string(); }
std::string FormatArg::describeObject(const Date& d) { return d.iso8601(); }

void FormatArg::assignValue(const Value& v) {
    if (v.isString()) {
        kind_ = Kind::Text;
        text_ = v.stringView();
    } else if (v.isNull()) {
        kind_ = Kind::Null;
    } else {
        kind_ = Kind::Object;
        address_ = &v;
        describe_ = &describeAs<Value>;
    }
}

namespace {

bool accepts(char conversion, FormatArg::Kind kind) {
    using K = FormatArg::Kind;
    unsigned category = 0;
    switch (kind) {
        case K::Signed:
        case K::Unsigned:
            category = format_detail::kInteger;
            break;
        case K::Real:
            category = format_detail::kFloating;
            break;
        case K::Text:
            category = format_detail::kText;
            break;
        case K::Object:
            category = format_detail::kObject;
            break;
        case K::Null:
            category = format_detail::kNull;
            break;
        case K::Pointer:
            category = format_detail::kPointer;
            break;
    }
    return (format_detail::acceptedBy(conversion) & category) != 0;
}

__attribute__((format(printf, 2, 3))) void appendPrintf(std::string& out, const char* directive, ...) {
    char small[128];
    va_list args;
    va_start(args, directive);
    int n = vsnprintf(small, sizeof small, directive, args);
    va_end(args);
    if (n < 0) return;
    if (static_cast<size_t>(n) < sizeof small) {
        out.append(small, static_cast<size_t>(n));
        return;
    }
    size_t at = out.size();
    out.resize(at + static_cast<size_t>(n) + 1);
    va_start(args, directive);
    vsnprintf(out.data() + at, static_cast<size_t>(n) + 1, directive, args);
    va_end(args);
    out.resize(at + static_cast<size_t>(n));
}

// "%-08.3" and so on, without the length modifier and conversion; width and precision already resolved.
std::string numericDirective(const Conversion& s, int width, int precision) {
    std::string directive = "%";
    if (s.leftAlign) directive += '-';
    if (s.plus) directive += '+';
    if (s.space) directive += ' ';
    if (s.alternate) directive += '#';
    if (s.zeroPad) directive += '0';
    if (width >= 0) directive += std::to_string(width);
    if (precision >= 0) directive += "." + std::to_string(precision);
    return directive;
}

void pad(std::string& out, std::string_view text, int width, bool leftAlign) {
    size_t fill = width > 0 && static_cast<size_t>(width) > text.size() ? static_cast<size_t>(width) - text.size() : 0;
    if (!leftAlign) out.append(fill, ' ');
    out.append(text);
    if (leftAlign) out.append(fill, ' ');
}

// Cuts text to at most `bytes` bytes without splitting a UTF-8 sequence.
std::string_view clip(std::string_view text, size_t bytes) {
    if (text.size() <= bytes) return text;
    size_t end = bytes;
    while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;
    return text.substr(0, end);
}

int effectiveBytes(const FormatArg& arg, const Conversion& s) {
    int length = s.lengthBytes == 0 ? 4 : std::min(s.lengthBytes, 8);
    return std::max(arg.integerBytes(), length);
}

int64_t asSigned(const FormatArg& arg, int bytes) {
    if (arg.kind() == FormatArg::Kind::Signed) return arg.signedValue();
    uint64_t u = arg.unsignedValue();
    switch (bytes) {
        case 1:
            return static_cast<int8_t>(static_cast<uint8_t>(u));
        case 2:
            return static_cast<int16_t>(static_cast<uint16_t>(u));
        case 4:
            return static_cast<int32_t>(static_cast<uint32_t>(u));
        default:
            return static_cast<int64_t>(u);
    }
}

uint64_t asUnsigned(const FormatArg& arg, int bytes) {
    if (arg.kind() == FormatArg::Kind::Unsigned) return arg.unsignedValue();
    int64_t s = arg.signedValue();
    switch (bytes) {
        case 1:
            return static_cast<uint8_t>(s);
        case 2:
            return static_cast<uint16_t>(s);
        case 4:
            return static_cast<uint32_t>(s);
        default:
            return static_cast<uint64_t>(s);
    }
}

void renderOne(std::string& out, const Conversion& s, const FormatArg& arg, int width, int precision, bool leftAlign) {
    Conversion directive = s;
    directive.leftAlign = leftAlign;
    switch (s.conversion) {
        case 'd':
        case 'i':
            appendPrintf(out, (numericDirective(directive, width, precision) + "lld").c_str(),
                         static_cast<long long>(asSigned(arg, effectiveBytes(arg, s))));
            return;
        case 'u':
        case 'x':
        case 'X':
        case 'o':
            appendPrintf(out, (numericDirective(directive, width, precision) + "ll" + s.conversion).c_str(),
                         static_cast<unsigned long long>(asUnsigned(arg, effectiveBytes(arg, s))));
            return;
        case 'c': {
            char c = static_cast<char>(asUnsigned(arg, 1));
            pad(out, std::string_view(&c, 1), width, leftAlign);
            return;
        }
        case 'f':
        case 'F':
        case 'e':
        case 'E':
        case 'g':
        case 'G':
        case 'a':
        case 'A': {
            long double v = arg.kind() == FormatArg::Kind::Real     ? arg.realValue()
                            : arg.kind() == FormatArg::Kind::Signed ? static_cast<long double>(arg.signedValue())
                                                                    : static_cast<long double>(arg.unsignedValue());
            appendPrintf(out, (numericDirective(directive, width, precision) + "L" + s.conversion).c_str(), v);
            return;
        }
        case 'p': {
            std::string text = "0x0";
            if (arg.kind() != FormatArg::Kind::Null) {
                text.clear();
                appendPrintf(text, "%#llx",
                             static_cast<unsigned long long>(reinterpret_cast<uintptr_t>(arg.address())));
                if (arg.address() == nullptr) text = "0x0";
            }
            pad(out, text, width, leftAlign);
            return;
        }
        default: {  // 's' and '@'
            std::string owned;
            std::string_view text;
            switch (arg.kind()) {
                case FormatArg::Kind::Text:
                    text = arg.text();
                    break;
                case FormatArg::Kind::Null:
                    text = "(null)";
                    break;
                default:
                    owned = arg.describe();
                    text = owned;
                    break;
            }
            if (precision >= 0) text = clip(text, static_cast<size_t>(precision));
            pad(out, text, width, leftAlign);
            return;
        }
    }
}

}  // namespace

std::string formatPrintfRuntime(std::string_view format, std::span<const FormatArg> args) {
    std::string out;
    out.reserve(format.size() + 16 * args.size());
    size_t next = 0;
    size_t i = 0;
    while (i < format.size()) {
        size_t percent = format.find('%', i);
        if (percent == std::string_view::npos) {
            out.append(format.substr(i));
            break;
        }
        out.append(format.substr(i, percent - i));
        Conversion s = format_detail::parseConversion(format, percent);
        std::string_view written = format.substr(percent, s.end - percent);
        i = s.end;
        if (!s.ok) {
            out += "<bad conversion ";
            out += written;
            out += '>';
            continue;
        }
        if (s.percent) {
            out += '%';
            continue;
        }
        // Width and precision given as "*" come from integer arguments before the value, as in printf.
        int width = s.width, precision = s.precision;
        bool leftAlign = s.leftAlign;
        bool broken = false;
        enum class Star { Width, Precision };
        auto star = [&](int& into, Star which) {
            if (next >= args.size()) {
                broken = true;
                return;
            }
            const FormatArg& a = args[next++];
            if (a.kind() != FormatArg::Kind::Signed && a.kind() != FormatArg::Kind::Unsigned) {
                broken = true;
                return;
            }
            // Clamped first, so that negating the most negative value cannot overflow.
            int64_t v = a.kind() == FormatArg::Kind::Signed
                            ? std::clamp<int64_t>(a.signedValue(), -format_detail::kMaxWidth, format_detail::kMaxWidth)
                            : static_cast<int64_t>(std::min<uint64_t>(a.unsignedValue(), format_detail::kMaxWidth));
            if (which == Star::Width && v < 0) {
                leftAlign = true;
                v = -v;
            }
            into = v < 0 ? -1 : static_cast<int>(v);
        };
        if (s.widthStar) star(width, Star::Width);
        if (s.precisionStar) star(precision, Star::Precision);
        if (next >= args.size()) {
            out += '<';
            out += written;
            out += ": missing>";
            continue;
        }
        const FormatArg& arg = args[next++];
        if (broken || !accepts(s.conversion, arg.kind())) {
            out += '<';
            out += written;
            out += ": ";
            out += broken ? "bad width" : arg.kindName();
            out += "?>";
            continue;
        }
        renderOne(out, s, arg, width, precision, leftAlign);
    }
    if (next < args.size()) out += " <unused arguments: " + std::to_string(args.size() - next) + ">";
    return out;
}

}  // namespace bexil
