#pragma once

// A plug-in's data container, `<state dir>/containers/<plug-in identifier>/` with `tmp/` inside: the plug-in's HOME
// and TMPDIR. Users write into their containers, while bxd makes them and hands them over as root, so bxd never
// follows a link there: the container and its tmp/ are opened without following links, checked to be directories
// through what was opened, and changed through those descriptors, never through their paths. Stateless; any
// thread.

#include <sys/types.h>

#include <filesystem>
#include <optional>

#include "base/Error.h"

namespace bexil {

class DataContainer {
  public:
    struct Owner {
        uid_t uid;
        gid_t gid;
    };

    // Makes the container at `path` and its tmp/ where they are missing, sets both to mode 0700 and, when `owner` is
    // given, gives both to that user. The directory that holds the container is bxd's own and trusted; the
    // container and tmp/ must be real directories: a link or any other file there is refused (an error in the
    // POSIX domain, code ENOTDIR), and nothing is changed through it.
    static std::optional<Error> prepare(const std::filesystem::path& path, std::optional<Owner> owner = std::nullopt);
};

}  // namespace bexil
