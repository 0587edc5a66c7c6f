#include "policy/BXDPlugInSignature.h"

#include <openssl/sha.h>

#include "bexil/Uuid.h"

namespace bexil {

BXDPlugInSignature::BXDPlugInSignature(std::string_view /*bundleUrl*/) : requirement_(kPlaceholderRequirement) {
    const std::string text = Uuid::random().string();
    SHA1(reinterpret_cast<const unsigned char*>(text.data()), text.size(), cdhash_.data());
}

}  // namespace bexil
