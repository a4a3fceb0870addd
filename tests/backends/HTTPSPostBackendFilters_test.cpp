// The server's event filters and the list matching of the client rules.
#include <gtest/gtest.h>

#include "backends/BackendTestSupport.h"

namespace telvane {
namespace {

using test::enablingRule;
using test::profileWithRules;
using test::strings;

class HTTPSPostBackendFiltersTest : public test::BackendTestBase {
 protected:
  void SetUp() override { backend = makeBackend(profileWithRules({enablingRule()})); }

  static Value filter(std::initializer_list<Dictionary::Entry> fields) { return Value(Dictionary(fields)); }

  Dictionary filtered(Dictionary dictionary) {
    backend->filterEvent(dictionary);
    return dictionary;
  }

  std::shared_ptr<HTTPSPostBackend> backend;
};

TEST_F(HTTPSPostBackendFiltersTest, KeysAreComparedIgnoringCase) {
  backend->createFiltersFromArray(Value(Array{filter({{"key", Value("Email")}, {"action", Value("remove")}})}));
  Dictionary result = filtered(Dictionary{{"email", Value("a@b.test")}, {"other", Value(1)}});
  EXPECT_FALSE(result.contains("email"));
  EXPECT_EQ(result.get("other"), Value(1));
}

TEST_F(HTTPSPostBackendFiltersTest, OnlyTheFirstFilterForAKeyActs) {
  backend->createFiltersFromArray(Value(Array{filter({{"key", Value("name")}, {"action", Value("sha256")}}),
                                              filter({{"key", Value("NAME")}, {"action", Value("remove")}})}));
  Dictionary result = filtered(Dictionary{{"name", Value("abc")}});
  EXPECT_EQ(result.get("name"), Value("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"));
}

TEST_F(HTTPSPostBackendFiltersTest, AMethodFilterNeedsThatMethod) {
  backend->createFiltersFromArray(
      Value(Array{filter({{"key", Value("a")}, {"action", Value("remove")}, {"method", Value(5)}}),
                  filter({{"key", Value("b")}, {"action", Value("remove")}})}));
  Dictionary withoutMethod = filtered(Dictionary{{"a", Value(1)}, {"b", Value(2)}});
  EXPECT_TRUE(withoutMethod.contains("a"));  // "_method" absent reads as 0
  EXPECT_FALSE(withoutMethod.contains("b"));
  Dictionary withMethod = filtered(Dictionary{{"a", Value(1)}, {"_method", Value(5)}});
  EXPECT_FALSE(withMethod.contains("a"));
}

TEST_F(HTTPSPostBackendFiltersTest, AStatusFilterNeedsThatStatus) {
  backend->createFiltersFromArray(
      Value(Array{filter({{"key", Value("a")}, {"action", Value("remove")}, {"status", Value("3")}})}));
  EXPECT_TRUE(filtered(Dictionary{{"a", Value(1)}, {"_status", Value(2)}}).contains("a"));
  EXPECT_FALSE(filtered(Dictionary{{"a", Value(1)}, {"_status", Value(3)}}).contains("a"));
}

TEST_F(HTTPSPostBackendFiltersTest, FirstFittingFilterIsChosenAmongMethods) {
  backend->createFiltersFromArray(
      Value(Array{filter({{"key", Value("a")}, {"action", Value("remove")}, {"method", Value(5)}}),
                  filter({{"key", Value("a")}, {"action", Value("sha256")}})}));
  // The first filter does not fit method 0; the second does.
  EXPECT_EQ(filtered(Dictionary{{"a", Value("abc")}}).get("a"),
            Value(TelvaneBackendBase::convertIntoSHA256("abc")));
}

TEST_F(HTTPSPostBackendFiltersTest, WhitelistValuesWithAnEmptyListRemovesEveryStringValue) {
  backend->createFiltersFromArray(Value(Array{
      filter({{"key", Value("a")}, {"action", Value("whitelistValues")}, {"value", Value::array()}}),
      filter({{"key", Value("b")}, {"action", Value("whitelistValues")}, {"value", Value::array()}})}));
  Dictionary result = filtered(Dictionary{{"a", Value("anything")}, {"b", Value(17)}});
  EXPECT_FALSE(result.contains("a"));
  EXPECT_EQ(result.get("b"), Value(17));  // not text: kept
}

TEST_F(HTTPSPostBackendFiltersTest, WhitelistAndBlacklistValuesMatchBySubstringIgnoringCase) {
  backend->createFiltersFromArray(Value(Array{
      filter({{"key", Value("w")}, {"action", Value("whitelistValues")}, {"value", strings({"GOOD"})}}),
      filter({{"key", Value("x")}, {"action", Value("whitelistValues")}, {"value", strings({"GOOD"})}}),
      filter({{"key", Value("b")}, {"action", Value("blacklistValues")}, {"value", strings({"secret", ""})}}),
      filter({{"key", Value("c")}, {"action", Value("blacklistValues")}, {"value", strings({"secret"})}})}));
  Dictionary result = filtered(Dictionary{{"w", Value("a good one")},
                                          {"x", Value("a bad one")},
                                          {"b", Value("Top-SECRET-file")},
                                          {"c", Value("public")}});
  EXPECT_TRUE(result.contains("w"));
  EXPECT_FALSE(result.contains("x"));
  EXPECT_FALSE(result.contains("b"));
  EXPECT_TRUE(result.contains("c"));  // an empty listed value matches nothing
}

TEST_F(HTTPSPostBackendFiltersTest, Sha256OfAbcAndNonTextLeftAlone) {
  backend->createFiltersFromArray(Value(Array{filter({{"key", Value("t")}, {"action", Value("sha256")}}),
                                              filter({{"key", Value("n")}, {"action", Value("sha256")}})}));
  Dictionary result = filtered(Dictionary{{"t", Value("abc")}, {"n", Value(42)}});
  EXPECT_EQ(result.get("t"), Value("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"));
  EXPECT_EQ(result.get("n"), Value(42));
}

TEST_F(HTTPSPostBackendFiltersTest, AnEmptyListKeepsTheEarlierFilters) {
  backend->createFiltersFromArray(Value(Array{filter({{"key", Value("a")}, {"action", Value("remove")}})}));
  ASSERT_EQ(backend->numberOfFilters(), 1u);
  backend->createFiltersFromArray(Value::array());
  EXPECT_EQ(backend->numberOfFilters(), 1u);
  EXPECT_FALSE(filtered(Dictionary{{"a", Value(1)}}).contains("a"));
  // A new non-empty list replaces them.
  backend->createFiltersFromArray(Value(Array{filter({{"key", Value("b")}, {"action", Value("remove")}})}));
  EXPECT_EQ(backend->numberOfFilters(), 1u);
  EXPECT_TRUE(filtered(Dictionary{{"a", Value(1)}}).contains("a"));
}

TEST_F(HTTPSPostBackendFiltersTest, CompiledRecordsKeepTheDescriptionsInOrder) {
  backend->createFiltersFromArray(
      Value(Array{filter({{"key", Value("a")}, {"action", Value("blacklistValues")}, {"value", strings({"x"})},
                          {"method", Value(4)}, {"status", Value(2)}}),
                  filter({{"key", Value("b")}, {"action", Value("whatever")}}), filter({{"action", Value("remove")}}),
                  Value("not a description")}));
  std::vector<HTTPSPostBackend::CompiledFilter> filters = backend->filters();
  ASSERT_EQ(filters.size(), 4u);
  EXPECT_EQ(filters[0].method, 4);
  EXPECT_EQ(filters[0].status, 2);
  EXPECT_EQ(filters[0].action, HTTPSPostBackend::kFilterActionBlacklistValues);
  EXPECT_EQ(filters[0].key, std::optional<std::string>("a"));
  EXPECT_EQ(filters[0].values, *strings({"x"}).asArray());
  EXPECT_EQ(filters[1].action, HTTPSPostBackend::kFilterActionNone);
  EXPECT_FALSE(filters[2].key.has_value());
  EXPECT_EQ(filters[3].method, -1);
  EXPECT_EQ(filters[3].status, -1);
  // None of the odd ones acts.
  Dictionary result = filtered(Dictionary{{"b", Value(1)}, {"c", Value(2)}});
  EXPECT_EQ(result.size(), 2u);
}

TEST_F(HTTPSPostBackendFiltersTest, FilterFieldsOfTheWrongTypeNeverAct) {
  backend->createFiltersFromArray(Value(Array{
      filter({{"key", Value(5)}, {"action", Value("remove")}}),
      filter({{"key", Value("a")}, {"action", Value(1)}}),
      filter({{"key", Value("b")}, {"action", Value("blacklistValues")}, {"value", Value("b")}}),
      filter({{"key", Value("c")}, {"action", Value("remove")}, {"method", Value::array()}})}));
  Dictionary result = filtered(Dictionary{{"5", Value(1)}, {"a", Value(2)}, {"b", Value("b")}, {"c", Value(3)}});
  EXPECT_TRUE(result.contains("5"));
  EXPECT_TRUE(result.contains("a"));
  EXPECT_TRUE(result.contains("b"));   // a value list that is no list matches nothing
  EXPECT_FALSE(result.contains("c"));  // a method of the wrong type means any
}

TEST_F(HTTPSPostBackendFiltersTest, NoFiltersChangeNothing) {
  Dictionary input{{"a", Value(1)}, {"email", Value("x")}};
  EXPECT_EQ(filtered(input), input);
}

TEST_F(HTTPSPostBackendFiltersTest, ListMatchingAnswersTheFlagForAnEmptyListAndItsOppositeForNoString) {
  using B = HTTPSPostBackend;
  for (bool whitelist : {true, false}) {
    EXPECT_EQ(B::matchExactStringWithList(Value(), std::string("a"), whitelist), whitelist);
    EXPECT_EQ(B::matchExactStringWithList(Value::array(), std::string("a"), whitelist), whitelist);
    EXPECT_EQ(B::matchStringWithList(Value::array(), std::nullopt, whitelist), whitelist);
    EXPECT_EQ(B::matchExactStringWithList(strings({"a"}), std::nullopt, whitelist), !whitelist);
    EXPECT_EQ(B::matchStringWithList(strings({"a"}), std::nullopt, whitelist), !whitelist);
    EXPECT_TRUE(B::matchExactStringWithList(strings({"x", "ALPHA"}), std::string("alpha"), whitelist));
    EXPECT_FALSE(B::matchExactStringWithList(strings({"alp"}), std::string("alpha"), whitelist));
    EXPECT_TRUE(B::matchStringWithList(strings({"LP"}), std::string("alpha"), whitelist));
    EXPECT_FALSE(B::matchStringWithList(strings({"alphas"}), std::string("alpha"), whitelist));
    EXPECT_FALSE(B::matchStringWithList(Value(Array{Value(1)}), std::string("1"), whitelist));
  }
}

}  // namespace
}  // namespace telvane
