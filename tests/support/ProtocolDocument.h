// docs/protocol.md is what clients in other languages are written against, so tests read it as such a client
// would: its text, and the bytes of its "```hex NAME" blocks.
#pragma once

#include <cstdint>
#include <fstream>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

namespace bexil::test {

inline std::string protocolDocument() {
    std::ifstream in(std::string(BEXIL_SOURCE_DIR) + "/docs/protocol.md");
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

// Bytes written as two-digit hexadecimal numbers separated by white space.
inline std::vector<uint8_t> hexBytes(std::string_view text) {
    std::vector<uint8_t> out;
    std::istringstream in{std::string(text)};
    std::string byte;
    while (in >> byte) out.push_back(static_cast<uint8_t>(std::stoul(byte, nullptr, 16)));
    return out;
}

// The bytes of the "```hex NAME" block of docs/protocol.md; annotations after '#' are ignored.
inline std::vector<uint8_t> documentedBytes(const std::string& name) {
    std::istringstream in(protocolDocument());
    std::string line, text;
    bool inside = false;
    while (std::getline(in, line)) {
        if (!inside) {
            inside = line == "```hex " + name;
            continue;
        }
        if (line.starts_with("```")) break;
        text += line.substr(0, line.find('#')) + " ";
    }
    return hexBytes(text);
}

}  // namespace bexil::test
