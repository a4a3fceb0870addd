// The plain-function entry points.
#include "telvane/TelvaneFunctions.h"

#include <gtest/gtest.h>

#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

using test::Awaited;
using Op = ipc::Operation;

TEST(TelvaneFunctions, NullHandleDoesNothing) {
  std::optional<Error> error;
  bool called = false;
  EXPECT_FALSE(TelvaneSendMessageWithError(nullptr, 1, 1, Value(), &error));
  EXPECT_FALSE(TelvaneSendMessageWithDictionary(nullptr, Value(Dictionary{}), &error));
  EXPECT_FALSE(error.has_value());
  EXPECT_FALSE(TelvaneFlushMessages(nullptr));
  TelvaneFlushMessagesWithCompletion(nullptr, [&](const std::optional<Error>&) { called = true; });
  TelvaneUpdateSharedDataWithDictionary(nullptr, Value(Dictionary{{"a", Value(1)}}));
  TelvaneUpdateSharedDataForKey(nullptr, "a", Value(1));
  TelvaneSetMessageBlock(nullptr, [&](const std::string&) { called = true; });
  TelvaneFetchStatesWithUserInfo(nullptr, Value(), [&](bool) { called = true; });
  EXPECT_FALSE(TelvaneUploadLogWithArray(nullptr, Value(Array{Value(Dictionary{})})));
  // Nothing was kept to be called later: with no handle there is nothing asynchronous.
  EXPECT_FALSE(called);
}

TEST(TelvaneFunctions, HierarchyTokenOfLevelTwoGivesLevelThree) {
  Value parent(Dictionary{{kTelvaneHierarchyTokenTokenID, Value("5D0C1F9A-0000-4000-8000-000000000001")},
                          {kTelvaneHierarchyTokenLevel, Value(2)}});
  for (const Value& child :
       {TelvaneNewHierarchyTokenFromParentToken(parent), TelvaneCreateHierarchyTokenFromParentToken(parent)}) {
    EXPECT_EQ(child[kTelvaneHierarchyTokenTokenID], Value("5D0C1F9A-0000-4000-8000-000000000001"));
    EXPECT_EQ(child[kTelvaneHierarchyTokenLevel], Value(3));
  }
  EXPECT_EQ(TelvaneNewHierarchyTokenFromParentToken(Value())[kTelvaneHierarchyTokenLevel], Value(0));
}

TEST(TelvaneFunctions, ErrorsComeBackInTheTelvaneDomain) {
  test::FakeDaemon daemon;
  auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
  ASSERT_NE(telvane, nullptr);
  std::optional<Error> error;
  EXPECT_FALSE(TelvaneSendMessageWithDictionary(telvane.get(), Value(Dictionary{{"ParametersType", Value(1)}}), &error));
  ASSERT_TRUE(error.has_value());
  // The method's error carries the text as its domain; the plain function normalises it.
  EXPECT_EQ(error->domain, "TelvaneErrorDomain");
  EXPECT_EQ(error->code, 7);
  EXPECT_EQ(error->description, "Missing mandatory parameter 'category'");

  error.reset();
  EXPECT_FALSE(TelvaneSendMessageWithError(telvane.get(), 0, 1, Value(), &error));
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(error->code, 4);

  error.reset();
  EXPECT_TRUE(TelvaneSendMessageWithError(telvane.get(), 3, 1, Value(), &error));
  EXPECT_FALSE(error.has_value());
  EXPECT_TRUE(daemon.waitForCalls(Op::SendMessageWithDictionary, 1));
}

TEST(TelvaneFunctions, ForwardToTheObject) {
  test::FakeDaemon daemon;
  daemon.setReply(Op::FetchStates, Array{Value(Array{Value("brindle")}), Value(), Value()});
  daemon.setReply(Op::SendMessageWithDictionary, Array{Value("ok")});
  daemon.setReply(Op::FetchDisplayURL, Array{Value()});
  auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
  ASSERT_NE(telvane, nullptr);

  Awaited<std::string> text;
  TelvaneSetMessageBlock(telvane.get(), text.setter());
  ASSERT_TRUE(telvane->messageLoggingBlock());
  Awaited<bool> fetched;
  TelvaneFetchStatesWithUserInfo(telvane.get(), test::clientUserInfo(), fetched.setter());
  EXPECT_EQ(fetched.wait(), std::optional<bool>(true));
  EXPECT_EQ(telvane->enabledBackendNames(), std::vector<std::string>{"brindle"});

  EXPECT_TRUE(TelvaneSendMessageWithDictionary(
      telvane.get(), Value(Dictionary{{"ParametersCategory", Value(2)}, {"ParametersType", Value(1)}}), nullptr));
  EXPECT_EQ(text.wait(), std::optional<std::string>("ok"));

  TelvaneUpdateSharedDataWithDictionary(telvane.get(), Value(Dictionary{{"k", Value("v")}}));
  TelvaneUpdateSharedDataForKey(telvane.get(), "k", Value());
  EXPECT_TRUE(TelvaneUploadLogWithArray(telvane.get(), Value(Array{Value(Dictionary{{"LogData", Value("x")}})})));
  EXPECT_FALSE(TelvaneUploadLogWithArray(telvane.get(), Value(Array{})));
  EXPECT_TRUE(TelvaneFlushMessages(telvane.get()));
  Awaited<std::optional<Error>> flushed;
  TelvaneFlushMessagesWithCompletion(telvane.get(), flushed.setter());
  EXPECT_TRUE(flushed.wait().has_value());

  std::vector<Op> operations;
  for (const auto& call : daemon.calls()) operations.push_back(call.operation);
  EXPECT_EQ(operations, (std::vector<Op>{Op::SetSessionInfo, Op::FetchStates, Op::FetchDisplayURL,
                                         Op::SendMessageWithDictionary, Op::UpdateSharedDataWithDictionary,
                                         Op::UpdateSharedDataForKey, Op::UploadLogData, Op::FlushMessages,
                                         Op::FlushMessages}));
}

}  // namespace
}  // namespace telvane
