#include "util/PersistentIdentifiers.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Log.h"
#include "support/ScriptedRandom.h"
#include "support/TempDir.h"

namespace telvane {
namespace {

using test::ScriptedRandom;
using test::TempDir;

bool looksLikeUuid(const std::string& s) {
  if (s.size() != 36) return false;
  for (std::size_t i = 0; i < s.size(); ++i) {
    bool dash = i == 8 || i == 13 || i == 18 || i == 23;
    if (dash != (s[i] == '-')) return false;
    if (!dash && std::string("0123456789ABCDEF").find(s[i]) == std::string::npos) return false;
  }
  return true;
}

std::string stored(SettingsStore& store, const std::string& key) {
  auto v = store.read(kTelvaneDefaultsDomain, key);
  return v && v->isString() ? *v->asString() : std::string("<absent>");
}

TEST(PersistentIdentifiers, CustomSuffixIdentifierSurvivesRestarts) {
  TempDir dir;
  const std::string db = (dir / "defaults.sqlite3").string();
  ScriptedRandom random;
  std::string first;
  {
    auto store = openSqliteSettingsStore(db);
    ASSERT_NE(store, nullptr);
    first = getPersistentIdentifierForCustomClientIDSuffix(*store, random, "clientA", "serviceB");
    EXPECT_TRUE(looksLikeUuid(first)) << first;
    EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(*store, random, "clientA", "serviceB"), first);
  }
  // A new store object on the same file: a restarted process.
  auto reopened = openSqliteSettingsStore(db);
  ASSERT_NE(reopened, nullptr);
  // Its randomness must differ from the first run's, or a lost value would come back:
  // skip the scripted value the first run used.
  ScriptedRandom otherRandom;
  otherRandom.uuidString();
  log::LogCapture capture;
  EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(*reopened, otherRandom, "clientA", "serviceB"), first);
  EXPECT_TRUE(capture.contains(log::Level::Info, "getPersistentIdentifierForCustomClientIDSuffix: The value for "
                                                 "uuid:clientA:serviceB: " + first));
  EXPECT_EQ(stored(*reopened, "uuid:clientA:serviceB"), first);
  // Other suffixes: another identifier.
  EXPECT_NE(getPersistentIdentifierForCustomClientIDSuffix(*reopened, otherRandom, "clientA", "serviceC"), first);
}

TEST(PersistentIdentifiers, NoSuffixesUseTheKeyUuidColonColon) {
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  log::LogCapture capture;
  auto value = getPersistentIdentifierForCustomClientIDSuffix(*store, random, std::nullopt, std::nullopt);
  EXPECT_EQ(stored(*store, "uuid::"), value);
  EXPECT_TRUE(capture.contains("getPersistentIdentifierForCustomClientIDSuffix: The value for uuid::: " + value));
  auto onlyB = getPersistentIdentifierForCustomClientIDSuffix(*store, random, std::nullopt, "b");
  EXPECT_EQ(stored(*store, "uuid::b"), onlyB);
  EXPECT_NE(onlyB, value);
}

TEST(PersistentIdentifiers, StoredValueIsUsedAsItIs) {
  auto store = makeMemorySettingsStore();
  store->write(kTelvaneDefaultsDomain, "uuid:a:b", Value("preset-value"));
  ScriptedRandom random;
  EXPECT_EQ(getPersistentIdentifierForCustomClientIDSuffix(*store, random, "a", "b"), "preset-value");
}

TEST(PersistentIdentifiers, NonTextStoredValueIsReplaced) {
  auto store = makeMemorySettingsStore();
  store->write(kTelvaneDefaultsDomain, "uuidRespectDNU", Value(42));
  ScriptedRandom random;
  auto value = getPersistentIdentifierForDNU(*store, random, true);
  EXPECT_TRUE(looksLikeUuid(value));
  EXPECT_EQ(stored(*store, "uuidRespectDNU"), value);
}

TEST(PersistentIdentifiers, DnuIdentifiersByFlag) {
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  log::LogCapture capture;
  auto respect = getPersistentIdentifierForDNU(*store, random, true);
  auto override_ = getPersistentIdentifierForDNU(*store, random, false);
  EXPECT_NE(respect, override_);
  EXPECT_EQ(stored(*store, "uuidRespectDNU"), respect);
  EXPECT_EQ(stored(*store, "uuidOverrideDNU"), override_);
  EXPECT_EQ(getPersistentIdentifierForDNU(*store, random, true), respect);
  EXPECT_TRUE(capture.contains(log::Level::Info, "getPersistentIdentifierForDNU: The value for uuidRespectDNU: " + respect));
  EXPECT_TRUE(
      capture.contains(log::Level::Info, "getPersistentIdentifierForDNU: The value for uuidOverrideDNU: " + override_));
  EXPECT_EQ(capture.count("getPersistentIdentifierForDNU: The value for uuidRespectDNU: " + respect), 2u);
}

