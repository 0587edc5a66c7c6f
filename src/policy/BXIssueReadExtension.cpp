#include "policy/BXIssueReadExtension.h"

#include "platform/sandbox/SandboxExtensions.h"

namespace bexil {

std::optional<std::string> BXIssueReadExtension(const std::string& url) {
    return SandboxExtensions::shared().issueFileExtension(SandboxExtensions::kReadOnlyClass, url);
}

bool BXKeepReadExtensionsCheckable() { return SandboxExtensions::shared().ensureIssuingKey(); }

}  // namespace bexil
