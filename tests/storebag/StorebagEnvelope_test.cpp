#include "storebag/StorebagEnvelope.h"

#include <gtest/gtest.h>

#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "platform/Crypto.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "storebag/StorebagDocument.h"

namespace telvane {
namespace {

using test::bytesOf;
using test::SignedEnvelopeBuilder;
using test::StorebagBuilder;
using test::TestKeyPair;

class StorebagEnvelopeTest : public ::testing::Test {
 protected:
  Value document_ = StorebagBuilder()
                        .version("3.0")
                        .sharedValue("==hosts", Value("a,b"))
                        .backend("release", "metrix", Value(Dictionary{{"hosts", Value("==hosts")}}))
                        .build();
  Bytes envelope_ = SignedEnvelopeBuilder().sign(document_);
  test::TempDir dir_;
  StorebagDiskCache cache_{dir_.str(), false};
  StorebagVerifier verifier_{TestKeyPair::shared().publicKeyLoader(), &cache_};
  log::LogCapture capture_;
};

TEST_F(StorebagEnvelopeTest, GoodEnvelopeYieldsExpandedDocument) {
  std::optional<Value> document = verifier_.verify("confera", envelope_, false);
  ASSERT_TRUE(document);
  EXPECT_EQ((*document)["release"]["metrix"]["hosts"], Value(Array{Value("a"), Value("b")}));
  EXPECT_FALSE(document->asDictionary()->contains("shared_values"));
  EXPECT_FALSE(cache_.load("confera").has_value()) << "nothing is saved without the save flag";
}

TEST_F(StorebagEnvelopeTest, XmlEnvelopeIsAccepted) {
  std::optional<Value> document = verifier_.verify("confera", SignedEnvelopeBuilder().signAsXml(document_), false);
  ASSERT_TRUE(document);
  EXPECT_EQ((*document)["version"], Value("3.0"));
}

TEST_F(StorebagEnvelopeTest, SaveFlagWritesTheEnvelopeAsPassedIn) {
  ASSERT_TRUE(verifier_.verify("confera", envelope_, true));
  EXPECT_TRUE(capture_.contains(log::Level::Info, "fetchStorebagWithName: storebag 'confera' has been saved to disk cache"));
  EXPECT_EQ(cache_.load("confera"), std::optional<Bytes>(envelope_));
}

TEST_F(StorebagEnvelopeTest, NotAPropertyListLogsParseErrorAndMissingSignature) {
  EXPECT_FALSE(verifier_.verify("confera", bytesOf("this is not a property list"), true));
  EXPECT_TRUE(capture_.containsPrefix("fetchStorebagWithName: propertyListWithData error "));
  EXPECT_TRUE(capture_.contains(log::Level::Error, "fetchStorebagWithName: Signature is missing"));
  EXPECT_FALSE(cache_.load("confera").has_value());
}

TEST_F(StorebagEnvelopeTest, MissingSignatureIsLogged) {
  EXPECT_FALSE(verifier_.verify("confera", test::tamper::removeKey(envelope_, "signature"), false));
  EXPECT_TRUE(capture_.contains(log::Level::Error, "fetchStorebagWithName: Signature is missing"));
}

TEST_F(StorebagEnvelopeTest, EnvelopeThatIsNotADictionaryHasNoSignature) {
  Result<Bytes> array = plist::encodeBinary(Value(Array{Value("signature"), Value("bag")}));
  EXPECT_FALSE(verifier_.verify("confera", *array, false));
  EXPECT_TRUE(capture_.contains(log::Level::Error, "fetchStorebagWithName: Signature is missing"));
}

TEST_F(StorebagEnvelopeTest, FallbackDocumentIsRefusedForItsMissingSignature) {
  EXPECT_FALSE(verifier_.verify("confera", defaultStorebagData(), false));
  EXPECT_TRUE(capture_.contains(log::Level::Error, "fetchStorebagWithName: Signature is missing"));
}

TEST_F(StorebagEnvelopeTest, MissingBagFailsSilently) {
  EXPECT_FALSE(verifier_.verify("confera", test::tamper::removeKey(envelope_, "bag"), false));
  EXPECT_EQ(checkStorebagEnvelope(test::tamper::removeKey(envelope_, "bag"), TestKeyPair::shared().publicKeyLoader()).status,
            EnvelopeStatus::BadBagEncoding);
  EXPECT_TRUE(capture_.texts().empty());
}

TEST_F(StorebagEnvelopeTest, BadBase64FailsSilently) {
  // One character left over cannot form base64.
  Bytes badSignature = test::tamper::setKey(envelope_, "signature", Value("A"));
  EXPECT_FALSE(verifier_.verify("confera", badSignature, false));
  EXPECT_EQ(checkStorebagEnvelope(badSignature, TestKeyPair::shared().publicKeyLoader()).status,
            EnvelopeStatus::BadSignatureEncoding);
  Bytes badBag = test::tamper::setKey(envelope_, "bag", Value("QUJD\nR"));
  EXPECT_FALSE(verifier_.verify("confera", badBag, false));
  EXPECT_EQ(checkStorebagEnvelope(badBag, TestKeyPair::shared().publicKeyLoader()).status,
            EnvelopeStatus::BadBagEncoding);
  Bytes numberSignature = test::tamper::setKey(envelope_, "signature", Value(12));
  EXPECT_FALSE(verifier_.verify("confera", numberSignature, false));
  EXPECT_TRUE(capture_.texts().empty());
}

TEST_F(StorebagEnvelopeTest, CharactersOutsideTheAlphabetAreIgnored) {
  Result<Value> fields = plist::decode(envelope_);
  std::string signature = (*fields)["signature"].stringOrEmpty();
  std::string broken;
  for (std::size_t i = 0; i < signature.size(); ++i) {
    broken += signature[i];
    if (i % 16 == 15) broken += "\n *";
  }
  EXPECT_TRUE(verifier_.verify("confera", test::tamper::setKey(envelope_, "signature", Value(broken)), false));
}

TEST_F(StorebagEnvelopeTest, SignatureByAnotherKeyIsNotVerified) {
  TestKeyPair other;
  Bytes foreign = SignedEnvelopeBuilder(other).sign(document_);
  EXPECT_FALSE(verifier_.verify("confera", foreign, true));
  EXPECT_TRUE(capture_.containsPrefix("fetchStorebagWithName: Signature can not be verified, 0x"));
  EXPECT_FALSE(cache_.load("confera").has_value());
}

TEST_F(StorebagEnvelopeTest, TamperedBagFailsAndLeavesPreviousFileUntouched) {
  ASSERT_TRUE(verifier_.verify("confera", envelope_, true));
  Bytes tampered = test::tamper::changeBagByte(envelope_, 20);
  EXPECT_FALSE(verifier_.verify("confera", tampered, true));
  EXPECT_TRUE(capture_.containsPrefix("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_EQ(cache_.load("confera"), std::optional<Bytes>(envelope_));
}

TEST_F(StorebagEnvelopeTest, MissingPublicKeyFailsSilently) {
  StorebagVerifier noKey([]() -> std::optional<Bytes> { return std::nullopt; }, &cache_);
  EXPECT_FALSE(noKey.verify("confera", envelope_, true));
  StorebagVerifier badKey([]() -> std::optional<Bytes> { return bytesOf("not der"); }, &cache_);
  EXPECT_FALSE(badKey.verify("confera", envelope_, true));
  StorebagVerifier noFile(publicKeyFileLoader((dir_ / "absent.der").string()), &cache_);
  EXPECT_FALSE(noFile.verify("confera", envelope_, true));
  EXPECT_TRUE(capture_.texts().empty());
  EXPECT_FALSE(cache_.load("confera").has_value());
}

TEST_F(StorebagEnvelopeTest, KeyFileIsReadOnEveryCheck) {
  auto path = dir_ / "key.der";
  StorebagVerifier fromFile(publicKeyFileLoader(path.string()), nullptr);
  EXPECT_FALSE(fromFile.verify("confera", envelope_, false));
  TestKeyPair::shared().writePublicKey(path);
  EXPECT_TRUE(fromFile.verify("confera", envelope_, false));
  TestKeyPair other;
  other.writePublicKey(path);
  EXPECT_FALSE(fromFile.verify("confera", envelope_, false));
}

TEST_F(StorebagEnvelopeTest, BagThatIsNotAPropertyListIsSavedButYieldsNothing) {
  Bytes envelope = SignedEnvelopeBuilder().signBag(bytesOf("plain text, not a list"));
  EXPECT_FALSE(verifier_.verify("confera", envelope, true));
  EXPECT_EQ(checkStorebagEnvelope(envelope, TestKeyPair::shared().publicKeyLoader()).status,
            EnvelopeStatus::BagNotPropertyList);
  EXPECT_EQ(cache_.load("confera"), std::optional<Bytes>(envelope));
}

TEST_F(StorebagEnvelopeTest, SignatureCoversDecodedBagBytes) {
  Result<Value> fields = plist::decode(envelope_);
  Result<Bytes> bag = crypto::base64Decode((*fields)["bag"].stringOrEmpty());
  Result<Bytes> signature = crypto::base64Decode((*fields)["signature"].stringOrEmpty());
  Result<crypto::PublicKey> key = crypto::PublicKey::fromDer(TestKeyPair::shared().publicKeyDer());
  ASSERT_TRUE(bag && signature && key);
  EXPECT_TRUE(verifyStorebagSignature(*key, *bag, *signature));
  Bytes text((*fields)["bag"].stringOrEmpty().begin(), (*fields)["bag"].stringOrEmpty().end());
  EXPECT_FALSE(verifyStorebagSignature(*key, text, *signature));
}

TEST(EnvelopeStatusTextTest, NamesEveryOutcome) {
  EXPECT_EQ(envelopeStatusText(EnvelopeStatus::Verified), "OK");
  EXPECT_EQ(envelopeStatusText(EnvelopeStatus::SignatureInvalid), "signature can not be verified");
  EXPECT_EQ(envelopeStatusText(EnvelopeStatus::SignatureMissing), "signature is missing");
}

}  // namespace
}  // namespace telvane
