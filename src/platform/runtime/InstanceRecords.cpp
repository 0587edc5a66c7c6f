#include "platform/runtime/InstanceRecords.h"

#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>

#include "base/StandardPaths.h"

namespace bexil {

namespace fs = std::filesystem;

fs::path InstanceRecords::runtimeDirectory() { return bexil::runtimeDirectory(); }

std::string_view InstanceRecords::folderOf(Kind kind) { return kind == Kind::Running ? "instances" : "assertions"; }

InstanceRecords::InstanceRecords(Kind kind, fs::path runtimeDir) : directory_(runtimeDir / folderOf(kind)) {}

std::optional<unsigned long long> InstanceRecords::startTime(pid_t pid) { return statField(pid, 22); }

std::optional<unsigned long long> InstanceRecords::statField(pid_t pid, int index) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string stat;
    if (!std::getline(in, stat)) return std::nullopt;
    // The command name (field 2) may contain spaces and parentheses; the fields after it follow the last ')'.
    size_t close = stat.rfind(')');
    if (close == std::string::npos) return std::nullopt;
    std::istringstream fields(stat.substr(close + 2));
    std::string field;
    for (int at = 3; fields >> field; ++at) {
        if (at == index) return std::strtoull(field.c_str(), nullptr, 10);
    }
    return std::nullopt;
}

// A bundle identifier names one folder: nothing that could climb out of the runtime directory.
static bool safeComponent(const std::string& name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos;
}

bool InstanceRecords::record(const std::string& bundleIdentifier, pid_t pid) const {
    if (!safeComponent(bundleIdentifier)) return false;
    std::optional<unsigned long long> started = startTime(pid);
    if (!started) return false;
    std::error_code ec;
    fs::create_directories(directory_ / bundleIdentifier, ec);
    std::ofstream out(directory_ / bundleIdentifier / std::to_string(pid));
    out << *started << "\n";
    return static_cast<bool>(out);
}

std::vector<InstanceRecords::Instance> InstanceRecords::live(const std::string& bundleIdentifier) const {
    std::vector<Instance> found;
    if (!safeComponent(bundleIdentifier)) return found;
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(directory_ / bundleIdentifier, ec)) {
        const std::string name = entry.path().filename().string();
        char* end = nullptr;
        long pid = std::strtol(name.c_str(), &end, 10);
        if (name.empty() || *end != '\0' || pid <= 0) continue;
        std::ifstream in(entry.path());
        unsigned long long recorded = 0;
        in >> recorded;
        std::optional<unsigned long long> started = startTime(static_cast<pid_t>(pid));
        if (!in || !started || *started != recorded) {
            fs::remove(entry.path(), ec);  // the process is gone, or its pid now names another one
            continue;
        }
        found.push_back(Instance{static_cast<pid_t>(pid), entry.path(), recorded});
    }
    return found;
}

}  // namespace bexil
