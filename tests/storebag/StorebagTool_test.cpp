// Runs the built telvane-storebag.
#include <gtest/gtest.h>

#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/ToolRunner.h"
#include "platform/Json.h"
#include "platform/PropertyList.h"
#include "storebag/StorebagEnvelope.h"

namespace telvane {
namespace {

using test::runTool;
using test::ToolRun;

class StorebagToolTest : public ::testing::Test {
 protected:
  ToolRun run(const std::vector<std::string>& arguments, const std::vector<std::string>& environment = {}) {
    std::vector<std::string> env = environment;
    env.push_back("TELVANE_DEFAULTS_DB=" + (dir_ / "defaults.sqlite3").string());
    env.push_back("TELVANED_DEVICE_INFO=" + (dir_ / "device-info.conf").string());
    return runTool(tool_, arguments, env);
  }
  std::string path(const std::string& name) { return (dir_ / name).string(); }

  std::string tool_ = test::builtToolPath("telvane-storebag");
  test::TempDir dir_;
};

TEST_F(StorebagToolTest, KeygenSignVerifyShowRoundTrip) {
  ASSERT_EQ(run({"keygen", "--private", path("k.pem"), "--public", path("k.der")}).exitCode, 0);
  test::writeFile(dir_ / "doc.json",
                  R"({"version":"7","shared_values":{"==h":"a,b"},"release":{"m":{"hosts":"==h"}},)"
                  R"("zembra_internal":{"i":{"on":true}},"release_timeout":9})");
  ASSERT_EQ(run({"sign", "--key", path("k.pem"), path("doc.json"), path("env")}).exitCode, 0);

  // The envelope is what the daemon verifies.
  std::optional<Bytes> der = publicKeyFileLoader(path("k.der"))();
  ASSERT_TRUE(der);
  std::string envelopeText = test::readFile(dir_ / "env");
  Bytes envelope(envelopeText.begin(), envelopeText.end());
  EXPECT_EQ(envelopeText.rfind("bplist00", 0), 0u);
  EnvelopeCheck check = checkStorebagEnvelope(envelope, publicKeyFileLoader(path("k.der")));
  EXPECT_EQ(check.status, EnvelopeStatus::Verified);

  ToolRun verified = run({"verify", "--public", path("k.der"), path("env")});
  EXPECT_EQ(verified.exitCode, 0);
  EXPECT_EQ(verified.out, "OK\n");

  ToolRun shown = run({"show", path("env"), "--public", path("k.der"), "--environment", "4", "--client-type", "7"});
  ASSERT_EQ(shown.exitCode, 0) << shown.err;
  Result<Value> section = json::parse(shown.out);
  ASSERT_TRUE(section.ok()) << shown.out;
  EXPECT_EQ(*section, Value(Dictionary{{"m", Value(Dictionary{{"hosts", Value(Array{Value("a"), Value("b")})}})},
                                       {"release_timeout", Value(9)}}));
  EXPECT_NE(shown.out.find("\n    "), std::string::npos) << "pretty JSON";

  ToolRun internal = run({"show", path("env"), "--public", path("k.der"), "--environment", "2", "--client-type", "11"});
  ASSERT_EQ(internal.exitCode, 0);
  EXPECT_EQ(json::parse(internal.out).value()["i"]["on"], Value(true));
}

TEST_F(StorebagToolTest, ShowUsesTheDefaultKeyAndSettingsEnvironment) {
  const test::TestKeyPair& keys = test::TestKeyPair::shared();
  keys.writePublicKey(dir_ / "default.der");
  Bytes envelope = test::SignedEnvelopeBuilder().sign(
      test::StorebagBuilder().version("1").backend("seed", "s", Value(1)).backend("release", "r", Value(2)).build());
  test::writeFile(dir_ / "env", std::string(envelope.begin(), envelope.end()));
  // No environment type set, not an internal build: the seed section.
  ToolRun shown = run({"show", path("env"), "--client-type", "5"}, {"TELVANED_PUBLIC_KEY=" + path("default.der")});
  ASSERT_EQ(shown.exitCode, 0) << shown.err;
  EXPECT_EQ(json::parse(shown.out).value(), Value(Dictionary{{"s", Value(1)}}));
}

TEST_F(StorebagToolTest, SignAcceptsPropertyListDocuments) {
  test::TestKeyPair::shared().writePrivateKey(dir_ / "k.pem");
  test::TestKeyPair::shared().writePublicKey(dir_ / "k.der");
  test::writeFile(dir_ / "doc.plist", test::StorebagBuilder().version("x").emptySection("release").buildXml());
  ASSERT_EQ(run({"sign", "--key", path("k.pem"), path("doc.plist"), path("env")}).exitCode, 0);
  ToolRun shown = run({"show", path("env"), "--public", path("k.der")});
  ASSERT_EQ(shown.exitCode, 0);
  EXPECT_EQ(json::parse(shown.out).value()["version"], Value("x"));
}

TEST_F(StorebagToolTest, VerifyReportsTheReasonAndFails) {
  test::TestKeyPair::shared().writePublicKey(dir_ / "k.der");
  Bytes good = test::SignedEnvelopeBuilder().sign(test::StorebagBuilder().version("1").build());
  Bytes tampered = test::tamper::changeBagByte(good, 10);
  test::writeFile(dir_ / "bad", std::string(tampered.begin(), tampered.end()));
  ToolRun verified = run({"verify", "--public", path("k.der"), path("bad")});
  EXPECT_EQ(verified.exitCode, 1);
  EXPECT_EQ(verified.out, "signature can not be verified\n");

  Bytes unsigned_ = test::tamper::removeKey(good, "signature");
  test::writeFile(dir_ / "nosig", std::string(unsigned_.begin(), unsigned_.end()));
  verified = run({"verify", "--public", path("k.der"), path("nosig")});
  EXPECT_EQ(verified.exitCode, 1);
  EXPECT_EQ(verified.out, "signature is missing\n");

  ToolRun shown = run({"show", path("bad"), "--public", path("k.der")});
  EXPECT_EQ(shown.exitCode, 1);
}

TEST_F(StorebagToolTest, UsageErrorsExitTwo) {
  EXPECT_EQ(run({}).exitCode, 2);
  EXPECT_EQ(run({"frobnicate"}).exitCode, 2);
  EXPECT_EQ(run({"keygen", "--private", path("k.pem")}).exitCode, 2);
  EXPECT_EQ(run({"sign", "--key", path("k.pem"), path("only-one")}).exitCode, 2);
  EXPECT_EQ(run({"verify"}).exitCode, 2);
  EXPECT_EQ(run({"verify", "--bogus", "x", path("e")}).exitCode, 2);
  EXPECT_EQ(run({"show", path("e"), "--environment", "four"}).exitCode, 2);
  EXPECT_EQ(run({"show", path("e"), "--client-type"}).exitCode, 2);
}

}  // namespace
}  // namespace telvane
