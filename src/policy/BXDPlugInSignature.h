#pragma once

// The signature summary of a plug-in bundle: a code digest and a requirement text. Bundles are not signed on this
// platform, so the summary is a placeholder that is never the same twice: a value type, owned by whoever builds it,
// usable on any thread.

#include <array>
#include <cstdint>
#include <string>
#include <string_view>

namespace bexil {

class BXDPlugInSignature {
  public:
    static constexpr size_t kDigestBytes = 20;  // a SHA-1 digest
    static constexpr std::string_view kPlaceholderRequirement = "dummy requirement";

    // initWithURL:error: computes no real signature: `requirement` is the placeholder text and `cdhash` the SHA-1
    // digest of the text of a new random UUID. The URL is not read, and since nothing can fail there is no error.
    explicit BXDPlugInSignature(std::string_view bundleUrl);

    const std::array<uint8_t, kDigestBytes>& cdhash() const { return cdhash_; }
    const std::string& requirement() const { return requirement_; }

  private:
    std::array<uint8_t, kDigestBytes> cdhash_{};
    std::string requirement_;
};

}  // namespace bexil
