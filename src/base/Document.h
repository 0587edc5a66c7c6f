#pragma once

// Document reads and writes structured documents: one Value as the typed XML text form described in docs/vrec.md.
// Every operation is a static function without shared state, so any thread or queue may call them at any time; the
// file operations touch only the paths they are given.

#include <sys/types.h>

#include <cstddef>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/AtomicFile.h"
#include "base/Error.h"
#include "base/PosixError.h"
#include "bexil/Value.h"

namespace bexil {

// The error domain of documents that cannot be read or values that cannot be written.
inline constexpr std::string_view BXDocumentErrorDomain = "BexilDocument";
// The error domain of failed system calls: the code is the errno.

enum DocumentErrorCode : int {
    // The text is not XML, not the document structure, or a value in it does not parse.
    kDocumentMalformed = 1,
    // The value holds something the document form cannot carry (a UUID, a string XML cannot hold, a wild date).
    kDocumentUnrepresentable = 2,
    // The document is larger than kMaxDocumentBytes or nests deeper than kMaxDocumentDepth.
    kDocumentLimitExceeded = 3,
};

// Containers (dictionaries and arrays) nested deeper than this are refused, reading and writing, so that neither
// the codec nor the destruction of what it returns can exhaust the stack.
inline constexpr size_t kMaxDocumentDepth = 512;
// Documents longer than this are refused, reading and writing; a hostile file cannot make the reader allocate more.
inline constexpr size_t kMaxDocumentBytes = 64u << 20;

class Document {
  public:
    // The system calls of the atomic file write (base/AtomicFile.h).
    using FileSystem = bexil::FileSystem;
    static FileSystem& posixFileSystem() { return bexil::posixFileSystem(); }

    // The value a document holds. Malformed text is an error naming what is wrong, where it is in the value
    // (root["key"][index]) and its byte offset; no partial value is ever returned.
    static Result<Value> read(std::string_view text);
    // The same, with the string Values of the document made by `makeString` from their text (which it may take)
    // rather than each a new Value: a caller that already holds equal strings can hand those out, so that a record
    // keeping texts beside the document's value keeps each once. It must return a string Value of that text.
    using StringMaker = std::function<Value(std::string&& text)>;
    static Result<Value> read(std::string_view text, const StringMaker& makeString);
    // The document text of a value. A value that cannot be represented (see docs/vrec.md) is an error naming
    // where it is; nothing is silently dropped or changed.
    static Result<std::string> write(const Value& value);

    // Reads and parses a file; I/O errors are POSIX errors, parse errors name the path in their message. Only a
    // regular file is read (anything else is EINVAL): a pipe or a device named in place of a document could
    // otherwise keep the reader waiting, or reading, for ever.
    static Result<Value> readFile(const std::filesystem::path& path);
    // The same for a file the caller has opened (so that it could check what it opened); `path` names it in
    // messages. Reads from the descriptor's current offset; the caller keeps and closes it.
    static Result<Value> readOpenFile(int fd, const std::filesystem::path& path);
    // Replaces the file at `path` with the document of `value`: a temporary file in the same directory is written,
    // synced, renamed over the target and the directory synced. On failure before the rename the old file is
    // untouched and the temporary file removed; when only the directory sync fails, the new document is in place
    // but the error is still returned because it may not be durable.
    static std::optional<Error> writeFileAtomically(const std::filesystem::path& path, const Value& value,
                                                    FileSystem& fileSystem = posixFileSystem());
};

}  // namespace bexil
