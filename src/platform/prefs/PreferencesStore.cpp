#include "platform/prefs/PreferencesStore.h"

// Readers are many (the daemon reads its exclusions on every discovery request) and writers are rare (an
// administrator or the bexil tool). So a read costs one stat() when nothing changed, and a change is detected by
// the file's identity: writers always replace the file by renaming a fresh one over it, which gives it a new inode
// and new times, so the identity changes even when the size does not. Parsing happens outside the lock; two threads
// that see the same change may both parse it, and the later one simply stores the same answer again.

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "base/Document.h"
#include "base/StandardPaths.h"
#include "base/UniqueFd.h"
#include "platform/log/Log.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

int64_t nanoseconds(const struct timespec& time) {
    return static_cast<int64_t>(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
}

// Closes a descriptor when the scope ends.
}  // namespace

fs::path PreferencesStore::defaultDirectory() { return preferencesDirectory(); }

std::string PreferencesStore::currentHostName() {
    std::array<char, 256> host{};
    if (gethostname(host.data(), host.size() - 1) != 0 || host[0] == '\0') return "localhost";
    std::string name(host.data());
    for (char& c : name)
        if (c == '/') c = '_';
    return name;
}

PreferencesStore& PreferencesStore::shared() {
    static PreferencesStore* store = new PreferencesStore();  // never destroyed: readers may run during exit
    return *store;
}

PreferencesStore::PreferencesStore(fs::path directory, std::string hostName)
    : directory_(std::move(directory)), hostName_(std::move(hostName)) {}

fs::path PreferencesStore::fileForDomain(std::string_view domain) const {
    return directory_ / (std::string(domain) + "." + hostName_ + ".vrec");
}

std::optional<Error> PreferencesStore::checkDomain(std::string_view domain) {
    bool valid = !domain.empty() && domain.size() <= kMaxDomainLength && domain != "." && domain != "..";
    for (char c : domain) {
        bool allowed = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
                       c == '-' || c == '_';
        if (!allowed) valid = false;
    }
    if (valid) return std::nullopt;
    return BXError(ErrorCode::OperationFailed,
                   "invalid preferences domain name \"" + std::string(domain.substr(0, kMaxDomainLength)) + "\"");
}

Result<Value> PreferencesStore::readFile(const fs::path& file, FileIdentity* identity) const {
    *identity = {};
    UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.get() < 0) {
        if (errno == ENOENT) return Value::emptyDictionary();
        return posixError(errno, "cannot open " + file.string());
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) return posixError(errno, "cannot stat " + file.string());
    *identity = {st.st_dev, st.st_ino, st.st_size, nanoseconds(st.st_mtim), nanoseconds(st.st_ctim), true};
    if (!S_ISREG(st.st_mode)) return BXError(ErrorCode::OperationFailed, file.string() + " is not a regular file");
    if (static_cast<uint64_t>(st.st_size) > kMaxPreferencesFileBytes) {
        log::ops().error("preferences file %{public}@ is larger than %zu bytes", file.string(),
                         kMaxPreferencesFileBytes);
        return BXError(ErrorCode::OperationFailed, file.string() + " is larger than the preferences size limit");
    }

    std::string text;
    text.resize(static_cast<size_t>(st.st_size));
    size_t done = 0;
    while (true) {
        if (done == text.size()) {
            // The file may have grown since fstat (someone writing it in place); take what is there, within limits.
            if (text.size() >= kMaxPreferencesFileBytes) break;
            text.resize(std::min(kMaxPreferencesFileBytes, text.size() + 4096));
        }
        ssize_t got = ::read(fd.get(), text.data() + done, text.size() - done);
        if (got < 0) {
            if (errno == EINTR) continue;
            return posixError(errno, "cannot read " + file.string());
        }
        if (got == 0) break;
        done += static_cast<size_t>(got);
    }
    text.resize(done);

    Result<Value> document = Document::read(text);
    if (!document) return document.error();
    if (!document->isDictionary())
        return BXError(ErrorCode::OperationFailed, file.string() + " does not hold a dictionary");
    return document;
}

void PreferencesStore::synchronize(std::string_view domain) {
    if (auto error = checkDomain(domain)) {
        log::ops().error("preferences: %{public}@", *error);
        return;
    }
    fs::path file = fileForDomain(domain);

    FileIdentity current;
    if (struct stat st{}; ::stat(file.c_str(), &st) == 0)
        current = {st.st_dev, st.st_ino, st.st_size, nanoseconds(st.st_mtim), nanoseconds(st.st_ctim), true};
    {
        std::lock_guard lock(mutex_);
        auto found = cache_.find(domain);
        if (found != cache_.end() && found->second.identity == current) return;
    }

    FileIdentity identity;
    Result<Value> values = readFile(file, &identity);
    CachedDomain fresh{identity, values ? *values : Value::emptyDictionary()};
    if (!values)
        log::ops().error("preferences %{public}@ cannot be used, reading it as empty: %{public}@", file.string(),
                         values.error());

    std::lock_guard lock(mutex_);
    cache_.insert_or_assign(std::string(domain), std::move(fresh));
}

Value PreferencesStore::copyValue(std::string_view domain, std::string_view key) const {
    std::lock_guard lock(mutex_);
    auto found = cache_.find(domain);
    if (found == cache_.end()) return Value::null();
    return found->second.values.get(key);
}

Value PreferencesStore::copyValueAfterSync(std::string_view domain, std::string_view key) {
    synchronize(domain);
    return copyValue(domain, key);
}

Result<Value> PreferencesStore::readDomain(std::string_view domain) const {
    if (auto error = checkDomain(domain)) return *error;
    FileIdentity identity;
    return readFile(fileForDomain(domain), &identity);
}

std::optional<Error> PreferencesStore::setValue(std::string_view domain, std::string_view key, const Value& value) {
    if (auto error = checkDomain(domain)) return error;
    std::error_code ec;
    fs::create_directories(directory_, ec);
    if (ec) return posixError(ec.value(), "cannot create " + directory_.string());

    // The read-modify-write of two writers must not interleave, or one of their changes would be lost. The lock is
    // on the directory itself, so no lock file is left lying around; it is released when the descriptor closes.
    UniqueFd lockFd(::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (lockFd.get() < 0) return posixError(errno, "cannot open " + directory_.string());
    while (::flock(lockFd.get(), LOCK_EX) != 0) {
        if (errno != EINTR) return posixError(errno, "cannot lock " + directory_.string());
    }

    Result<Value> current = readDomain(domain);
    if (!current) return current.error();
    MutableDictionary updated(*current);
    if (value.isNull())
        updated.remove(key);
    else
        updated.set(key, value);
    Value document = updated.take();

    Result<std::string> text = Document::write(document);
    if (!text) return text.error();
    if (text->size() > kMaxPreferencesFileBytes)
        return BXError(ErrorCode::OperationFailed,
                       "preferences of " + std::string(domain) + " would exceed the preferences size limit");
    return Document::writeFileAtomically(fileForDomain(domain), document);
}

}  // namespace bexil
