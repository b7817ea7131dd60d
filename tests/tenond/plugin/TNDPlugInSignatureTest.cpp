// Plug-in signatures made from a bundle: the fixed requirement and a cdhash
// that no other signature shares.

#include <gtest/gtest.h>

#include <set>

#include "tenond/plugin/TNDPlugInSignature.h"

namespace tn {
namespace {

TEST(TNDPlugInSignature, FromABundleHasTheDummyRequirementAndAFreshCdhash) {
  const URL url = URL::fileURLWithPath("/opt/tenon/applications/App/Support/PlugIns/P.tnx");
  std::set<TNDPlugInSignature::CDHash> seen;
  for (int i = 0; i < 64; ++i) {
    const TNDPlugInSignature signature(url);
    EXPECT_EQ(signature.requirement(), "dummy requirement");
    EXPECT_NE(signature.cdhash(), TNDPlugInSignature::CDHash{});
    seen.insert(signature.cdhash());
  }
  EXPECT_EQ(seen.size(), 64U);
}

TEST(TNDPlugInSignature, FieldsAreSettableAndTheCdhashIsTwentyBytesOfData) {
  TNDPlugInSignature signature(URL::fileURLWithPath("/x"));
  TNDPlugInSignature::CDHash cdhash{};
  cdhash[0] = 0xAB;
  cdhash[19] = 0xCD;
  signature.setCdhash(cdhash);
  signature.setRequirement("identifier \"com.example.p\"");
  EXPECT_EQ(signature, TNDPlugInSignature(cdhash, "identifier \"com.example.p\""));

  const Value value = signature.cdhashValue();
  const Bytes* data = value.data();
  ASSERT_NE(data, nullptr);
  ASSERT_EQ(data->size(), 20U);
  EXPECT_EQ((*data)[0], 0xAB);
  EXPECT_EQ((*data)[19], 0xCD);
}

}  // namespace
}  // namespace tn
