#include "platform/types/TypeRegistry.h"

#include <sys/stat.h>

#include <cstdlib>
#include <deque>
#include <fstream>
#include <sstream>
#include <unordered_map>
#include <unordered_set>
#include <utility>

#include "base/StandardPaths.h"
#include "platform/log/Log.h"

namespace bexil {

namespace {

constexpr std::string_view kTextPlain = "text/plain";
constexpr std::string_view kOctetStream = "application/octet-stream";

std::string lowerAscii(std::string_view text) {
    std::string out(text);
    for (char& c : out) {
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    }
    return out;
}

// "media/subtype" with both halves present: only such names take part in the implicit text/plain and
// application/octet-stream parents, so an arbitrary string is not taken for a binary type.
bool isMediaType(std::string_view type) {
    size_t slash = type.find('/');
    return slash != std::string_view::npos && slash > 0 && slash + 1 < type.size() &&
           type.find('/', slash + 1) == std::string_view::npos;
}

// The two whitespace-separated fields of a line, lower-cased; false for blank lines, comments and lines with any
// other number of fields.
bool splitPair(std::string_view line, std::string& first, std::string& second) {
    std::istringstream stream{std::string(line)};
    std::string a, b, extra;
    if (!(stream >> a >> b) || (stream >> extra)) return false;
    if (a.empty() || a[0] == '#') return false;
    first = lowerAscii(a);
    second = lowerAscii(b);
    return true;
}

}  // namespace

struct TypeRegistry::FileStamp {
    std::filesystem::path path;
    bool exists = false;
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    int64_t mtimeNanoseconds = 0;

    bool operator==(const FileStamp&) const = default;
};

struct TypeRegistry::Snapshot {
    std::vector<FileStamp> stamps;
    std::unordered_map<std::string, std::string> aliases;
    std::unordered_map<std::string, std::vector<std::string>> parents;

    std::string canonical(std::string_view type) const {
        std::string lower = lowerAscii(type);
        auto it = aliases.find(lower);
        return it == aliases.end() ? lower : it->second;
    }
};

TypeRegistry::TypeRegistry(std::vector<std::filesystem::path> dataDirs, std::chrono::milliseconds recheckInterval)
    : dataDirs_(std::move(dataDirs)), recheckInterval_(recheckInterval) {}

TypeRegistry::~TypeRegistry() = default;

std::vector<std::filesystem::path> TypeRegistry::defaultDataDirs() { return dataDirectories(); }

TypeRegistry& TypeRegistry::shared() {
    static TypeRegistry* registry = new TypeRegistry(defaultDataDirs());  // never destroyed: used until exit
    return *registry;
}

std::vector<TypeRegistry::FileStamp> TypeRegistry::stampFiles() const {
    std::vector<FileStamp> stamps;
    for (const auto& dir : dataDirs_) {
        for (const char* name : {"aliases", "subclasses"}) {
            FileStamp stamp;
            stamp.path = dir / "mime" / name;
            struct stat info {};
            if (::stat(stamp.path.c_str(), &info) == 0) {
                stamp.exists = true;
                stamp.device = info.st_dev;
                stamp.inode = info.st_ino;
                stamp.size = info.st_size;
                stamp.mtimeNanoseconds = static_cast<int64_t>(info.st_mtim.tv_sec) * 1000000000 + info.st_mtim.tv_nsec;
            }
            stamps.push_back(std::move(stamp));
        }
    }
    return stamps;
}

std::shared_ptr<const TypeRegistry::Snapshot> TypeRegistry::load(std::vector<FileStamp> stamps) const {
    auto snapshot = std::make_shared<Snapshot>();
    std::unordered_map<std::string, std::unordered_set<std::string>> seenParents;
    for (const auto& stamp : stamps) {
        if (!stamp.exists) continue;
        if (stamp.size < 0 || static_cast<uintmax_t>(stamp.size) > kMaxFileBytes) {
            log::ops().error("type registry: %{public}s exceeds %llu bytes; not read", stamp.path.string(),
                             static_cast<unsigned long long>(kMaxFileBytes));
            continue;
        }
        std::ifstream in(stamp.path);
        if (!in) continue;
        bool isAliases = stamp.path.filename() == "aliases";
        std::string line, first, second;
        while (std::getline(in, line)) {
            if (!splitPair(line, first, second)) continue;
            if (isAliases) {
                snapshot->aliases.try_emplace(first, second);  // earlier directories win
            } else if (seenParents[first].insert(second).second) {
                snapshot->parents[first].push_back(second);
            }
        }
    }
    snapshot->stamps = std::move(stamps);
    return snapshot;
}

std::shared_ptr<const TypeRegistry::Snapshot> TypeRegistry::current() const {
    auto now = std::chrono::steady_clock::now();
    std::shared_ptr<const Snapshot> snapshot;
    {
        std::lock_guard<std::mutex> guard(mutex_);
        snapshot = snapshot_;
        if (snapshot && now - lastCheck_ < recheckInterval_) return snapshot;
        lastCheck_ = now;
    }
    // Stat and read outside the lock; two threads that find a change at once both load and the later one wins,
    // which is harmless since they read the same files.
    auto stamps = stampFiles();
    if (snapshot && snapshot->stamps == stamps) return snapshot;
    auto fresh = load(std::move(stamps));
    std::lock_guard<std::mutex> guard(mutex_);
    snapshot_ = fresh;
    return fresh;
}

std::string TypeRegistry::canonicalType(std::string_view type) const { return current()->canonical(type); }

bool TypeRegistry::conformsTo(std::string_view type, std::string_view other) const {
    if (type.empty() || other.empty()) return false;
    auto snapshot = current();
    const std::string start = snapshot->canonical(type);
    const std::string target = snapshot->canonical(other);
    if (start == target) return true;

    // Breadth-first over the declared parents; the visited set is what keeps a cyclic database from looping.
    std::unordered_set<std::string> visited{start};
    std::deque<std::string> queue{start};
    auto visit = [&](std::string name) {
        if (visited.insert(name).second) queue.push_back(std::move(name));
    };
    while (!queue.empty()) {
        if (visited.size() > kMaxTypesVisited) {
            log::ops().error("type registry: gave up on %{public}s after %zu types", start, kMaxTypesVisited);
            return false;
        }
        std::string current = std::move(queue.front());
        queue.pop_front();
        if (current == target) return true;
        if (auto it = snapshot->parents.find(current); it != snapshot->parents.end()) {
            for (const auto& parent : it->second) visit(snapshot->canonical(parent));
        }
        if (isMediaType(current)) {
            if (current.starts_with("text/") && current != kTextPlain) visit(std::string(kTextPlain));
            if (!current.starts_with("inode/") && current != kOctetStream) visit(std::string(kOctetStream));
        }
    }
    return false;
}

}  // namespace bexil
