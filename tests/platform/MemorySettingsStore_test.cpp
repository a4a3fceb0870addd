#include "platform/MemorySettingsStore.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <thread>
#include <vector>

namespace telvane {
namespace {

TEST(MemorySettingsStoreTest, TypedValuesRoundTrip) {
  auto store = makeMemorySettingsStore();
  ASSERT_NE(store, nullptr);
  const std::pair<const char*, Value> values[] = {
      {"string", Value("hello")},
      {"number-text", Value("123")},
      {"int", Value(std::numeric_limits<long long>::min())},
      {"uint", Value(std::numeric_limits<unsigned long long>::max())},
      {"double", Value(0.1)},
      {"true", Value(true)},
      {"false", Value(false)},
      {"bytes", Value(Bytes{0, 1, 2})},
      {"date", Value::date(1'700'000'000.5)},
  };
  for (const auto& [key, value] : values) ASSERT_TRUE(store->write("d", key, value));
  for (const auto& [key, value] : values) {
    SCOPED_TRACE(key);
    auto read = store->read("d", key);
    ASSERT_TRUE(read.has_value());
    EXPECT_EQ(read->type(), value.type());
    EXPECT_EQ(*read, value);
  }
}

TEST(MemorySettingsStoreTest, AbsentIsToldApartFromEmptyAndFalse) {
  auto store = makeMemorySettingsStore();
  EXPECT_FALSE(store->read("d", "missing").has_value());
  store->write("d", "empty", Value(""));
  store->write("d", "no", Value(false));
  store->write("d", "zero", Value(0));
  ASSERT_TRUE(store->read("d", "empty").has_value());
  EXPECT_EQ(*store->read("d", "empty"), Value(""));
  ASSERT_TRUE(store->read("d", "no").has_value());
  EXPECT_EQ(*store->read("d", "no"), Value(false));
  ASSERT_TRUE(store->read("d", "zero").has_value());
  EXPECT_FALSE(store->read("d", "missing").has_value());
}

TEST(MemorySettingsStoreTest, OverwriteReplacesValueAndType) {
  auto store = makeMemorySettingsStore();
  store->write("d", "k", Value("text"));
  store->write("d", "k", Value(7));
  EXPECT_EQ(*store->read("d", "k"), Value(7));
  EXPECT_TRUE(store->read("d", "k")->isInteger());
}

TEST(MemorySettingsStoreTest, RemoveKeyAndDomain) {
  auto store = makeMemorySettingsStore();
  store->write("d", "a", Value(1));
  store->write("d", "b", Value(2));
  EXPECT_TRUE(store->remove("d", "a"));
  EXPECT_FALSE(store->remove("d", "a"));
  EXPECT_FALSE(store->read("d", "a").has_value());
  EXPECT_TRUE(store->read("d", "b").has_value());
  EXPECT_TRUE(store->removeDomain("d"));
  EXPECT_FALSE(store->removeDomain("d"));
  EXPECT_FALSE(store->read("d", "b").has_value());
  EXPECT_TRUE(store->readDomain("d").empty());
  // A domain emptied key by key is gone as well.
  store->write("e", "only", Value(1));
  EXPECT_TRUE(store->remove("e", "only"));
  EXPECT_FALSE(store->removeDomain("e"));
}

TEST(MemorySettingsStoreTest, DomainsAreSeparate) {
  auto store = makeMemorySettingsStore();
  store->write("one", "k", Value("first"));
  store->write("two", "k", Value("second"));
  EXPECT_EQ(*store->read("one", "k"), Value("first"));
  EXPECT_EQ(*store->read("two", "k"), Value("second"));
  store->removeDomain("one");
  EXPECT_EQ(*store->read("two", "k"), Value("second"));
}

TEST(MemorySettingsStoreTest, ReadDomainIsSortedByKey) {
  auto store = makeMemorySettingsStore();
  store->write("d", "zeta", Value(3));
  store->write("d", "alpha", Value(1));
  store->write("d", "Mid", Value(2));
  store->write("other", "beta", Value(9));
  auto entries = store->readDomain("d");
  ASSERT_EQ(entries.size(), 3u);
  EXPECT_EQ(entries[0].first, "Mid");
  EXPECT_EQ(entries[1].first, "alpha");
  EXPECT_EQ(entries[2].first, "zeta");
  EXPECT_EQ(entries[2].second, Value(3));
}

TEST(MemorySettingsStoreTest, StoredContainersAreCopies) {
  auto store = makeMemorySettingsStore();
  Value dict = Value(Dictionary{{"a", Value(1)}});
  store->write("d", "dict", dict);
  dict.asDictionary()->set("b", Value(2));
  auto read = store->read("d", "dict");
  ASSERT_TRUE(read.has_value());
  EXPECT_EQ(read->asDictionary()->size(), 1u);
  EXPECT_FALSE(read->sharesContainerWith(dict));
  read->asDictionary()->set("c", Value(3));
  EXPECT_EQ(store->read("d", "dict")->asDictionary()->size(), 1u);
}

TEST(MemorySettingsStoreTest, NaNIsKept) {
  auto store = makeMemorySettingsStore();
  store->write("d", "nan", Value(std::nan("")));
  auto read = store->read("d", "nan");
  ASSERT_TRUE(read.has_value());
  EXPECT_TRUE(std::isnan(read->doubleValue()));
}

TEST(MemorySettingsStoreTest, ConcurrentWritersFromManyThreads) {
  auto store = makeMemorySettingsStore();
  constexpr int kThreads = 8;
  constexpr int kKeysPerThread = 200;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&store, t] {
      for (int i = 0; i < kKeysPerThread; ++i) {
        std::string key = "k" + std::to_string(t) + "-" + std::to_string(i);
        store->write("d", key, Value(t * 1000 + i));
        store->read("d", key);
        store->readDomain("d");
        if (i % 10 == 0) store->remove("d", key);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  auto entries = store->readDomain("d");
  EXPECT_EQ(entries.size(), static_cast<std::size_t>(kThreads * (kKeysPerThread - kKeysPerThread / 10)));
  EXPECT_EQ(*store->read("d", "k3-7"), Value(3007));
  EXPECT_FALSE(store->read("d", "k3-10").has_value());
}

}  // namespace
}  // namespace telvane
