#pragma once
// PROVISIONAL: replaced by the real printf-style formatter before this lands.
#include <string>
#include <type_traits>
namespace bexil {
template <typename... Args>
class FormatString {
public:
    constexpr FormatString(const char* text) : text_(text) {}
    constexpr const char* text() const { return text_; }
private:
    const char* text_;
};
template <typename... Args>
std::string formatPrintf(FormatString<std::type_identity_t<Args>...> format, Args&&...) { return format.text(); }
}  // namespace bexil
