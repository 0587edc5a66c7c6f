#include "platform/sandbox/SandboxExtensions.h"

#include <fcntl.h>
#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>

#include "base/AtomicFile.h"
#include "base/PosixError.h"
#include "base/StandardPaths.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

constexpr size_t kKeyBytes = 32;
constexpr char kSeparator = ';';

std::string hex(const unsigned char* bytes, size_t count) {
    static constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    text.reserve(count * 2);
    for (size_t i = 0; i < count; ++i) {
        text += kDigits[bytes[i] >> 4];
        text += kDigits[bytes[i] & 0xf];
    }
    return text;
}

// Replaces the key file (mode 0600) so that a reader sees the old key or the new one, never a part. False with
// errno set on failure.
bool writeKey(const fs::path& path, const std::vector<uint8_t>& key) {
    std::error_code ec;
    fs::create_directories(path.parent_path(), ec);
    std::string_view bytes(reinterpret_cast<const char*>(key.data()), key.size());
    if (std::optional<Error> error = replaceFileAtomically(path, bytes, 0600)) {
        errno = error->domain() == BXPosixErrorDomain ? static_cast<int>(error->code()) : EIO;
        return false;
    }
    return true;
}

std::optional<std::vector<uint8_t>> readKey(const fs::path& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    std::vector<uint8_t> key(kKeyBytes + 1);
    ssize_t n = ::read(fd, key.data(), key.size());
    int saved = errno;
    ::close(fd);
    if (n != static_cast<ssize_t>(kKeyBytes)) {
        errno = n < 0 ? saved : EINVAL;
        return std::nullopt;
    }
    key.resize(kKeyBytes);
    return key;
}

// The canonical form of an existing path, or none with errno set. The C library's realpath asks the kernel about
// every component in turn, and each question walks the path from the root again, so a token for a file deep in an
// application cost dozens of lookups. Opening the path once without access to its contents (which needs what
// resolving it needs: search permission on every directory) and reading back the name the kernel resolved costs two
// walks whatever the depth. Without /proc, or when the answer is no plain path, the library's way decides.
std::optional<std::string> canonicalPath(const std::string& path) {
    int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    std::string link = "/proc/self/fd/" + std::to_string(fd);
    char resolved[PATH_MAX + 1];
    ssize_t n = ::readlink(link.c_str(), resolved, sizeof resolved);
    ::close(fd);
    constexpr std::string_view kDeleted = " (deleted)";
    if (n > 0 && static_cast<size_t>(n) < sizeof resolved && resolved[0] == '/') {
        std::string_view name(resolved, static_cast<size_t>(n));
        if (!name.ends_with(kDeleted)) return std::string(name);
    }
    std::unique_ptr<char, decltype(&free)> canonical(realpath(path.c_str(), nullptr), &free);
    if (!canonical) return std::nullopt;
    return std::string(canonical.get());
}

}  // namespace

fs::path SandboxExtensions::defaultKeyPath() { return runtimeDirectory() / "sandbox" / "extension-key"; }

SandboxExtensions& SandboxExtensions::shared() {
    static SandboxExtensions instance(defaultKeyPath());
    return instance;
}

SandboxExtensions::SandboxExtensions(fs::path keyPath) : keyPath_(std::move(keyPath)) {}

bool SandboxExtensions::ensureIssuingKeyLocked() {
    if (!issuingKey_.empty()) {
        // Someone cleaned the runtime dir: put the key back, or no consumer could check this run's tokens.
        struct stat status;
        if (::stat(keyPath_.c_str(), &status) == 0) return true;
        return writeKey(keyPath_, issuingKey_);
    }
    std::vector<uint8_t> key(kKeyBytes);
    if (RAND_bytes(key.data(), static_cast<int>(key.size())) != 1) {
        errno = EIO;
        return false;
    }
    if (!writeKey(keyPath_, key)) return false;
    issuingKey_ = std::move(key);
    issuingMac_.reset();
    return true;
}

bool SandboxExtensions::ensureIssuingKey() {
    std::lock_guard lock(mutex_);
    return issuingKey_.empty() || ensureIssuingKeyLocked();
}

void SandboxExtensions::MacStateFree::operator()(evp_mac_ctx_st* state) const { EVP_MAC_CTX_free(state); }

