#include "platform/value/URL.h"

#include <gtest/gtest.h>

namespace tn {
namespace {

TEST(URL, FilePathsRoundTripThroughTheirPercentEncodedText) {
  for (const char* path : {"/opt/tenon/applications/Notes/", "/a b/c%d/é/#?", "/tmp/x+y=z@w", "relative/p"}) {
    URL u = URL::fileURLWithPath(path);
    auto parsed = URL::parse(u.absoluteString());
    ASSERT_TRUE(parsed) << u.absoluteString();
    EXPECT_EQ(parsed->path(), path);
    EXPECT_TRUE(parsed->isFileURL());
  }
  EXPECT_EQ(URL::fileURLWithPath("/My App/").absoluteString(), "file:///My%20App/");
  EXPECT_EQ(URL::fileURLWithPath("/a#b?c%").absoluteString(), "file:///a%23b%3Fc%25");
}

TEST(URL, ParseDecodesHostAndPathAndDropsQueryAndFragment) {
  auto u = URL::parse("FILE://localhost/x%2Fy/z?q=1#frag");
  ASSERT_TRUE(u);
  EXPECT_EQ(u->scheme(), "file");
  EXPECT_EQ(u->host(), "localhost");
  EXPECT_EQ(u->path(), "/x/y/z");
  auto v = URL::parse("file:/bare/path");
  ASSERT_TRUE(v);
  EXPECT_EQ(v->path(), "/bare/path");
}

TEST(URL, ParseRefusesMalformedText) {
  for (const char* bad : {"", "/no/scheme", ":x", "1ab://x", "file:///a%2", "file:///a%", "file:///%G0",
                          "file:///nul%00byte"})
    EXPECT_FALSE(URL::parse(bad)) << bad;
  // A raw NUL anywhere: in the path, the host, the scheme, or after a '?'
  // that would otherwise drop it.
  using namespace std::string_view_literals;
  for (const std::string_view bad : {"file:///opt/A.tnx\0/x"sv, "file://host\0/x"sv, "fi\0le:///x"sv,
                                     "file:///x?\0"sv, "file:///x\0"sv})
    EXPECT_FALSE(URL::parse(bad)) << bad.size();
}

}  // namespace
}  // namespace tn
