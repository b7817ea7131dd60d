// Busy assertions: only processes the supervisor runs may make them, and
// they end with idle or with their connection.

#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/relay/ProcessStartTime.h"
#include "platform/vigil/Vigil.h"
#include "tests/support/TempDirectory.h"

namespace vigil {
namespace {

TEST(Vigil, RefusesAProcessTheSupervisorDidNotStart) {
  const tn::test::TempRoot root;
  auto service = Vigil::create(warden::Warden::create(), {});
  ASSERT_TRUE(service.ok()) << service.error().description();
  const int key = 0;
  const auto declared = (*service)->declare(&key, ::getpid(), *relay::processStartTime(::getpid()), true);
  ASSERT_FALSE(declared.ok());
  EXPECT_EQ(declared.error().code(), EPERM);
  EXPECT_NE(declared.error().localizedDescription().find("no running plug-in instance"), std::string::npos);
  EXPECT_TRUE((*service)->busyInstances({"com.example.upcase"}).empty());
}

}  // namespace
}  // namespace vigil
