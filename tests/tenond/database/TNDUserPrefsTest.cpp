// The exclusions preference: written by another party at any time, read
// afresh by the daemon; a damaged domain reads as none and says why.

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

#include "platform/log/CaptureSink.h"
#include "tenond/database/TNDUserPrefs.h"
#include "tests/support/TempDirectory.h"

namespace tnd {
namespace {

TEST(UserPrefs, ExclusionsWrittenByAnotherProcessAfterStartAreSeen) {
  const tn::test::TempRoot root;
  const TNDUserPrefs prefs;  // made before the value exists, as at start-up
  EXPECT_FALSE(prefs.exclusions());

  const tn::Value rules(tn::Array{tn::Value(tn::Dictionary{{"XTExtensionPointIdentifier", tn::Value("com.x")}})});
  const pid_t writer = ::fork();
  if (writer == 0) {
    _exit(prefs::PreferenceDomain(TNDUserPrefs::kDomain).setValue(TNDUserPrefs::kExclusionsKey, rules).ok() ? 0 : 1);
  }
  int status = 0;
  ::waitpid(writer, &status, 0);
  ASSERT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(prefs.exclusions(), rules);

  // A damaged domain file: none, and an error line that names the file.
  std::ofstream(prefs::PreferenceDomain(TNDUserPrefs::kDomain).path(), std::ofstream::binary) << "{broken";
  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(prefs.exclusions());
  ASSERT_EQ(capture->records().size(), 1u);
  EXPECT_NE(capture->records()[0].text.find(prefs::PreferenceDomain(TNDUserPrefs::kDomain).path()),
            std::string::npos);
}

}  // namespace
}  // namespace tnd
