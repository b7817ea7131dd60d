// "access" end to end: one read-only token per named plug-in bundle, in the
// order of the request, each naming the bundle's canonical path and verifiable
// with the daemon's key; the walk's errors; nothing for an empty list.

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/sandbox/Extensions.h"
#include "platform/sandbox/ExtensionToken.h"
#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"

namespace tn::test {
namespace {

class Access : public NotesDaemonTest {
 protected:
  Access() : NotesDaemonTest({"One", "Two"}) {}

  Value access(Array uuids) {
    return peer_->request({{"request", "access"}, {"version", 3}, {"uuids", Value(std::move(uuids))}});
  }
};

TEST_F(Access, OneVerifiableTokenPerBundleInRequestOrder) {
  const Value reply = access({Value(uuids_[1]), Value(uuids_[0]), Value(uuids_[1])});
  ASSERT_TRUE(reply["errorcode"].isNull()) << reply;
  const Array& tokens = *reply["extensions"].array();
  ASSERT_EQ(tokens.size(), 3u);
  for (size_t i = 0; i < tokens.size(); ++i) {
    const std::string expected = std::filesystem::canonical(paths_[i == 1 ? 0 : 1]).string();
    const Result<sandbox::ExtensionToken> token = sandbox::parseExtensionToken(*tokens[i].string());
    ASSERT_TRUE(token.ok()) << token.error().description();
    EXPECT_EQ(token->kind, sandbox::ExtensionKind::File);
    EXPECT_EQ(token->subject, expected);
    EXPECT_TRUE(sandbox::consumeExtension(*tokens[i].string()).ok()) << "signed with the daemon's key";
  }

  const Value none = access({});
  ASSERT_TRUE(none["errorcode"].isNull()) << none;
  EXPECT_EQ(none["extensions"], Value(Array{}));
}

TEST_F(Access, TheWalkStopsAtAnUnknownPlugInAndReturnsNoToken) {
  const Value reply = access({Value(uuids_[0]), Value(UUID::random())});
  EXPECT_EQ(reply["errorcode"], Value(uint64_t{4})) << reply;
  EXPECT_EQ(reply["error"], Value("no such plugin (uuid not found)"));
  EXPECT_TRUE(reply["extensions"].isNull());
  const Value notAnArray = peer_->request({{"request", "access"}, {"version", 3}, {"uuids", "nope"}});
  EXPECT_EQ(notAnArray["errorcode"], Value(uint64_t{4})) << notAnArray;
}

}  // namespace
}  // namespace tn::test
