#pragma once

// Sandbox extension tokens: unforgeable strings that grant access of one class (read-only, say) to one canonical
// path. A token is "<class>;<HMAC-SHA-256 in hex>;<path>", the HMAC taken over class and path with a key made
// afresh for each run of the issuing process and kept in <runtime dir>/sandbox/extension-key (mode 0600), so only
// processes that may read that file can check a token, and tokens of an earlier run stop working. Consuming a valid
// token enters it into a process-local handle table; releasing removes it. One object per key file; any thread.

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// The library's keyed MAC state (EVP_MAC_CTX); only the source knows the library.
struct evp_mac_ctx_st;

namespace bexil {

class SandboxExtensions {
  public:
    // The class of read-only file extensions.
    static constexpr std::string_view kReadOnlyClass = "com.quorvel.sandbox.read-only";
    // Longest path a token may name; longer ones are refused with ENAMETOOLONG.
    static constexpr size_t kMaxPathLength = 4096;

    // <runtime dir>/sandbox/extension-key; the runtime dir is $BX_RUNTIME_DIR, else /run/bexil for root, else
    // $XDG_RUNTIME_DIR/bexil.
    static std::filesystem::path defaultKeyPath();
    // The process's shared instance over the default key file.
    static SandboxExtensions& shared();

    explicit SandboxExtensions(std::filesystem::path keyPath);
    SandboxExtensions(const SandboxExtensions&) = delete;
    SandboxExtensions& operator=(const SandboxExtensions&) = delete;

    // Issues a token of `extensionClass` for the canonical form of `path` (which must exist). None on failure,
    // with errno set (the path's resolution error, or the key file's).
    std::optional<std::string> issueFileExtension(std::string_view extensionClass, const std::string& path);
    // Writes the key file back when it has disappeared, so that consumers can still check the tokens issued
    // before (tokens handed out again from a cache, say). True when there is no key yet or the file is in place;
    // false with errno set when it cannot be written.
    bool ensureIssuingKey();
    // Checks a token against the current key and, when valid, records it: a positive handle. -1 with errno EPERM
    // for a token that is malformed or not signed with the current key, or the errno of reading the key.
    int64_t consume(const std::string& token);
    // Forgets a consumed token; unknown handles are ignored.
    void release(int64_t handle);
    // The path a consumed handle grants, or none.
    std::optional<std::string> consumedPath(int64_t handle) const;

    const std::filesystem::path& keyPath() const { return keyPath_; }

  private:
    // The issuing key: made on first use in this process (replacing any earlier run's key) and written back when
    // its file has disappeared. REQUIRES: mutex_ held.
    bool ensureIssuingKeyLocked();
    std::string signature(const std::vector<uint8_t>& key, std::string_view extensionClass,
                          std::string_view path) const;
    // The same signature with the issuing key, from a MAC state keyed once. REQUIRES: mutex_ held, a key made.
    std::string issuingSignatureLocked(std::string_view extensionClass, std::string_view path);

    struct MacStateFree {
        void operator()(evp_mac_ctx_st* state) const;
    };

    const std::filesystem::path keyPath_;
    mutable std::mutex mutex_;
    std::vector<uint8_t> issuingKey_;
    // HMAC-SHA-256 keyed with issuingKey_ (none until first needed, or when the library cannot make one): copying
    // it per token spares setting up the algorithm and the key each time, which was most of a token's cost.
    std::unique_ptr<evp_mac_ctx_st, MacStateFree> issuingMac_;
    std::map<int64_t, std::string> consumed_;
    int64_t nextHandle_ = 1;
};

}  // namespace bexil
