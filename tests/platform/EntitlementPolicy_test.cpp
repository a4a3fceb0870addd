#include "platform/EntitlementPolicy.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/Log.h"
#include "support/TempDir.h"

using namespace telvane;

namespace {
const std::string kEntitlement = "com.zembra.private.telvaned";

PeerCredentials peer(uid_t uid, gid_t gid, std::vector<gid_t> groups = {}) {
  PeerCredentials c;
  c.uid = uid;
  c.gid = gid;
  c.groups = std::move(groups);
  return c;
}
}  // namespace

TEST(EntitlementPolicy, GrantsByUidAndGid) {
  EntitlementPolicy policy;
  policy.addText("com.zembra.private.telvaned uid:1000\ncom.zembra.private.telvaned gid:50\n", "test");
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(1000, 1)), std::optional<bool>(true));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(7, 50)), std::optional<bool>(true));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(7, 1, {3, 50})), std::optional<bool>(true));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(7, 1, {3})), std::nullopt);
  EXPECT_EQ(policy.valueFor("com.zembra.other", peer(1000, 1)), std::nullopt);
}

TEST(EntitlementPolicy, GrantsByUserAndGroupName) {
  EntitlementPolicy policy;
  policy.addText("com.zembra.private.telvaned user:root\ncom.zembra.private.telvaned group:root\n", "test");
  EXPECT_EQ(policy.grantCount(), 2u);
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(0, 12345)), std::optional<bool>(true));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(4242, 0)), std::optional<bool>(true));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(4242, 4242)), std::nullopt);
}

TEST(EntitlementPolicy, CommentsAndBlankLinesAreSkippedAndBadLinesLogged) {
  log::LogCapture capture;
  EntitlementPolicy policy;
  policy.addText(
      "# who may report\n"
      "\n"
      "com.zembra.private.telvaned uid:5   # trailing comment\n"
      "com.zembra.private.telvaned\n"
      "com.zembra.private.telvaned pid:3\n"
      "com.zembra.private.telvaned uid:abc\n"
      "com.zembra.private.telvaned user:no-such-user-here\n"
      "com.zembra.private.telvaned uid:1 extra\n",
      "policy.conf");
  EXPECT_EQ(policy.grantCount(), 1u);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "EntitlementPolicy: policy.conf:4: expected '<entitlement> <subject>'"));
  EXPECT_TRUE(capture.contains(log::Level::Error, "EntitlementPolicy: policy.conf:5: unknown subject 'pid:3'"));
  EXPECT_TRUE(capture.contains(log::Level::Error, "EntitlementPolicy: policy.conf:6: no such uid 'abc'"));
  EXPECT_TRUE(
      capture.contains(log::Level::Error, "EntitlementPolicy: policy.conf:7: no such user 'no-such-user-here'"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "EntitlementPolicy: policy.conf:8: expected '<entitlement> <subject>'"));
  EXPECT_EQ(policy.valueFor(kEntitlement, peer(5, 5)), std::optional<bool>(true));
}

TEST(EntitlementPolicy, LoadsEveryFileOfTheDirectory) {
  test::TempDir dir;
  test::writeFile(dir / "10-a.conf", "com.zembra.private.telvaned uid:11\n");
  test::writeFile(dir / "20-b.conf", "com.zembra.private.telvaned uid:22\n");
  auto policy = EntitlementPolicy::load(dir.str());
  EXPECT_EQ(policy.grantCount(), 2u);
  EXPECT_TRUE(policy.valueFor(kEntitlement, peer(22, 22)).has_value());
}

TEST(EntitlementPolicy, MissingDirectoryIsAnEmptyPolicy) {
  auto policy = EntitlementPolicy::load("/nonexistent/telvane/entitlements.d");
  EXPECT_EQ(policy.grantCount(), 0u);
  EXPECT_FALSE(policy.valueFor(kEntitlement, peer(0, 0)).has_value());
}
