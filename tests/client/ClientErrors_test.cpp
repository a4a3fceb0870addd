#include "client/ClientErrors.h"

#include <gtest/gtest.h>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"

namespace telvane::client {
namespace {

TEST(ClientErrors, MissingParameterTextIsTheDomain) {
  Error error = missingParameterError("Missing mandatory parameter 'type'");
  EXPECT_EQ(error.domain, "Missing mandatory parameter 'type'");
  EXPECT_EQ(error.code, 7);
  EXPECT_EQ(error.description, "Missing mandatory parameter 'type'");
  EXPECT_EQ(makeError(4, "x").domain, "TelvaneErrorDomain");
}

TEST(ClientErrors, ReplyErrorMapBecomesAnError) {
  EXPECT_FALSE(errorFromReplyValue(Value()).has_value());
  EXPECT_FALSE(errorFromReplyValue(Value("not a map")).has_value());
  auto error = errorFromReplyValue(Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                                    {"code", Value(503)},
                                                    {"description", Value("Service Unavailable")},
                                                    {"userInfo", Value(Dictionary{{"retry", Value(true)}})}}));
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(error->domain, "TelvaneErrorDomain");
  EXPECT_EQ(error->code, 503);
  EXPECT_EQ(error->description, "Service Unavailable");
  EXPECT_EQ(error->userInfo, Value(Dictionary{{"retry", Value(true)}}));
}

TEST(ClientErrors, SessionInfoCheck) {
  log::LogCapture capture;
  EXPECT_EQ(validateSessionInfo(Value())->code, 2);
  EXPECT_EQ(validateSessionInfo(Value("text"))->code, 2);
  EXPECT_EQ(capture.count("validateSessionInfo: sessionInfo is nil"), 2u);
  EXPECT_EQ(validateSessionInfo(Value(Dictionary{}))->code, 3);
  EXPECT_EQ(validateSessionInfo(test::clientSessionInfo(4))->code, 3);
  EXPECT_EQ(validateSessionInfo(test::clientSessionInfo(31))->code, 3);
  EXPECT_EQ(capture.count("validateSessionInfo: clientType is invalid"), 3u);
  EXPECT_FALSE(validateSessionInfo(test::clientSessionInfo(5)).has_value());
  EXPECT_FALSE(validateSessionInfo(test::clientSessionInfo(30)).has_value());
  // The integer value of a text counts, as everywhere.
  EXPECT_FALSE(validateSessionInfo(Value(Dictionary{{"ComponentType", Value("12")}})).has_value());
}

}  // namespace
}  // namespace telvane::client
