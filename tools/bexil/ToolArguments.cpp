#include "ToolArguments.h"

#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "base/Document.h"
#include "client/JsonText.h"
#include "platform/prefs/PreferencesStore.h"

namespace bexil::tool {

namespace fs = std::filesystem;

namespace {

// Rule files are small; anything larger is a mistake (a wrong file name), not a rule set.
constexpr uintmax_t kMaxRuleFileBytes = 4 * 1024 * 1024;

struct NamedFlag {
    const char* name;
    uint64_t bit;
};
constexpr std::array<NamedFlag, 4> kDiscoveryFlags = {{
    {"all-versions", protocol::discover::kAllVersions},
    {"all-instances", protocol::discover::kAllInstances},
    {"system-only", protocol::discover::kSystemOnly},
    {"all", protocol::discover::kAll},
}};

}  // namespace

int exitStatusForCode(int64_t code) { return code >= 1 && code <= 63 ? static_cast<int>(code) : 1; }

Result<std::vector<Uuid>> parseUuids(const std::vector<std::string>& texts) {
    std::vector<Uuid> uuids;
    for (const std::string& text : texts) {
        auto uuid = Uuid::parse(text);
        if (!uuid)
            return BXError(ErrorCode::InvalidRequest,
                           "not a UUID: \"" + text + "\" (expected 8-4-4-4-12 hexadecimal digits)");
        uuids.push_back(*uuid);
    }
    return uuids;
}

Result<Value> plugInArgument(const std::string& text) {
    if (text.empty()) return BXError(ErrorCode::InvalidRequest, "--plugin needs an identifier, a UUID or a path");
    if (text.find('/') == std::string::npos || text.front() == '/') return Value::string(text);
    std::error_code error;
    fs::path absolute = fs::absolute(text, error);
    if (error) return BXError(ErrorCode::InvalidRequest, "cannot make \"" + text + "\" an absolute path");
    return Value::string(absolute.lexically_normal().string());
}

Result<Value> absolutePaths(const std::vector<std::string>& texts) {
    MutableArray paths;
    for (const std::string& text : texts) {
        if (text.empty() || text.front() != '/') return BXError(ErrorCode::BadPath, "absolute path required: " + text);
        paths.append(Value::string(text));
    }
    return paths.take();
}

Result<Value> rulesFromArguments(const std::vector<std::string>& arguments) {
    MutableDictionary rules;
    for (const std::string& argument : arguments) {
        size_t eq = argument.find('=');
        if (eq == std::string::npos || eq == 0)
            return BXError(ErrorCode::InvalidRequest, "rule \"" + argument + "\" is not KEY=PATTERN");
        std::string key = argument.substr(0, eq);
        if (rules.find(key) != nullptr)
            return BXError(ErrorCode::InvalidRequest, "rule key \"" + key + "\" given twice");
        rules.set(key, Value::string(argument.substr(eq + 1)));
    }
    return rules.take();
}

Result<Value> readDictionaryFile(const fs::path& path) {
    std::error_code ec;
    uintmax_t size = fs::file_size(path, ec);
    if (ec) return BXError(ErrorCode::InvalidRequest, "cannot read " + path.string() + ": " + ec.message());
    if (size > kMaxRuleFileBytes)
        return BXError(ErrorCode::InvalidRequest, "cannot read " + path.string() + ": larger than " +
                                                      std::to_string(kMaxRuleFileBytes) + " bytes");
    Result<Value> value = BXError(ErrorCode::InvalidRequest, "");
    if (path.extension() == ".vrec") {
        value = Document::readFile(path);
    } else {
        std::ifstream in(path, std::ios::binary);
        if (!in)
            return BXError(ErrorCode::InvalidRequest, "cannot read " + path.string() + ": " + std::strerror(errno));
        std::stringstream text;
        text << in.rdbuf();
        value = parseJson(text.str());
    }
    if (!value) {
        return BXError(ErrorCode::InvalidRequest,
                       path.string() + ": " + value.error().localizedDescription().value_or("unreadable"));
    }
    if (!value->isDictionary()) return BXError(ErrorCode::InvalidRequest, path.string() + ": not a dictionary");
    return value;
}

Result<uint64_t> discoveryFlags(const std::vector<std::string>& names) {
    uint64_t flags = 0;
    for (const std::string& name : names) {
        bool known = false;
        for (const NamedFlag& flag : kDiscoveryFlags) {
            if (name == flag.name) {
                flags |= flag.bit;
                known = true;
            }
        }
        if (!known)
            return BXError(ErrorCode::InvalidRequest, "unknown discovery flag \"" + name +
                                                          "\" (known: all-versions, all-instances, system-only, all)");
    }
    return flags;
}

fs::path preferencesFile() { return PreferencesStore().fileForDomain(kUserPrefsDomain); }

std::optional<Error> validateExclusions(const Value& rules) {
    if (!rules.isArray()) return BXError(ErrorCode::InvalidRequest, "exclusions must be an array of rule dictionaries");
    size_t index = 0;
    for (const Value& rule : rules.items()) {
        if (!rule.isDictionary())
            return BXError(ErrorCode::InvalidRequest,
                           "exclusion " + std::to_string(index) + " is not a rule dictionary");
        ++index;
    }
    return std::nullopt;
}

}  // namespace bexil::tool
