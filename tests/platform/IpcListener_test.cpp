#include "platform/IpcListener.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <future>

#include "platform/IpcConnection.h"
#include "support/TempDir.h"

using namespace telvane;
using namespace std::chrono_literals;

TEST(IpcListener, AcceptsConnectionsOnItsPath) {
  test::TempDir dir;
  std::string path = (dir / "sock").string();
  std::promise<int> accepted;
  auto listener = IpcListener::create(SerialQueue::create("test.listener"),
                                      [&](UniqueFd fd) { accepted.set_value(fd.get() >= 0 ? 1 : 0); });
  ASSERT_TRUE(listener->listen(path).ok());
  EXPECT_FALSE(listener->socketActivated());
  listener->resume();
  auto client = IpcConnection::connect(path, SerialQueue::create("test.client"));
  ASSERT_TRUE(client.ok()) << client.error();
  auto f = accepted.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(f.get(), 1);
  struct stat st {};
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
}

TEST(IpcListener, ReplacesAStaleSocketFileAndRemovesItsOwnOnCancel) {
  test::TempDir dir;
  std::string path = (dir / "sock").string();
  // A listener that is never cleaned up leaves its socket file behind, as a daemon
  // that died would.
  auto stale = IpcListener::create(SerialQueue::create("test.stale"), [](UniqueFd) {});
  ASSERT_TRUE(stale->listen(path).ok());
  auto queue = SerialQueue::create("test.second");
  std::promise<void> accepted;
  auto second = IpcListener::create(queue, [&](UniqueFd) { accepted.set_value(); });
  ASSERT_TRUE(second->listen(path).ok()) << "a leftover socket file must not block binding";
  second->resume();
  auto client = IpcConnection::connect(path, SerialQueue::create("test.client"));
  ASSERT_TRUE(client.ok()) << client.error();
  auto f = accepted.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  second->cancel();
  queue->sync([] {});
  struct stat st {};
  EXPECT_NE(::stat(path.c_str(), &st), 0) << "cancel removes the socket file it bound";
}

TEST(IpcListener, ConnectToAPathWithoutListenerFails) {
  test::TempDir dir;
  auto client = IpcConnection::connect((dir / "nobody").string(), SerialQueue::create("test.client"));
  EXPECT_FALSE(client.ok());
  EXPECT_NE(client.error().find("connect"), std::string::npos);
}
