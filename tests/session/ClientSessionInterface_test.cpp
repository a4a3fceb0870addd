#include "session/ClientSessionInterface.h"

#include <gtest/gtest.h>

#include "platform/Log.h"
#include "support/SessionTestHarness.h"

using namespace telvane;
using namespace telvane::test;

TEST(ClientSessionInterfaceTest, ErrorTravelsAsDomainCodeDescriptionMap) {
  Value error = ClientSessionInterface::errorValue(makeTelvaneError(-1, "No backends available to send message"));
  ASSERT_TRUE(error.isDictionary());
  EXPECT_EQ(error["domain"].stringOrEmpty(), "TelvaneErrorDomain");
  EXPECT_EQ(error["code"].integerValue(), -1);
  EXPECT_EQ(error["description"].stringOrEmpty(), "No backends available to send message");
  EXPECT_TRUE(ClientSessionInterface::errorValue(std::nullopt).isNull());
}

namespace {

class ClientSessionInterfaceCallTest : public ::testing::Test {
 protected:
  log::LogCapture capture;
  TestEnvironment env;
};

TEST_F(ClientSessionInterfaceCallTest, SharedDataCallsReachTheAgentUnderItsLock) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::UpdateSharedDataWithDictionary, {Value(Dictionary{{"a", Value(1)}})});
  h.client().send(ipc::Operation::UpdateSharedDataForKey, {Value("b"), Value("two")});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.delegate()->sharedData(), Value(Dictionary{{"a", Value(1)}, {"b", Value("two")}}));

  h.client().send(ipc::Operation::UpdateSharedDataForKey, {Value("a"), Value()});
  ASSERT_TRUE(h.client().call(ipc::Operation::FetchDisplayURL, {}));
  EXPECT_EQ(h.delegate()->removedSharedKeys(), std::vector<std::string>{"a"});
  EXPECT_EQ(h.delegate()->sharedData(), Value(Dictionary{{"b", Value("two")}}));
}

TEST_F(ClientSessionInterfaceCallTest, FinishAndDisplayURLTravel) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::FinishSessionGracefully, {});
  auto reply = h.client().call(ipc::Operation::FetchDisplayURL, {});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, Array{Value("URL not available")});
  EXPECT_TRUE(h.session()->hasFinishedGracefully());
}

TEST_F(ClientSessionInterfaceCallTest, UploadWithoutDescriptorPassesNone) {
  auto backend = std::make_shared<FakeBackend>("upload_server", BackendKind::Upload);
  env.backends->add(backend);
  SessionTestHarness h(env);
  h.run([&] { h.session()->createBackendsWithStorebag(Value::dictionary()); });
  auto reply = h.client().call(ipc::Operation::UploadFileAtPath, {Value("/var/tmp/x.log"), Value()});
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, (Array{Value(false), Value(false)}));
  ASSERT_EQ(backend->uploads().size(), 1u);
  EXPECT_EQ(backend->uploads()[0].path, "/var/tmp/x.log");
  EXPECT_FALSE(backend->uploads()[0].token);
  EXPECT_EQ(backend->uploads()[0].contents, "");
}

TEST_F(ClientSessionInterfaceCallTest, WrongArgumentsEndTheConnectionAndTearTheSessionDown) {
  SessionTestHarness h(env);
  h.client().send(ipc::Operation::SetSessionInfo, {Value("not a map")});
  ASSERT_TRUE(h.client().waitUntilDisconnected());
  EXPECT_TRUE(waitUntil([&] { return h.session()->isTornDown(); }));
  EXPECT_TRUE(capture.containsPrefix("IpcConnection: closing connection"));
}

}  // namespace
