#include "storebag/StorebagMacros.h"

#include <gtest/gtest.h>

#include "support/StorebagBuilder.h"
#include "platform/Log.h"

namespace telvane {
namespace {

using test::StorebagBuilder;

Value strings(std::initializer_list<const char*> texts) {
  Array array;
  for (const char* text : texts) array.emplace_back(text);
  return Value(std::move(array));
}

TEST(ApplySharedValuesTest, MacroBecomesArrayOfCommaSeparatedParts) {
  log::LogCapture capture;
  Value document = StorebagBuilder()
                       .sharedValue("==hosts", Value("a,b"))
                       .backend("release", "metrix", Value(Dictionary{{"hosts", Value("==hosts")}}))
                       .build();
  Value expanded = applySharedValues(document);
  EXPECT_EQ(expanded["release"]["metrix"]["hosts"], strings({"a", "b"}));
  EXPECT_FALSE(expanded.asDictionary()->contains("shared_values"));
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "expandMacroForDataSet: Expanding macro '==hosts' into '" +
                                   strings({"a", "b"}).description() + "'"));
}

TEST(ApplySharedValuesTest, UnknownMacroStaysAString) {
  Value document = StorebagBuilder()
                       .sharedValue("==hosts", Value("a,b"))
                       .backend("release", "metrix", Value(Dictionary{{"x", Value("==x")}, {"plain", Value("a,b")}}))
                       .build();
  Value expanded = applySharedValues(document);
  EXPECT_EQ(expanded["release"]["metrix"]["x"], Value("==x"));
  EXPECT_EQ(expanded["release"]["metrix"]["plain"], Value("a,b"));
}

TEST(ApplySharedValuesTest, ValueWithoutCommaBecomesOneElementArray) {
  Value document = StorebagBuilder()
                       .sharedValue("==one", Value("solo"))
                       .backend("development", "metrix", Value("==one"))
                       .build();
  EXPECT_EQ(applySharedValues(document)["development"]["metrix"], strings({"solo"}));
}

TEST(ApplySharedValuesTest, PartsAreNotTrimmedAndEmptyPartsStay) {
  Value document =
      StorebagBuilder().sharedValue("==m", Value(" a,,b ")).backend("seed", "k", Value("==m")).build();
  EXPECT_EQ(applySharedValues(document)["seed"]["k"], strings({" a", "", "b "}));
}

TEST(ApplySharedValuesTest, NonStringSharedValueIsInsertedAsItIs) {
  Value document = StorebagBuilder().sharedValue("==n", Value(42)).backend("release", "k", Value("==n")).build();
  EXPECT_EQ(applySharedValues(document)["release"]["k"], Value(42));
}

TEST(ApplySharedValuesTest, MacrosAreReplacedAtAnyDepth) {
  Value deep(Dictionary{
      {"list", Value(Array{Value("==m"), Value(Array{Value("keep"), Value(Dictionary{{"inner", Value("==m")}})})})}});
  Value document = StorebagBuilder().sharedValue("==m", Value("p,q")).backend("zembra_internal", "b", deep).build();
  Value expanded = applySharedValues(document);
  const Value& list = expanded["zembra_internal"]["b"]["list"];
  ASSERT_TRUE(list.isArray());
  EXPECT_EQ((*list.asArray())[0], strings({"p", "q"}));
  const Value& nested = (*list.asArray())[1];
  EXPECT_EQ((*nested.asArray())[0], Value("keep"));
  EXPECT_EQ((*nested.asArray())[1]["inner"], strings({"p", "q"}));
}

TEST(ApplySharedValuesTest, InsertedValueIsNotExpandedAgain) {
  Value document = StorebagBuilder()
                       .sharedValue("==outer", Value("==inner"))
                       .sharedValue("==inner", Value("x,y"))
                       .backend("release", "k", Value("==outer"))
                       .build();
  EXPECT_EQ(applySharedValues(document)["release"]["k"], strings({"==inner"}));
}

TEST(ApplySharedValuesTest, OnlyTheFourSectionsAreExpanded) {
  Value document = StorebagBuilder()
                       .sharedValue("==m", Value("a"))
                       .set("elsewhere", Value(Dictionary{{"k", Value("==m")}}))
                       .backend("release", "k", Value("==m"))
                       .build();
  Value expanded = applySharedValues(document);
  EXPECT_EQ(expanded["elsewhere"]["k"], Value("==m"));
  EXPECT_EQ(expanded["release"]["k"], strings({"a"}));
}

TEST(ApplySharedValuesTest, MissingOrEmptyTableLeavesDocumentUnchanged) {
  Value without = StorebagBuilder().backend("release", "k", Value("==m")).build();
  Value result = applySharedValues(without);
  EXPECT_TRUE(result.sharesContainerWith(without));

  Value empty = StorebagBuilder().set("shared_values", Value::dictionary()).backend("release", "k", Value("==m")).build();
  Value kept = applySharedValues(empty);
  EXPECT_TRUE(kept.asDictionary()->contains("shared_values"));
  EXPECT_EQ(kept["release"]["k"], Value("==m"));
}

TEST(ApplySharedValuesTest, InputDocumentIsNotChanged) {
  Value document = StorebagBuilder()
                       .sharedValue("==m", Value("a,b"))
                       .backend("release", "k", Value(Array{Value("==m")}))
                       .build();
  Value before = document.deepCopy();
  Value expanded = applySharedValues(document);
  EXPECT_EQ(document, before);
  EXPECT_NE(expanded, before);
}

TEST(ExpandMacroForDataSetTest, NullContainerOrDataSetDoesNothing) {
  Value dataSet(Dictionary{{"==m", Value(1)}});
  Value container(Dictionary{{"k", Value("==m")}});
  Value null;
  expandMacroForDataSet(null, std::string("k"), dataSet);
  EXPECT_TRUE(null.isNull());
  expandMacroForDataSet(container, std::string("k"), Value());
  EXPECT_EQ(container["k"], Value("==m"));
}

TEST(ExpandMacroForDataSetTest, ArrayIndexSlotAndMismatchedSlots) {
  Value dataSet(Dictionary{{"==m", Value(1)}});
  Value array(Array{Value("==m"), Value("==m")});
  expandMacroForDataSet(array, std::size_t{1}, dataSet);
  EXPECT_EQ(array, Value(Array{Value("==m"), Value(1)}));
  expandMacroForDataSet(array, std::size_t{5}, dataSet);  // past the end
  expandMacroForDataSet(array, std::string("k"), dataSet);  // a key on an array
  EXPECT_EQ(array, Value(Array{Value("==m"), Value(1)}));
  Value scalar("==m");
  expandMacroForDataSet(scalar, std::string("k"), dataSet);
  EXPECT_EQ(scalar, Value("==m"));
}

TEST(ExpandMacroForDataSetTest, StringMustBeginWithTheMarker) {
  Value dataSet(Dictionary{{"a==m", Value(1)}, {"=m", Value(2)}});
  Value container(Dictionary{{"x", Value("a==m")}, {"y", Value("=m")}});
  expandMacroForDataSet(container, std::string("x"), dataSet);
  expandMacroForDataSet(container, std::string("y"), dataSet);
  EXPECT_EQ(container["x"], Value("a==m"));
  EXPECT_EQ(container["y"], Value("=m"));
}

}  // namespace
}  // namespace telvane
