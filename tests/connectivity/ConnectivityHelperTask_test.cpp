#include "connectivity/ConnectivityHelperTask.h"

#include <gtest/gtest.h>

#include "platform/Log.h"

namespace telvane {
namespace {

TEST(ConnectivityHelperTask, LogsCreationAndDestructionWithItsDescription) {
  log::LogCapture capture;
  {
    ConnectivityHelperTask task("Task_0000002a", nullptr);
    EXPECT_EQ(task.taskDescription(), "Task_0000002a");
    EXPECT_TRUE(capture.contains(log::Level::Info, "ConnectivityHelperTask with ID <Task_0000002a> created"));
    EXPECT_FALSE(capture.contains("ConnectivityHelperTask with ID <Task_0000002a> dealloced"));
  }
  EXPECT_TRUE(capture.contains(log::Level::Info, "ConnectivityHelperTask with ID <Task_0000002a> dealloced"));
}

TEST(ConnectivityHelperTask, CollectsReceivedDataInOrderAndKeepsItsCompletion) {
  int calls = 0;
  std::optional<std::string> seen;
  ConnectivityHelperTask task("Task_00000001",
                              [&](std::optional<std::string> data, std::optional<HttpResponse>,
                                  std::optional<TelvaneError>) {
                                ++calls;
                                seen = data;
                              });
  EXPECT_EQ(task.receivedData(), "");
  task.appendReceivedData("ab");
  task.appendReceivedData("cd");
  EXPECT_EQ(task.receivedData(), "abcd");
  ASSERT_TRUE(task.completionHandler());
  task.completionHandler()(task.receivedData(), std::nullopt, std::nullopt);
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(seen, "abcd");
  task.setCompletionHandler(nullptr);
  EXPECT_FALSE(task.completionHandler());
}

}  // namespace
}  // namespace telvane