TEST(PersistentIdentifiers, RegenerateTrueChangesOnlyRespect) {
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  auto respect = getPersistentIdentifierForDNU(*store, random, true);
  auto override_ = getPersistentIdentifierForDNU(*store, random, false);
  log::LogCapture capture;
  auto fresh = regeneratePersistentIdentifierForDNU(*store, random, true);
  EXPECT_TRUE(looksLikeUuid(fresh));
  EXPECT_NE(fresh, respect);
  EXPECT_EQ(stored(*store, "uuidRespectDNU"), fresh);
  EXPECT_EQ(stored(*store, "uuidOverrideDNU"), override_);
  EXPECT_EQ(getPersistentIdentifierForDNU(*store, random, true), fresh);
  EXPECT_TRUE(
      capture.contains(log::Level::Info, "regeneratePersistentIdentifierForDNU: Set new value for uuidRespectDNU: " + fresh));
}

TEST(PersistentIdentifiers, RegenerateFalseChangesOnlyOverride) {
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  auto respect = getPersistentIdentifierForDNU(*store, random, true);
  auto fresh = regeneratePersistentIdentifierForDNU(*store, random, false);
  EXPECT_EQ(stored(*store, "uuidOverrideDNU"), fresh);
  EXPECT_EQ(stored(*store, "uuidRespectDNU"), respect);
}

TEST(PersistentIdentifiers, DnuFunctionsWaitForTheClassLock) {
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  std::unique_lock<std::recursive_mutex> held(telvaneClassLock());
  std::atomic<bool> done{false};
  std::thread t([&] {
    getPersistentIdentifierForDNU(*store, random, true);
    done = true;
  });
  // While the lock is held here the other thread cannot store anything. Without the
  // lock it would be done within microseconds; watch it for a while.
  const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(200);
  bool storedWhileLocked = false;
  while (std::chrono::steady_clock::now() < until) {
    if (done.load() || store->read(kTelvaneDefaultsDomain, "uuidRespectDNU").has_value()) {
      storedWhileLocked = true;
      break;
    }
    std::this_thread::yield();
  }
  held.unlock();
  t.join();
  EXPECT_FALSE(storedWhileLocked);
  EXPECT_TRUE(done.load());
  EXPECT_TRUE(store->read(kTelvaneDefaultsDomain, "uuidRespectDNU").has_value());
}

TEST(PersistentIdentifiers, ClassLockIsRecursiveAndProcessWide) {
  std::lock_guard<std::recursive_mutex> outer(telvaneClassLock());
  EXPECT_EQ(&telvaneClassLock(), &telvaneClassLock());
  // The same thread may call the DNU functions while holding the lock.
  auto store = makeMemorySettingsStore();
  ScriptedRandom random;
  auto v = regeneratePersistentIdentifierForDNU(*store, random, false);
  EXPECT_EQ(getPersistentIdentifierForDNU(*store, random, false), v);
}

TEST(PersistentIdentifiers, ConcurrentDnuCallersAgree) {
  auto store = makeMemorySettingsStore();
  auto random = Random::system();
  std::vector<std::string> values(8);
  std::vector<std::thread> threads;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&, i] { values[i] = getPersistentIdentifierForDNU(*store, *random, true); });
  }
  for (auto& t : threads) t.join();
  for (const auto& v : values) EXPECT_EQ(v, values[0]);
}

TEST(PersistentIdentifiers, ConvertIntoSha256OfAscii) {
  EXPECT_EQ(convertIntoSHA256("abc"), "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_EQ(convertIntoSHA256(""), "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");
}

TEST(PersistentIdentifiers, ConvertIntoSha256TruncatesNonAsciiToUtf16Length) {
  // "héllo": 6 UTF-8 bytes, 5 UTF-16 units: the digest covers "h\xc3\xa9ll".
  EXPECT_EQ(convertIntoSHA256("h\xc3\xa9llo"), "57f3ab0d8e5e8a0254d599a0a3eccb11b7a93e7355530ba92118328ec7c41388");
  // Two CJK characters: 6 bytes, 2 units: the first 2 bytes.
  EXPECT_EQ(convertIntoSHA256("\xe6\x97\xa5\xe6\x9c\xac"),
            "36714a7932a5940c8de18c47f09a2ab0965e49b2eb92553d1c91d98c4d714337");
  // An emoji (surrogate pair, 2 units) and "a": 5 bytes, 3 units.
  EXPECT_EQ(convertIntoSHA256("\xf0\x9f\x98\x80" "a"),
            "b38af6aef10b9620ceb4fe55a4aaf8def5e4d9bd99bd1ebff06a0d44220546a2");
}

TEST(PersistentIdentifiers, Utf16Length) {
  EXPECT_EQ(utf16Length(""), 0u);
  EXPECT_EQ(utf16Length("abc"), 3u);
  EXPECT_EQ(utf16Length("h\xc3\xa9llo"), 5u);
  EXPECT_EQ(utf16Length("\xe6\x97\xa5"), 1u);
  EXPECT_EQ(utf16Length("\xf0\x9f\x98\x80"), 2u);
}

}  // namespace
}  // namespace telvane
