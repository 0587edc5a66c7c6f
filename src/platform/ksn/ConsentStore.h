#pragma once

// ConsentStore keeps the user's privacy-consent answers in one structured document: bundle identifier -> service
// name -> granted (docs/preferences.md). It keeps nothing in memory, so every query sees the file as it is now,
// whoever changed it. Thread-safe; writers are serialised across processes by a lock on the file's directory.

#include <filesystem>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "bexil/Value.h"
#include "platform/ksn/PrivacyConsent.h"

namespace bexil {

class ConsentStore : public PrivacyConsent {
  public:
    static constexpr std::string_view kFileName = "consent.vrec";
    // Consent files larger than this are refused: the answers of every application of a user fit easily.
    static constexpr size_t kMaxConsentFileBytes = 4u << 20;

    // <state dir>/consent.vrec: $BX_STATE_DIR, else /var/lib/bexil for root, else $XDG_STATE_HOME/bexil (with
    // $HOME/.local/state for an unset XDG_STATE_HOME).
    static std::filesystem::path defaultFile();

    explicit ConsentStore(std::filesystem::path file = defaultFile());

    const std::filesystem::path& file() const { return file_; }

    // The records of one bundle identifier, ordered by service name. A missing file or an identifier without an
    // entry gives an empty list; a file that cannot be read or is malformed, or an entry that is not a dictionary,
    // gives nothing (logged).
    std::optional<std::vector<ConsentRecord>> informationForBundleIdentifier(std::string_view bundleIdentifier) const;
    // The services granted to the bundle identifier (empty when the query fails).
    std::set<std::string> grantedServices(std::string_view bundleIdentifier) const;

    // Reads the bundle's "BDBundleIdentifier" and answers informationForBundleIdentifier for it.
    std::optional<std::vector<ConsentRecord>> copyInformationForBundle(const PlatformBundle& bundle) const override;

    // Records the user's answer for one service of one bundle and replaces the file atomically. A file that cannot
    // be read is left untouched and reported, never overwritten.
    std::optional<Error> setGranted(std::string_view bundleIdentifier, std::string_view service, bool granted);

  private:
    // The whole document: an empty dictionary for a missing file, an error for anything else unusable.
    Result<Value> readDocument() const;

    const std::filesystem::path file_;
};

}  // namespace bexil
