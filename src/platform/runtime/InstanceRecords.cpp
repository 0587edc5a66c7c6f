#include "platform/runtime/InstanceRecords.h"

#include <unistd.h>

#include <cstdint>
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

static constexpr std::string_view kSandboxLine = "sandbox";

bool InstanceRecords::record(const std::string& bundleIdentifier, pid_t pid, std::optional<pid_t> sandbox) const {
    if (!safeComponent(bundleIdentifier)) return false;
    std::optional<unsigned long long> started = startTime(pid);
    if (!started) return false;
    std::error_code ec;
    fs::create_directories(directory_ / bundleIdentifier, ec);
    std::ofstream out(directory_ / bundleIdentifier / std::to_string(pid));
    out << *started << "\n";
    if (sandbox) {
        // A sandbox that has already gone needs no line; the instance record is still worth keeping.
        if (std::optional<unsigned long long> sandboxStarted = startTime(*sandbox))
            out << kSandboxLine << " " << *sandbox << " " << *sandboxStarted << "\n";
    }
    return static_cast<bool>(out);
}

std::vector<InstanceRecords::Sandboxed> InstanceRecords::sandboxed() const {
    std::vector<Sandboxed> found;
    std::error_code ec;
    for (const auto& bundle : fs::directory_iterator(directory_, ec)) {
        const std::string bundleIdentifier = bundle.path().filename().string();
        if (!safeComponent(bundleIdentifier) || !bundle.is_directory(ec)) continue;
        std::error_code inner;
        for (const auto& entry : fs::directory_iterator(bundle.path(), inner)) {
            const std::string name = entry.path().filename().string();
            char* end = nullptr;
            long pid = std::strtol(name.c_str(), &end, 10);
            if (name.empty() || *end != '\0' || pid <= 0 || pid > INT32_MAX) continue;
            std::ifstream in(entry.path());
            unsigned long long started = 0, sandboxStarted = 0;
            long sandbox = 0;
            std::string word;
            if (!(in >> started >> word >> sandbox >> sandboxStarted) || word != kSandboxLine || sandbox <= 0 ||
                sandbox > INT32_MAX)
                continue;
            found.push_back(Sandboxed{bundleIdentifier, Instance{static_cast<pid_t>(pid), entry.path(), started},
                                      static_cast<pid_t>(sandbox), sandboxStarted});
        }
    }
    return found;
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
