#pragma once

// PreferencesStore is the per-user, per-host key-value store of preference domains: one structured document per
// domain, `<directory>/<domain>.<hostname>.vrec`, whose root dictionary maps keys to values (docs/preferences.md).
// Reads go through a synchronisation step that re-reads a domain's file only when its identity or modification time
// changed, so a change written by another process is seen by the next read. Thread-safe: any thread may read and
// write; the cache is behind one mutex and no file I/O happens while holding it.

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "bexil/Value.h"

namespace bexil {

class PreferencesStore {
  public:
    // Preference files larger than this are refused (logged, read as an empty domain); nobody writes that many
    // preferences by hand, and a reader on every request must not be made to parse a huge file.
    static constexpr size_t kMaxPreferencesFileBytes = 4u << 20;
    // Domain names longer than this, or with characters outside [A-Za-z0-9._-], are refused: the name becomes a
    // file name and must not be able to reach outside the directory.
    static constexpr size_t kMaxDomainLength = 200;

    // $BX_PREFERENCES_DIR, else $XDG_CONFIG_HOME/bexil/preferences, else $HOME/.config/bexil/preferences.
    static std::filesystem::path defaultDirectory();
    // The machine's host name as it appears in file names ("localhost" when it cannot be read; '/' becomes '_').
    static std::string currentHostName();
    // The store of the current user and host, shared by everyone in the process.
    static PreferencesStore& shared();

    explicit PreferencesStore(std::filesystem::path directory = defaultDirectory(),
                              std::string hostName = currentHostName());
    PreferencesStore(const PreferencesStore&) = delete;
    PreferencesStore& operator=(const PreferencesStore&) = delete;

    const std::filesystem::path& directory() const { return directory_; }
    const std::string& hostName() const { return hostName_; }

    // The file that holds `domain` for this store's host.
    std::filesystem::path fileForDomain(std::string_view domain) const;

    // The synchronisation step: when the domain's file is not the one last read (other inode or device, size,
    // modification or change time), it is read again. A missing file is an empty domain; an unreadable or
    // malformed one is logged once per change of the file and reads as an empty domain until it is fixed.
    void synchronize(std::string_view domain);
    // The value of `key` in `domain` as of the last synchronisation, or a null Value when it is not set.
    Value copyValue(std::string_view domain, std::string_view key) const;
    // synchronize + copyValue: what a reader that must see other processes' changes calls.
    Value copyValueAfterSync(std::string_view domain, std::string_view key);

    // The whole domain read straight from its file: an empty dictionary when there is no file, an error when the
    // file cannot be read or is not a dictionary document. Writers use this so that they never replace a file they
    // could not understand.
    Result<Value> readDomain(std::string_view domain) const;
    // Sets `key` to `value` (a null Value removes it) and replaces the file atomically. Writers are serialised
    // across processes by a lock on the directory; a file that cannot be read is left untouched and reported.
    std::optional<Error> setValue(std::string_view domain, std::string_view key, const Value& value);

  private:
    struct FileIdentity {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        int64_t modifiedNs = 0;
        int64_t changedNs = 0;
        bool exists = false;
        bool operator==(const FileIdentity&) const = default;
    };
    struct CachedDomain {
        FileIdentity identity;
        Value values;  // always a dictionary
    };

    static std::optional<Error> checkDomain(std::string_view domain);
    // Opens, identifies and parses the file in one go, so the identity always belongs to the bytes that were read.
    Result<Value> readFile(const std::filesystem::path& file, FileIdentity* identity) const;

    const std::filesystem::path directory_;
    const std::string hostName_;
    mutable std::mutex mutex_;
    std::map<std::string, CachedDomain, std::less<>> cache_;
};

}  // namespace bexil
