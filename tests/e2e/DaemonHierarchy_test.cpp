// The real daemon with a tree of client sessions under one hierarchy token: filing by
// token and level, the dotted chain of ancestor identifiers recomputed when a
// session's user info changes, the gap left by a departed parent, and the data the
// sessions of one token share (which outlives them).
#include <gtest/gtest.h>

#include <algorithm>
#include <future>
#include <memory>
#include <mutex>

#include "e2e/E2eHelpers.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"
#include "telvane/Telvane.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr long kComponentType = 12;
constexpr const char* kUUIDPrefix = "initWithSessionDelegate: Initialized session with UUID ";

Value sessionInfo(unsigned sessionID, const Value& hierarchyToken) {
  Dictionary info{{"ComponentType", Value(kComponentType)}, {"SessionID", Value(sessionID)}};
  if (!hierarchyToken.isNull()) info.set("HierarchyToken", hierarchyToken);
  return Value(std::move(info));
}

Value userInfo(const std::string& clientName) {
  return Value(Dictionary{{"_clientName", Value(clientName)}, {"_serviceName", Value("hierarchy-e2e")}});
}

// The identifiers the daemon gave its sessions, in creation order.
std::vector<std::string> sessionIdentifiers(const DaemonProcess& daemon) {
  std::vector<std::string> identifiers;
  std::string prefix = kUUIDPrefix;
  for (const auto& text : daemon.logTexts()) {
    if (text.compare(0, prefix.size(), prefix) == 0) identifiers.push_back(text.substr(prefix.size()));
  }
  return identifiers;
}

// A client session whose daemon side has been configured; `identifier` is the
// daemon's identifier string of the session. Only one session may be opening at a
// time, so that creation order tells which identifier is whose.
struct Member {
  std::unique_ptr<Telvane> client;
  unsigned sessionID = 0;
  std::string identifier;
};

Member openMember(DaemonProcess& daemon, unsigned sessionID, const Value& hierarchyToken) {
  Member member;
  member.sessionID = sessionID;
  std::size_t before = sessionIdentifiers(daemon).size();
  member.client = Telvane::create(sessionInfo(sessionID, hierarchyToken), Value(), Value());
  EXPECT_TRUE(member.client) << "session " << sessionID;
  EXPECT_TRUE(daemon.waitForLogLine("setSessionInfo: Configuring session " + std::to_string(sessionID)));
  auto identifiers = sessionIdentifiers(daemon);
  EXPECT_EQ(identifiers.size(), before + 1);
  if (identifiers.size() == before + 1) member.identifier = identifiers.back();
  EXPECT_FALSE(member.identifier.empty());
  return member;
}

// Fetches states with new user info and waits for the daemon's answer; the result is
// whether the daemon reported backends.
std::optional<bool> fetchWithUserInfo(Telvane& client, const Value& info) {
  auto promise = std::make_shared<std::promise<bool>>();
  auto once = std::make_shared<std::once_flag>();
  auto future = promise->get_future();
  client.fetchReportingStatesWithUserInfo(info, [promise, once](bool received) {
    std::call_once(*once, [&] { promise->set_value(received); });
  });
  if (future.wait_for(20s) != std::future_status::ready) return std::nullopt;
  return future.get();
}

// Flushes and waits for the daemon's answer: everything the client sent before has
// been handled by its daemon-side session by then. The error text, or nothing.
std::optional<std::string> flushAndWait(Telvane& client) {
  auto promise = std::make_shared<std::promise<std::string>>();
  auto once = std::make_shared<std::once_flag>();
  auto future = promise->get_future();
  client.flushMessagesWithCompletion([promise, once](const std::optional<Error>& error) {
    std::call_once(*once, [&] { promise->set_value(error ? error->description : std::string()); });
  });
  if (future.wait_for(20s) != std::future_status::ready) return std::nullopt;
  return future.get();
}

std::string invalidatedLine(const Member& member) {
  return "invalidateReportingSession: TelvanedSession <TelvanedSession: session " +
         std::to_string(member.sessionID) + ", " + member.identifier + "> was invalidated";
}

std::string downstreamLine(unsigned sessionID) {
  return "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session " +
         std::to_string(sessionID);
}

