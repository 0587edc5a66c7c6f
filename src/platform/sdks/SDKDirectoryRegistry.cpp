#include "platform/sdks/SDKDirectoryRegistry.h"

// SDK directories belong to the system's packages and its administrator, but the names looked up in them come from
// plug-ins' own information dictionaries, that is from whoever wrote a bundle. So a name is taken only when it is a
// plain file name (no "/", not "." or ".."), and a document is read only when it is a regular file inside its
// directory: a symbolic link is followed when it leads to a file inside the same directory (an alias for another
// extension point's SDK) and refused when it leads anywhere else, so that a link cannot make the registry hand a
// plug-in the contents of an arbitrary file.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <string>

#include "base/Document.h"
#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

constexpr const char* kSDKDirectoryVariable = "BX_SDK_DIR";
constexpr const char* kAdministratorDirectory = "/etc/bexil/sdks";
constexpr const char* kVendorDirectory = "/usr/share/bexil/sdks";

Error sdkError(std::string message) { return BXError(ErrorCode::OperationFailed, std::move(message)); }

std::optional<Error> checkName(std::string_view name) {
    bool valid = !name.empty() && name.size() <= SDKDirectoryRegistry::kMaxSDKNameLength && name != "." &&
                 name != ".." && name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
    if (valid) return std::nullopt;
    // The name is shown as a description so that control characters or a NUL cannot garble the log line.
    return sdkError("invalid SDK name " +
                    Value::string(name.substr(0, SDKDirectoryRegistry::kMaxSDKNameLength)).description());
}

std::optional<std::string> realPath(const fs::path& path) {
    char buffer[PATH_MAX];
    if (::realpath(path.c_str(), buffer) == nullptr) return std::nullopt;
    return std::string(buffer);
}

// Reads at most kMaxSDKDocumentBytes + 1 bytes, so that a file that grows while it is read is still caught.
Result<Value> readDocument(int fd, const struct stat& st, const fs::path& file) {
    if (!S_ISREG(st.st_mode)) return sdkError(file.string() + " is not a regular file");
    constexpr size_t kLimit = SDKDirectoryRegistry::kMaxSDKDocumentBytes;
    if (static_cast<uint64_t>(st.st_size) > kLimit) {
        log::ops().error("sdk document %{public}@ is larger than %zu bytes", file.string(), kLimit);
        return sdkError(file.string() + " is larger than the SDK document size limit");
    }
    std::string text(static_cast<size_t>(st.st_size) + 1, '\0');
    size_t done = 0;
    for (;;) {
        if (done == text.size()) {
            if (text.size() > kLimit) break;
            text.resize(std::min(kLimit + 1, text.size() + 4096));
        }
        ssize_t got = ::read(fd, text.data() + done, text.size() - done);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return posixError(errno, "cannot read " + file.string());
        if (got == 0) break;
        done += static_cast<size_t>(got);
    }
    if (done > kLimit) {
        log::ops().error("sdk document %{public}@ is larger than %zu bytes", file.string(), kLimit);
        return sdkError(file.string() + " is larger than the SDK document size limit");
    }
    text.resize(done);
    Result<Value> document = Document::read(text);
    if (!document)
        return sdkError(file.string() + " is malformed: " + document.error().localizedDescription().value_or(""));
    if (!document->isDictionary()) return sdkError(file.string() + " does not hold a dictionary");
    return document;
}

}  // namespace

std::vector<fs::path> SDKDirectoryRegistry::defaultDirectories() {
    if (const char* dir = std::getenv(kSDKDirectoryVariable); dir != nullptr && *dir != '\0') return {fs::path(dir)};
    return {fs::path(kAdministratorDirectory), fs::path(kVendorDirectory)};
}

SDKDirectoryRegistry::SDKDirectoryRegistry(std::vector<fs::path> directories) : directories_(std::move(directories)) {}

Result<std::optional<Value>> SDKDirectoryRegistry::readSDKEntry(std::string_view name, fs::path* foundAt) const {
    if (auto error = checkName(name)) return *error;
    const std::string fileName = std::string(name) + std::string(kDocumentSuffix);
    for (const fs::path& directory : directories_) {
        const fs::path file = directory / fileName;
        struct stat st {};
        if (::lstat(file.c_str(), &st) != 0) {
            // A missing file or directory simply registers nothing here; look further down.
            if (errno == ENOENT || errno == ENOTDIR) continue;
            return posixError(errno, "cannot look at " + file.string());
        }
        if (foundAt != nullptr) *foundAt = file;

        fs::path target = file;
        if (S_ISLNK(st.st_mode)) {
            std::optional<std::string> realDirectory = realPath(directory);
            std::optional<std::string> realTarget = realPath(file);
            if (!realDirectory || !realTarget)
                return sdkError(file.string() + " is a symbolic link that leads nowhere");
            std::string inside = *realDirectory == "/" ? "/" : *realDirectory + "/";
            if (!realTarget->starts_with(inside))
                return sdkError(file.string() + " is a symbolic link that leads outside " + directory.string() +
                                " (to " + *realTarget + "); refused");
            target = *realTarget;
        }
        // O_NOFOLLOW: a file swapped for a link after the check above is refused rather than followed.
        UniqueFd fd(::open(target.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
        if (!fd) return posixError(errno, "cannot open " + file.string());
        struct stat opened {};
        if (::fstat(fd.get(), &opened) != 0) return posixError(errno, "cannot stat " + file.string());
        Result<Value> document = documentOf(fd.get(), opened, file);
        if (!document) return document.error();
        return std::optional<Value>(*document);
    }
    return std::optional<Value>();
}

static bool sameTime(const timespec& a, const timespec& b) { return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec; }

Result<Value> SDKDirectoryRegistry::documentOf(int fd, const struct stat& st, const fs::path& file) const {
    const std::string key = file.string();
    {
        std::lock_guard<std::mutex> guard(keptMutex_);
        auto found = kept_.find(key);
        if (found != kept_.end()) {
            const Kept& k = found->second;
            if (k.device == st.st_dev && k.inode == st.st_ino && k.size == st.st_size &&
                sameTime(k.modified, st.st_mtim) && sameTime(k.changed, st.st_ctim))
                return k.document;
        }
    }
    // Parsed outside the lock: another thread's look-up of another SDK need not wait for this one.
    Result<Value> document = readDocument(fd, st, file);
    std::lock_guard<std::mutex> guard(keptMutex_);
    if (!document) {
        kept_.erase(key);
        return document;
    }
    if (kept_.size() >= kMaxCachedDocuments && !kept_.contains(key)) {
        log::ops().notice("sdk documents kept reached %zu; dropping them all and reading afresh", kMaxCachedDocuments);
        kept_.clear();
    }
    kept_.insert_or_assign(key, Kept{st.st_dev, st.st_ino, st.st_size, st.st_mtim, st.st_ctim, *document});
    return document;
}

std::optional<Value> SDKDirectoryRegistry::copySDKEntry(std::string_view name) const {
    Result<std::optional<Value>> entry = readSDKEntry(name);
    if (!entry) {
        log::ops().error("sdk %{public}@ cannot be used: %{public}@", Value::string(name).description(256),
                         entry.error().localizedDescription().value_or(""));
        return std::nullopt;
    }
    return *entry;
}

}  // namespace bexil
