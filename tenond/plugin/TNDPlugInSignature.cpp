#include "tenond/plugin/TNDPlugInSignature.h"

#include <openssl/evp.h>

#include <cstdlib>

#include "platform/value/UUID.h"

namespace tn {
namespace {

constexpr std::string_view kDummyRequirement = "dummy requirement";

TNDPlugInSignature::CDHash sha1(std::string_view bytes) {
  TNDPlugInSignature::CDHash digest{};
  unsigned int length = 0;
  // EVP_Digest with SHA-1 fails only when the library cannot allocate.
  if (EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, EVP_sha1(), nullptr) != 1 ||
      length != digest.size()) {
    std::abort();
  }
  return digest;
}

}  // namespace

TNDPlugInSignature::TNDPlugInSignature(const URL& /*bundleURL*/)
    : cdhash_(sha1(UUID::random().string())), requirement_(kDummyRequirement) {}

TNDPlugInSignature::TNDPlugInSignature(CDHash cdhash, std::string requirement)
    : cdhash_(cdhash), requirement_(std::move(requirement)) {}

Value TNDPlugInSignature::cdhashValue() const { return Value(Bytes(cdhash_.begin(), cdhash_.end())); }

}  // namespace tn