std::string combinedLine(const std::string& chain, unsigned sessionID) {
  return "updateCombinedSessionID: Updating combined session ID '" + chain + "' for session " +
         std::to_string(sessionID) + " backends";
}

std::string checkingLine(const std::string& token, unsigned sessionID) {
  return "parentSessionIDStringForSession: Checking hierarchyToken '" + token + "' for session " +
         std::to_string(sessionID);
}

std::ptrdiff_t indexOf(const std::vector<std::string>& texts, const std::string& text) {
  auto it = std::find(texts.begin(), texts.end(), text);
  return it == texts.end() ? -1 : it - texts.begin();
}

}  // namespace

TEST(DaemonHierarchy, ChainsOfATreeAreBuiltFromTheSessionIdentifiersAndStopAtAGap) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  useDaemon(daemon);

  Value rootToken = Telvane::newHierarchyTokenFromParentToken(Value());
  Value childToken = Telvane::newHierarchyTokenFromParentToken(rootToken);
  Value grandchildToken = Telvane::newHierarchyTokenFromParentToken(childToken);
  std::string token = rootToken["token"].stringOrEmpty();
  ASSERT_EQ(token.size(), 36u);
  ASSERT_EQ(childToken["token"].stringOrEmpty(), token);
  ASSERT_EQ(grandchildToken["level"].integerValue(), 2);

  Member root = openMember(daemon, 101, rootToken);
  Member child = openMember(daemon, 202, childToken);
  Member grandchild = openMember(daemon, 303, grandchildToken);
  ASSERT_TRUE(root.client && child.client && grandchild.client);
  for (const auto& [member, level] : {std::pair{&root, 0}, std::pair{&child, 1}, std::pair{&grandchild, 2}}) {
    EXPECT_EQ(daemon.countLogLines("updateCorrelatedSessions: Adding session " + std::to_string(member->sessionID) +
                                   " to list for hierarchyToken " + token + " with hierarchyLevel " +
                                   std::to_string(level)),
              1u);
  }
  EXPECT_EQ(daemon.countLogPrefix("updateCorrelatedSessions: Session "), 0u) << "no session is standalone";
  // Setting the session info alone computes no chain.
  EXPECT_EQ(daemon.countLogPrefix("updateCombinedSessionID: "), 0u);

  std::string rootChildChain = root.identifier + "." + child.identifier;
  std::string fullChain = rootChildChain + "." + grandchild.identifier;

  // The grandchild's user info changes: it computes its own chain; it has no
  // descendants to update.
  auto fetched = fetchWithUserInfo(*grandchild.client, userInfo("grandchild"));
  ASSERT_TRUE(fetched.has_value());
  EXPECT_FALSE(*fetched) << "no storebag: no backends";
  EXPECT_TRUE(daemon.waitForLogLine("receivedUserInfo: Received new user info for session 303"));
  EXPECT_TRUE(daemon.waitForLogLine(checkingLine(token, 303)));
  EXPECT_TRUE(daemon.waitForLogLine(combinedLine(fullChain, 303)));
  EXPECT_TRUE(daemon.waitForLogLine("parentSessionForChild: Checking hierarchyToken '" + token + "' for session 303"));
  EXPECT_EQ(daemon.countLogPrefix("updateDownstreamSessions: "), 0u);
  EXPECT_EQ(daemon.countLogPrefix("parentSessionIDStringForSession: Found a gap"), 0u);

  // The same names again are no change: nothing is recomputed.
  ASSERT_TRUE(fetchWithUserInfo(*grandchild.client, userInfo("grandchild")).has_value());
  EXPECT_TRUE(daemon.waitForLogLine("fetchStatesWithUserInfo: Fetching states for session 303", 20s, 2));
  EXPECT_EQ(daemon.countLogLines("receivedUserInfo: Received new user info for session 303"), 1u);
  EXPECT_EQ(daemon.countLogLines(combinedLine(fullChain, 303)), 1u);

  // The child's: its own chain, then its descendant's.
  ASSERT_TRUE(fetchWithUserInfo(*child.client, userInfo("child")).has_value());
  EXPECT_TRUE(daemon.waitForLogLine(checkingLine(token, 202)));
  EXPECT_TRUE(daemon.waitForLogLine(combinedLine(rootChildChain, 202)));
  EXPECT_TRUE(daemon.waitForLogLine(downstreamLine(303)));
  EXPECT_TRUE(daemon.waitForLogLine(combinedLine(fullChain, 303), 20s, 2));
  EXPECT_EQ(daemon.countLogLines(downstreamLine(202)), 0u) << "a session is not its own descendant";

  // The root's: a root has no chain; every descendant is updated, in list order.
  ASSERT_TRUE(fetchWithUserInfo(*root.client, userInfo("root")).has_value());
  EXPECT_TRUE(daemon.waitForLogLine(downstreamLine(202)));
  EXPECT_TRUE(daemon.waitForLogLine(downstreamLine(303), 20s, 2));
  EXPECT_TRUE(daemon.waitForLogLine(combinedLine(rootChildChain, 202), 20s, 2));
  EXPECT_TRUE(daemon.waitForLogLine(combinedLine(fullChain, 303), 20s, 3));
  EXPECT_EQ(daemon.countLogLines(checkingLine(token, 101)), 0u);
  EXPECT_EQ(daemon.countLogPrefix("updateCombinedSessionID: Updating combined session ID '" + root.identifier + "' "),
            0u);
  {
    auto texts = daemon.logTexts();
    auto rootUpdate = indexOf(texts, "receivedUserInfo: Received new user info for session 101");
    auto childLine = indexOf(texts, downstreamLine(202));
    ASSERT_GE(rootUpdate, 0);
    ASSERT_GE(childLine, 0);
    EXPECT_LT(rootUpdate, childLine);
    // The grandchild's second downstream line is the one of the root's update.
    std::vector<std::ptrdiff_t> grandchildLines;
    for (std::size_t i = 0; i < texts.size(); ++i) {
      if (texts[i] == downstreamLine(303)) grandchildLines.push_back(static_cast<std::ptrdiff_t>(i));
    }
    ASSERT_EQ(grandchildLines.size(), 2u);
    EXPECT_LT(childLine, grandchildLines[1]);
  }

  // The level-1 session goes away: the grandchild's chain now stops at the gap at
  // its direct parent, so no chain is stamped.
  child.client.reset();
  ASSERT_TRUE(daemon.waitForLogLine(invalidatedLine(child)));
  ASSERT_TRUE(fetchWithUserInfo(*grandchild.client, userInfo("grandchild, orphaned")).has_value());
  EXPECT_TRUE(daemon.waitForLogLine("receivedUserInfo: Received new user info for session 303", 20s, 2));
  EXPECT_TRUE(daemon.waitForLogLine(
      "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete parentSessionID "
      "is '(null)'"));
  EXPECT_TRUE(daemon.waitForLogLine("parentSessionForChild: Unable to find session with hierarchy of 1 for "
                                    "hierarchyToken '" +
                                    token + "'"));
  EXPECT_EQ(daemon.countLogPrefix("updateCombinedSessionID: Updating combined session ID '"), 5u)
      << "three for the grandchild, two for the child, none after the gap";

  // A new level-1 session fills the gap: the next update stamps a chain through it.
  Member stepChild = openMember(daemon, 404, childToken);
  ASSERT_TRUE(stepChild.client);
  EXPECT_NE(stepChild.identifier, child.identifier);
  ASSERT_TRUE(fetchWithUserInfo(*grandchild.client, userInfo("grandchild, adopted")).has_value());
  EXPECT_TRUE(daemon.waitForLogLine(
      combinedLine(root.identifier + "." + stepChild.identifier + "." + grandchild.identifier, 303)));
  EXPECT_EQ(daemon.countLogPrefix("parentSessionIDStringForSession: Found a gap"), 1u);

  root.client.reset();
  grandchild.client.reset();
  stepChild.client.reset();
  EXPECT_TRUE(daemon.waitForLogLine(invalidatedLine(root)));
  EXPECT_TRUE(daemon.waitForLogLine(invalidatedLine(grandchild)));
  EXPECT_TRUE(daemon.waitForLogLine(invalidatedLine(stepChild)));
  EXPECT_EQ(daemon.countLogPrefix("parentSessionIDStringForSession: ERROR"), 0u);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(DaemonHierarchy, SessionsOfATokenShareOneMapThatOutlivesThem) {
  TempDir dir;
  DaemonProcess daemon(dir.str());
  ASSERT_TRUE(daemon.start());
  useDaemon(daemon);

  Value rootToken = Telvane::newHierarchyTokenFromParentToken(Value());
  std::string token = rootToken["token"].stringOrEmpty();
  ASSERT_FALSE(token.empty());
  auto updated = [&](std::size_t keys) {
    return "updateSharedDataForSession: hierarchyToken " + token + " now shares " + std::to_string(keys) + " keys";
  };
  auto removed = [&](std::size_t keys) {
    return "removeObjectFromSharedDataForSession: hierarchyToken " + token + " now shares " + std::to_string(keys) +
           " keys";
  };

  Member root = openMember(daemon, 1, rootToken);
  Member child = openMember(daemon, 2, Telvane::newHierarchyTokenFromParentToken(rootToken));
  Member standalone = openMember(daemon, 3, Value());
  ASSERT_TRUE(root.client && child.client && standalone.client);
  EXPECT_TRUE(daemon.waitForLogLine(
      "updateCorrelatedSessions: Session 3 has no correlated sessions as it is a standalone session"));

  // Keys from two members of the tree accumulate under the token.
  root.client->updateSharedDataWithDictionary(Value(Dictionary{{"a", Value(1)}, {"b", Value(2)}}));
  EXPECT_TRUE(daemon.waitForLogLine(updated(2)));
  child.client->updateSharedDataForKey("c", Value("three"));
  EXPECT_TRUE(daemon.waitForLogLine(updated(3)));
  // A key without a value is removed, whoever set it.
  child.client->updateSharedDataForKey("a", Value());
  EXPECT_TRUE(daemon.waitForLogLine(removed(2)));
  // The same key again overwrites: the count stays.
  root.client->updateSharedDataForKey("c", Value("again"));
  EXPECT_TRUE(daemon.waitForLogLine(updated(2), 20s, 2));

  // A standalone session shares nothing: its updates and removals touch no map.
  std::size_t updates = daemon.countLogPrefix("updateSharedDataForSession: ");
  std::size_t removals = daemon.countLogPrefix("removeObjectFromSharedDataForSession: ");
  standalone.client->updateSharedDataWithDictionary(Value(Dictionary{{"x", Value(1)}}));
  standalone.client->updateSharedDataForKey("y", Value("why"));
  standalone.client->updateSharedDataForKey("b", Value());
  auto flushed = flushAndWait(*standalone.client);
  ASSERT_TRUE(flushed.has_value());
  EXPECT_EQ(*flushed, "No backends available to send message")
      << "the daemon answered the flush that followed the updates";
  EXPECT_TRUE(daemon.waitForLogLine("flushMessagesWithCompletion: Flushing messages for session 3"));
  EXPECT_EQ(daemon.countLogPrefix("updateSharedDataForSession: "), updates);
  EXPECT_EQ(daemon.countLogPrefix("removeObjectFromSharedDataForSession: "), removals);

  // Every session goes; the token's map stays. A new session of the token adds two
  // keys to the two kept ("b" and "c").
  root.client.reset();
  child.client.reset();
  standalone.client.reset();
  ASSERT_TRUE(daemon.waitForLogLine(invalidatedLine(root)));
  ASSERT_TRUE(daemon.waitForLogLine(invalidatedLine(child)));
  ASSERT_TRUE(daemon.waitForLogLine(invalidatedLine(standalone)));
  Member returning = openMember(daemon, 4, rootToken);
  ASSERT_TRUE(returning.client);
  EXPECT_TRUE(daemon.waitForLogLine("updateCorrelatedSessions: Adding session 4 to list for hierarchyToken " + token +
                                    " with hierarchyLevel 0"));
  returning.client->updateSharedDataWithDictionary(Value(Dictionary{{"d", Value(4)}, {"e", Value(5)}}));
  EXPECT_TRUE(daemon.waitForLogLine(updated(4)));
  returning.client->updateSharedDataForKey("b", Value());
  EXPECT_TRUE(daemon.waitForLogLine(removed(3)));

  returning.client.reset();
  EXPECT_TRUE(daemon.waitForLogLine(invalidatedLine(returning)));
  EXPECT_EQ(daemon.stop(), 0);
}
