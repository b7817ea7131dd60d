#pragma once

// TNDPlugInSignature: what the daemon records about a plug-in's code
// signature: the code directory hash (cdhash) and the designated requirement.
//
// Linux has no code signatures, so a signature made from a bundle does not
// read the bundle: its requirement is the fixed text "dummy requirement" and
// its cdhash a SHA-1 of a fresh random UUID, so that two plug-ins (or two
// signatures of the same bundle) never share a cdhash by accident. Code that
// compares signatures therefore sees every newly made signature as different,
// as it would after a binary changed.

#include <array>
#include <cstdint>
#include <string>

#include "platform/value/URL.h"
#include "platform/value/Value.h"

namespace tn {

class TNDPlugInSignature {
 public:
  static constexpr size_t kCDHashSize = 20;
  using CDHash = std::array<uint8_t, kCDHashSize>;

  // The signature of the bundle at bundleURL. Never fails; the bundle is
  // not read (see above).
  explicit TNDPlugInSignature(const URL& bundleURL);

  TNDPlugInSignature(CDHash cdhash, std::string requirement);

  const CDHash& cdhash() const { return cdhash_; }
  void setCdhash(const CDHash& cdhash) { cdhash_ = cdhash; }

  // The cdhash as a data value (20 bytes), for messages and documents.
  Value cdhashValue() const;

  const std::string& requirement() const { return requirement_; }
  void setRequirement(std::string requirement) { requirement_ = std::move(requirement); }

  friend bool operator==(const TNDPlugInSignature&, const TNDPlugInSignature&) = default;

 private:
  CDHash cdhash_{};
  std::string requirement_;
};

}  // namespace tn
