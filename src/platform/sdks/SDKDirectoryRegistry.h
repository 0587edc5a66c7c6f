#pragma once

// SDKDirectoryRegistry finds SDK documents in directories: the SDK of extension point NAME is the structured
// document NAME.vrec (docs/sdks.md). Directories are searched in precedence order and the first one holding the
// file wins, so a file in /etc/bexil/sdks replaces the one of the same name in /usr/share/bexil/sdks. Every
// look-up opens the file as it is now; a document read before is reused only while the file it came from is the
// same file, unchanged (device, inode, size, modification and change times), so an edited or replaced SDK is seen
// at once while resolving many plug-ins of one extension point parses its SDK once. Any thread.

#include <sys/stat.h>

#include <cstddef>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Error.h"
#include "platform/sdks/ExtensionSDKRegistry.h"

namespace bexil {

class SDKDirectoryRegistry : public ExtensionSDKRegistry {
  public:
    // SDK documents larger than this are refused (logged): a real one holds a few dozen keys, and a reader must not
    // be made to parse a huge file every time a plug-in is resolved.
    static constexpr size_t kMaxSDKDocumentBytes = 1u << 20;
    // Longest SDK name taken; a longer one cannot be a file name once ".vrec" is added.
    static constexpr size_t kMaxSDKNameLength = 250;
    static constexpr std::string_view kDocumentSuffix = ".vrec";
    // Parsed documents kept at most; past this the kept ones are dropped (logged) and reading starts afresh. A
    // machine has a few dozen extension points; names that find no file keep nothing.
    static constexpr size_t kMaxCachedDocuments = 256;

    // $BX_SDK_DIR alone when it is set and not empty, else /etc/bexil/sdks then /usr/share/bexil/sdks.
    static std::vector<std::filesystem::path> defaultDirectories();

    // `directories` in precedence order: a file in an earlier one hides the file of the same name in later ones.
    explicit SDKDirectoryRegistry(std::vector<std::filesystem::path> directories = defaultDirectories());

    const std::vector<std::filesystem::path>& directories() const { return directories_; }

    // One look-up with its reason: nothing when no directory holds NAME.vrec; an error when the name is not a
    // plain file name, or when the document that hides all others cannot be used (unreadable, larger than
    // kMaxSDKDocumentBytes, malformed, not a dictionary, or a symbolic link that leads out of its directory). A
    // broken document is not skipped in favour of a lower one: whoever put it there meant to replace that one.
    // `foundAt`, when given, receives the document's path whenever one was found.
    Result<std::optional<Value>> readSDKEntry(std::string_view name, std::filesystem::path* foundAt = nullptr) const;

    // readSDKEntry with errors logged on the ops channel and answered as nothing.
    std::optional<Value> copySDKEntry(std::string_view name) const override;

  private:
    // A parsed document and the identity of the file it was read from.
    struct Kept {
        dev_t device;
        ino_t inode;
        off_t size;
        timespec modified;
        timespec changed;
        Value document;
    };
    // The document of the open file `fd` (whose status is `st`), parsed now or kept from before.
    Result<Value> documentOf(int fd, const struct stat& st, const std::filesystem::path& file) const;

    const std::vector<std::filesystem::path> directories_;
    mutable std::mutex keptMutex_;
    mutable std::unordered_map<std::string, Kept> kept_;
};

}  // namespace bexil
