// Helpers for the plug-in model tests: a fake registry and log capture.

#pragma once

#include <gtest/gtest.h>

#include <map>
#include <string>

#include "libtenon/model/TNRegistryLookup.h"
#include "platform/log/Log.h"

namespace tn::test {

// A registry with SDK dictionaries and strings tables given by the test. It
// counts strings-table queries, since one query per plug-in is a contract.
class FakeRegistryLookup : public TNRegistryLookup {
 public:
  std::map<std::string, Dictionary, std::less<>> sdks;
  // bundle path -> table -> strings; a bundle absent here has no table.
  std::map<std::string, std::map<std::string, LocalizedStrings, std::less<>>> tables;
  mutable int stringQueries = 0;
  mutable std::set<std::string, std::less<>> lastKeys;

  std::optional<Dictionary> sdkDictionary(std::string_view identifier) const override {
    const auto found = sdks.find(identifier);
    if (found == sdks.end()) return std::nullopt;
    return found->second;
  }

  std::optional<LocalizedStrings> localizedStrings(const URL& plugInBundle, std::string_view table,
                                                   const std::set<std::string, std::less<>>& keys) const override {
    ++stringQueries;
    lastKeys = keys;
    const auto bundle = tables.find(plugInBundle.path());
    if (bundle == tables.end()) return std::nullopt;
    const auto strings = bundle->second.find(table);
    if (strings == bundle->second.end()) return std::nullopt;
    LocalizedStrings answer;
    for (const std::string& key : keys) {
      if (const auto found = strings->second.find(key); found != strings->second.end()) answer.insert(*found);
    }
    return answer;
  }
};

// Every test starts with debug logging on for the model's categories and a
// fresh capture sink.
class ModelTest : public ::testing::Test {
 protected:
  void SetUp() override { log::configure("ops=debug,rg=debug,sandbox=debug"); }
  void TearDown() override { log::configure(""); }

  bool logged(std::string_view category, log::Level level, std::string_view text) const {
    return capture_->contains(category, level, text);
  }

  log::ScopedCaptureSink capture_;
};

}  // namespace tn::test
