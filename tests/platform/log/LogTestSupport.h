// Helpers shared by the log tests.

#pragma once

#include <gtest/gtest.h>

#include "platform/log/Log.h"

namespace tn::log::test {

// Every test starts and ends with info and debug off everywhere and with a
// fresh capture sink installed, so tests do not see each other's settings.
class LogTest : public ::testing::Test {
 protected:
  void SetUp() override { configure(""); }
  void TearDown() override { configure(""); }

  ScopedCaptureSink capture_;
};

}  // namespace tn::log::test
