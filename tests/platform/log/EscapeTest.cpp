// Escaping of log text: what passes unchanged, what is escaped and how, and
// that every line of every log object is escaped before any sink sees it.

#include "platform/log/Escape.h"

#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "tests/platform/log/LogTestSupport.h"

namespace tn::log {
namespace {

using namespace std::string_literals;

TEST(Escape, Table) {
  const std::vector<std::pair<std::string, std::string>> table = {
      // Unchanged: printable ASCII and valid UTF-8 outside the escaped ranges.
      {"plain /opt/App.bundle", "plain /opt/App.bundle"},
      {"caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80", "caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"},
      {"\xc2\xa0 no-break space", "\xc2\xa0 no-break space"},
      // Line breaks, tab, backslash.
      {"a\nb\rc\td", "a\\nb\\rc\\td"},
      {"back\\slash", "back\\\\slash"},
      // Other C0 controls, ESC, NUL, DEL.
      {"\x1b[31mred\x1b[0m", "\\x1b[31mred\\x1b[0m"},
      {"nul\0here"s, "nul\\x00here"},
      {"\x01\x07\x08\x0b\x0c\x1f\x7f", "\\x01\\x07\\x08\\x0b\\x0c\\x1f\\x7f"},
      // C1 controls (CSI U+009B would start an escape sequence), separators, bidi.
      {"\xc2\x80\xc2\x9b\xc2\x9f", "\\u0080\\u009b\\u009f"},
      {"\xe2\x80\xa8\xe2\x80\xa9", "\\u2028\\u2029"},
      {"\xe2\x80\xae" "evil\xe2\x81\xa6", "\\u202eevil\\u2066"},
      // Invalid UTF-8: stray continuation, overlong, surrogate, beyond U+10FFFF, cut off, bad lead.
      {"\x80x", "\\x80x"},
      {"\xc0\xaf", "\\xc0\\xaf"},
      {"\xe0\x80\xaf", "\\xe0\\x80\\xaf"},
      {"\xed\xa0\x80", "\\xed\\xa0\\x80"},
      {"\xf4\x90\x80\x80", "\\xf4\\x90\\x80\\x80"},
      {"end\xe2\x82", "end\\xe2\\x82"},
      {"\xff\xfe", "\\xff\\xfe"},
      {"\xc3(", "\\xc3("},
  };
  for (const auto& [input, expected] : table) {
    EXPECT_EQ(escapeText(input), expected) << escapeText(input);
    EXPECT_EQ(needsEscaping(input), input != expected) << expected;
    for (const char c : escapeText(input)) {
      EXPECT_TRUE(static_cast<unsigned char>(c) >= 0x20 && c != 0x7f) << expected;
    }
  }
}

class EscapedLines : public test::LogTest {};

TEST_F(EscapedLines, EveryLineIsEscapedBeforeTheSink) {
  const std::string peer = "/tmp/\x1b]0;owned\x07\nFAKE tenond[1] ops.error: forged\xc2\x9b";
  TN_LOG_DEFAULT(ops(), "invalid plugin path: {}", peer);
  TN_LOG_ERROR(defaultLog(), "{}", std::string("a\0b", 3));
  const std::vector<std::string> lines = capture_->lines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0],
            "ops default invalid plugin path: /tmp/\\x1b]0;owned\\x07\\nFAKE tenond[1] ops.error: forged\\u009b");
  EXPECT_EQ(lines[1], "default error a\\x00b");
}

}  // namespace
}  // namespace tn::log
