// Reading replies: the error a reply reports, and the typed encoding of
// plug-in forms, on its own and across the wire.

#include <gtest/gtest.h>

#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/InternalInconsistency.h"
#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/CaptureSink.h"
#include "platform/relay/RelayError.h"
#include "tests/libtenon/client/FakeDaemon.h"

namespace tn {
namespace {

relay::Reply replyWith(Dictionary keys) { return Value(std::move(keys)); }

TEST(ErrorInReply, AnEmptyReplyOrAZeroCodeIsSuccess) {
  EXPECT_EQ(TNDaemonClient::errorInReply(replyWith({})), std::nullopt);
  EXPECT_EQ(TNDaemonClient::errorInReply(replyWith({{"errorcode", Value(uint64_t{0})}})), std::nullopt);
  // Keys a successful operation adds do not make it an error.
  EXPECT_EQ(TNDaemonClient::errorInReply(replyWith({{"extensions", Value(Array())}})), std::nullopt);
}

TEST(ErrorInReply, ACodeWithAMessageKeepsBoth) {
  const auto error = TNDaemonClient::errorInReply(
      replyWith({{"errorcode", Value(uint64_t{15})}, {"error", Value("Cannot locate PlugIn")}}));
  ASSERT_TRUE(error);
  EXPECT_EQ(*error, TNMakeError(15, std::string("Cannot locate PlugIn")));
}

TEST(ErrorInReply, ACodeWithoutAMessageGetsTheGenericText) {
  const auto error = TNDaemonClient::errorInReply(replyWith({{"errorcode", Value(uint64_t{15})}}));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kTenonErrorDomain);
  EXPECT_EQ(error->code(), 15);
  EXPECT_EQ(error->localizedDescription(), "unknown error returned by Tenon subsystem");
}

TEST(ErrorInReply, AConnectionErrorBecomesCodeFourWithItsDescription) {
  const Error relayError = relay::makeRelayError(relay::RelayErrorCode::ConnectionInvalid, "the peer went away");
  const auto error = TNDaemonClient::errorInReply(relay::Reply(relayError));
  ASSERT_TRUE(error);
  EXPECT_EQ(*error, TNMakeError(4, std::string("the peer went away")));
}

TEST(ErrorInReply, AMessageWithoutACodeIsAProtocolViolation) {
  const relay::Reply reply = replyWith({{"error", Value("half an error")}});
  try {
    (void)TNDaemonClient::errorInReply(reply);
    FAIL() << "no exception";
  } catch (const InternalInconsistency& violation) {
    EXPECT_STREQ(violation.what(), "tenond reported error without a code: half an error");
  }
  // A code of the wrong kind reads as no code at all.
  EXPECT_THROW((void)TNDaemonClient::errorInReply(
                   replyWith({{"errorcode", Value("15")}, {"error", Value("Cannot locate PlugIn")}})),
               InternalInconsistency);
}

// A form as the daemon exports it: every kind a form can hold, including
// those the plain wire mapping would not keep apart.
Value sampleForm() {
  return Value(Dictionary{
      {"hubProtocolVersion", Value(uint64_t{2})},
      {"identifier", Value("com.example.filter")},
      {"version", Value("1.10")},
      {"uuid", Value("E621E1F8-C36C-495A-93FC-0C247A3E6E5F")},
      {"lastmodified", Value(int64_t{1700000000})},
      {"systemResident", Value(true)},
      {"annotations", Value(Dictionary{{"election", Value(int64_t{1})}})},
      {"weight", Value(2.0)},
      {"hash", Value(Bytes{0xde, 0xad})},
      {"created", Value(Date{1363896240.5})},
      {"token", Value(*UUID::parse("0F3C6D2E-8E51-4D5F-9A0B-3C2D1E0F4A5B"))},
      {"offsets", Value(Array{Value(int64_t{-1}), Value(int64_t{0}), Value(uint64_t{7})})},
  });
}

class TypedForms : public ::testing::Test {
 protected:
  test::TempRoot root_;
  log::ScopedCaptureSink log_;  // undecodable values are logged as errors
};

TEST_F(TypedForms, OnlyVersionThreeEncodesAndDecodes) {
  EXPECT_TRUE(TNDaemonClient::convertToRelay(sampleForm(), 2).isNull());
  EXPECT_TRUE(TNDaemonClient::convertToRelay(sampleForm(), 4).isNull());

  TNDaemonClient client("nobody-listens");
  const Value encoded = TNDaemonClient::convertToRelay(sampleForm(), 3);
  ASSERT_NE(encoded.data(), nullptr) << "the typed encoding is a data value";
  EXPECT_TRUE(Value::identical(client.convertFromRelay(encoded), sampleForm()));

  client.setProtocolVersion(2);
  EXPECT_TRUE(client.convertFromRelay(encoded).isNull());
}

TEST_F(TypedForms, ValuesThatAreNoTypedEncodingDecodeToNone) {
  TNDaemonClient client("nobody-listens");
  EXPECT_TRUE(client.convertFromRelay(Value()).isNull());
  EXPECT_TRUE(client.convertFromRelay(Value("not data")).isNull());
  EXPECT_TRUE(client.convertFromRelay(Value(Bytes{0xff})).isNull());
  EXPECT_EQ(log_->count("ops", log::Level::Error, "cannot decode typed value"), 2u) << "null is absence, not an error";
}

TEST_F(TypedForms, MatchesSurviveTheWireExactly) {
  const Value forms(Array{sampleForm(), sampleForm()});
  test::FakeDaemon daemon("forms", [&](const Value&) {
    return Value(Dictionary{{"matches", TNDaemonClient::convertToRelay(forms, 3)}});
  });
  TNDaemonClient client("forms");
  BlockingReply pending;
  client.matchPlugIns({}, 0, pending.block());
  const relay::Reply reply = pending.wait(test::kPatience);
  ASSERT_TRUE(reply) << reply.error().description();
  EXPECT_EQ(TNDaemonClient::errorInReply(reply), std::nullopt);
  EXPECT_TRUE(Value::identical(client.convertFromRelay((*reply)["matches"]), forms));
}

}  // namespace
}  // namespace tn
