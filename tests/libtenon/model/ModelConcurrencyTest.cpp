// Records and sandbox extensions used from several threads at once, as the
// daemon's queues use them: single reads and writes of a record's fields,
// and issuing, consuming and releasing tokens (the key cache and the table
// of held extensions). Run under ThreadSanitizer (label "concurrency").

#include <gtest/gtest.h>

#include <cstdlib>
#include <thread>
#include <vector>

#include "libtenon/model/TNPlugInCore.h"
#include "libtenon/model/TNSandboxExtension.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace tn {
namespace {

constexpr int kThreads = 4;
constexpr int kRounds = 200;

TEST(ModelConcurrency, RecordFieldsAreReadAndWrittenFromManyThreads) {
  auto record = TNPlugInCore::create(
      "x", URL::fileURLWithPath("/p/X.tnx"),
      Value(Dictionary{{"XTExtension", Dictionary{{"XTExtensionAttributes", Dictionary{{"XTExtensionVersion", "1"}}}}}}),
      Value(), UUID::random());
  record->setOriginalIdentifier("x");
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([record, t] {
      for (int i = 0; i < kRounds; ++i) {
        if (t % 2 == 0) {
          record->setLocalizedName("name " + std::to_string(i));
          record->setAnnotations(Value(Dictionary{{"election", i % 2}}));
          record->setLastModified(i);
        } else {
          Result<Dictionary> form = record->exportForm();
          ASSERT_TRUE(form);
          ASSERT_TRUE(TNPlugInCore::createWithForm(Value(*form)));
          ASSERT_FALSE(record->diagnose().has_value() && record->identifier() != "x");
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
}

TEST(ModelConcurrency, TokensAreIssuedConsumedAndReleasedFromManyThreads) {
  test::TempDirectory root;
  ::setenv("TENON_ROOT", root.path().c_str(), 1);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&root, t] {
      for (int i = 0; i < kRounds / 4; ++i) {
        Result<std::string> token =
            t % 2 == 0 ? issueFileExtension(URL::fileURLWithPath(root.path())) : issueServiceExtension("com.example.s");
        ASSERT_TRUE(token) << token.error().description();
        TNSandboxExtension holder(*token);
        holder.consume();
        ASSERT_TRUE(holder.isConsumed());
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  ::unsetenv("TENON_ROOT");
}

}  // namespace
}  // namespace tn
