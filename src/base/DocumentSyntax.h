#pragma once

// What the document reader and writer share (base-internal): the format's names, its text rules (XML characters,
// character references, base64 data, reals) and the pieces of its error messages. Pure functions; any thread.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/Error.h"

namespace bexil::document_detail {

inline constexpr std::string_view kRootName = "vrec";
inline constexpr std::string_view kFormatVersion = "1";
inline constexpr size_t kSnippetLength = 40;

// An error in the document domain.
Error documentError(int code, std::string message);
// A short, printable, quoted excerpt of text for an error message.
std::string snippet(std::string_view text);

// One step from a container to a value in it, kept cheap while all goes well and spelled out only for errors.
struct PathStep {
    std::string_view key;  // the dictionary key, when index is npos
    size_t index = std::string_view::npos;
};
// "root[\"key\"][3]".
std::string pathText(const std::vector<PathStep>& steps);

bool isXmlWhitespace(char c);
std::string_view trimmed(std::string_view s);
bool isXmlChar(uint32_t c);

// Where text stops being UTF-8 made of XML characters.
struct TextFault {
    size_t offset;
    bool invalidUtf8;
    uint32_t character;  // when the encoding is fine but the character is not allowed

    std::string describe() const;
};
std::optional<TextFault> findTextFault(std::string_view s);
// Character references must each name an XML character.
std::optional<Error> checkCharacterReferences(std::string_view text);
// The base64 text of a <data> element, or the reason it is not base64.
std::variant<std::vector<uint8_t>, std::string> decodeDataText(std::string_view text);

std::optional<double> parseReal(std::string_view s);
void appendReal(std::string& out, double d);

}  // namespace bexil::document_detail