namespace {

// Class and path are joined by a NUL, which neither can contain, so no two pairs sign the same bytes.
std::string signedMessage(std::string_view extensionClass, std::string_view path) {
    std::string message;
    message.reserve(extensionClass.size() + 1 + path.size());
    message += extensionClass;
    message += '\0';
    message += path;
    return message;
}

// A fresh HMAC-SHA-256 state keyed with `key`, or none when the library cannot make one.
EVP_MAC_CTX* keyedMac(const std::vector<uint8_t>& key) {
    // Fetching looks the algorithm up in the library's tables: once per process is enough.
    static EVP_MAC* const hmac = EVP_MAC_fetch(nullptr, "HMAC", nullptr);
    if (hmac == nullptr) return nullptr;
    EVP_MAC_CTX* state = EVP_MAC_CTX_new(hmac);
    if (state == nullptr) return nullptr;
    char digest[] = "SHA256";
    OSSL_PARAM params[] = {OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, digest, 0), OSSL_PARAM_END};
    if (EVP_MAC_init(state, key.data(), key.size(), params) != 1) {
        EVP_MAC_CTX_free(state);
        return nullptr;
    }
    return state;
}

// The one way a signature is made: the MAC of `state` (which this takes over and frees) over the class and path,
// in hexadecimal; empty when there is no state or the library fails, which no caller may take as a signature.
std::string finishSignature(EVP_MAC_CTX* state, std::string_view extensionClass, std::string_view path) {
    if (state == nullptr) return {};
    std::string message = signedMessage(extensionClass, path);
    unsigned char digest[EVP_MAX_MD_SIZE];
    size_t length = 0;
    bool ok = EVP_MAC_update(state, reinterpret_cast<const unsigned char*>(message.data()), message.size()) == 1 &&
              EVP_MAC_final(state, digest, &length, sizeof digest) == 1;
    EVP_MAC_CTX_free(state);
    return ok ? hex(digest, length) : std::string();
}

}  // namespace

std::string SandboxExtensions::issuingSignatureLocked(std::string_view extensionClass, std::string_view path) {
    if (!issuingMac_) issuingMac_.reset(keyedMac(issuingKey_));
    EVP_MAC_CTX* state = issuingMac_ ? EVP_MAC_CTX_dup(issuingMac_.get()) : keyedMac(issuingKey_);
    return finishSignature(state, extensionClass, path);
}

std::string SandboxExtensions::signature(const std::vector<uint8_t>& key, std::string_view extensionClass,
                                         std::string_view path) const {
    return finishSignature(keyedMac(key), extensionClass, path);
}

std::optional<std::string> SandboxExtensions::issueFileExtension(std::string_view extensionClass,
                                                                 const std::string& path) {
    if (extensionClass.empty() || extensionClass.find(kSeparator) != std::string_view::npos ||
        path.find('\0') != std::string::npos) {
        errno = EINVAL;
        return std::nullopt;
    }
    std::optional<std::string> canonical = canonicalPath(path);
    if (!canonical) return std::nullopt;
    std::string resolved = std::move(*canonical);
    if (resolved.size() > kMaxPathLength) {
        errno = ENAMETOOLONG;
        return std::nullopt;
    }
    std::lock_guard lock(mutex_);
    if (!ensureIssuingKeyLocked()) return std::nullopt;
    std::string mac = issuingSignatureLocked(extensionClass, resolved);
    if (mac.empty()) {
        errno = EIO;
        return std::nullopt;
    }
    return std::string(extensionClass) + kSeparator + mac + kSeparator + resolved;
}

int64_t SandboxExtensions::consume(const std::string& token) {
    size_t first = token.find(kSeparator);
    size_t second = first == std::string::npos ? std::string::npos : token.find(kSeparator, first + 1);
    if (second == std::string::npos || first == 0 || second + 1 >= token.size()) {
        errno = EPERM;
        return -1;
    }
    std::string_view extensionClass(token.data(), first);
    std::string_view mac(token.data() + first + 1, second - first - 1);
    std::string_view path(token.data() + second + 1, token.size() - second - 1);

    std::optional<std::vector<uint8_t>> key = readKey(keyPath_);
    if (!key) return -1;
    std::string expected = signature(*key, extensionClass, path);
    if (expected.empty() || mac.size() != expected.size() ||
        CRYPTO_memcmp(mac.data(), expected.data(), expected.size()) != 0) {
        errno = EPERM;
        return -1;
    }
    std::lock_guard lock(mutex_);
    int64_t handle = nextHandle_++;
    consumed_.emplace(handle, std::string(path));
    return handle;
}

void SandboxExtensions::release(int64_t handle) {
    std::lock_guard lock(mutex_);
    consumed_.erase(handle);
}

std::optional<std::string> SandboxExtensions::consumedPath(int64_t handle) const {
    std::lock_guard lock(mutex_);
    auto found = consumed_.find(handle);
    if (found == consumed_.end()) return std::nullopt;
    return found->second;
}

}  // namespace bexil
