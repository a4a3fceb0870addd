// Telvane's uploads and digest key against a fake daemon.
#include "client/TelvaneImpl.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

using test::Awaited;
using test::FakeDaemon;
using Op = ipc::Operation;

class TelvaneUploadTest : public ::testing::Test {
 protected:
  void SetUp() override {
    telvane_ = Telvane::create(test::clientSessionInfo(), test::clientUserInfo(), Value());
    ASSERT_NE(telvane_, nullptr);
  }
  void startWithBackends(Array backends) {
    daemon_.setReply(Op::StartConfig, Array{Value(std::move(backends)), Value(), Value()});
    Awaited<bool> started;
    telvane_->startConfigurationWithCompletionHandler(started.setter());
    ASSERT_EQ(started.wait(), std::optional<bool>(true));
  }

  FakeDaemon daemon_;
  test::TempDir dir_;
  std::unique_ptr<Telvane> telvane_;
};

TEST_F(TelvaneUploadTest, ServerSupportsFileUploadWhenAnUploadBackendIsEnabled) {
  log::LogCapture capture;
  EXPECT_FALSE(telvane_->serverSupportsFileUpload());
  EXPECT_TRUE(capture.contains("serverSupportsFileUpload:NO (0 backends)"));
  startWithBackends({Value("brindle"), Value("upload_server")});
  EXPECT_TRUE(telvane_->serverSupportsFileUpload());
  EXPECT_TRUE(capture.contains("serverSupportsFileUpload:YES (2 backends)"));
}

TEST_F(TelvaneUploadTest, UploadPassesAReadOnlyDescriptorOfTheFile) {
  const auto file = dir_ / "report.log";
  test::writeFile(file, "line one\nline two\n");
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(file.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(true));
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].arguments[0], Value(file.string()));
  const std::string token = "com.zembra.telvane.upload";
  EXPECT_EQ(uploads[0].arguments[1], Value(Bytes(token.begin(), token.end())));
  ASSERT_EQ(uploads[0].descriptorContents.size(), 1u);
  EXPECT_EQ(uploads[0].descriptorContents[0], "line one\nline two\n");
  EXPECT_TRUE(uploads[0].descriptorReadOnly[0]);
}

TEST_F(TelvaneUploadTest, FileURLIsAcceptedAndTheDaemonsAnswerIsPassedOn) {
  const auto file = dir_ / "crash.txt";
  test::writeFile(file, "x");
  daemon_.setReply(Op::UploadFileAtPath, Array{Value(false), Value(false)});
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL("file://" + file.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(false));
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].arguments[0], Value(file.string()));
}

TEST_F(TelvaneUploadTest, RelativePathIsMadeAbsoluteForTheDaemon) {
  test::writeFile(dir_ / "relative.log", "r");
  const auto previous = std::filesystem::current_path();
  std::filesystem::current_path(dir_.path());
  Awaited<bool> uploaded;
  const bool accepted = telvane_->uploadFileWithURL(std::string("relative.log"), uploaded.setter());
  std::filesystem::current_path(previous);
  EXPECT_TRUE(accepted);
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(true));
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].arguments[0], Value((dir_ / "relative.log").string()));
  EXPECT_EQ(uploads[0].descriptorContents, std::vector<std::string>{"r"});
}

TEST_F(TelvaneUploadTest, UploadWithoutAReadableFileFails) {
  log::LogCapture capture;
  EXPECT_FALSE(telvane_->uploadFileWithURL(std::nullopt));
  EXPECT_TRUE(capture.contains("uploadFileWithURL: fileURL provided is nil"));

  const auto missing = dir_ / "missing.log";
  EXPECT_FALSE(telvane_->uploadFileWithURL(missing.string()));
  EXPECT_TRUE(capture.contains("uploadFileWithURL: Failed to get sandbox extension for path " + missing.string() +
                               ", errno 2"));

  telvane_.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  EXPECT_TRUE(daemon_.calls(Op::UploadFileAtPath).empty());
}

TEST_F(TelvaneUploadTest, SymbolicLinkIsHandedOverAsTheLinkItselfNeverFollowed) {
  const auto target = dir_ / "target.log";
  const auto link = dir_ / "link.log";
  test::writeFile(target, "secret");
  std::filesystem::create_symlink(target, link);
  daemon_.setReply(Op::UploadFileAtPath, Array{Value(false), Value(false)});
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(link.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(false));
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  ASSERT_EQ(uploads[0].descriptorFileTypes.size(), 1u);
  EXPECT_EQ(uploads[0].descriptorFileTypes[0], static_cast<unsigned>(S_IFLNK));
  // Nothing of the target can be read through it.
  EXPECT_EQ(uploads[0].descriptorContents[0], "");
}

TEST_F(TelvaneUploadTest, FifoIsHandedOverWithoutWaitingForAWriter) {
  const auto fifo = dir_ / "pipe";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  daemon_.setReply(Op::UploadFileAtPath, Array{Value(false), Value(false)});
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(fifo.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(false));
  auto uploads = daemon_.calls(Op::UploadFileAtPath);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].descriptorFileTypes, std::vector<unsigned>{static_cast<unsigned>(S_IFIFO)});
}

TEST_F(TelvaneUploadTest, FileIsRemovedWhenTheDaemonLeavesTheRemovalToTheClient) {
  log::LogCapture capture;
  const auto file = dir_ / "accepted.log";
  test::writeFile(file, "accepted");
  daemon_.setReply(Op::UploadFileAtPath, Array{Value(true), Value(true)});
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(file.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(true));
  EXPECT_FALSE(std::filesystem::exists(file));
  EXPECT_TRUE(capture.contains("uploadFileWithURL: Removed " + file.string() + " as the upload server asked"));
}

TEST_F(TelvaneUploadTest, FileIsKeptUnlessTheDaemonAsksForItsRemoval) {
  const auto file = dir_ / "kept.log";
  test::writeFile(file, "kept");
  daemon_.setReply(Op::UploadFileAtPath, Array{Value(true), Value(false)});
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(file.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(true));
  EXPECT_TRUE(std::filesystem::exists(file));
}

TEST_F(TelvaneUploadTest, AFileReplacedAfterTheUploadIsNotRemoved) {
  const auto file = dir_ / "replaced.log";
  test::writeFile(file, "first");
  // The daemon's answer comes after the path was given to another file.
  daemon_.setResponder(Op::UploadFileAtPath, [&](const FakeDaemon::Call&) -> std::optional<Array> {
    std::filesystem::remove(file);
    test::writeFile(file, "second");
    return Array{Value(true), Value(true)};
  });
  Awaited<bool> uploaded;
  EXPECT_TRUE(telvane_->uploadFileWithURL(file.string(), uploaded.setter()));
  EXPECT_EQ(uploaded.wait(), std::optional<bool>(true));
  ASSERT_TRUE(std::filesystem::exists(file));
}

TEST_F(TelvaneUploadTest, EmptyLogDataArrayIsRefused) {
  log::LogCapture capture;
  EXPECT_FALSE(telvane_->uploadDataArray(Value(Array{})));
  EXPECT_FALSE(telvane_->uploadDataArray(Value()));
  EXPECT_EQ(capture.count("uploadDataArray: Log data array is empty"), 2u);
  telvane_.reset();
  ASSERT_TRUE(daemon_.waitForDisconnect(0));
  EXPECT_TRUE(daemon_.calls(Op::UploadLogData).empty());
}

TEST_F(TelvaneUploadTest, LogDataArrayIsForwardedWithTheReply) {
  Value entries(Array{Value(Dictionary{{kTelvaneLogDataData, Value(Bytes{1, 2, 3})},
                                       {kTelvaneLogDataStartTime, Value::date(1000)},
                                       {kTelvaneLogDataEndTime, Value::date(2000)}})});
  daemon_.setReply(Op::UploadLogData,
                   Array{Value(false), Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                                        {"code", Value(500)},
                                                        {"description", Value("server refused")}})});
  Awaited<std::pair<bool, std::optional<Error>>> uploaded;
  auto deliver = uploaded.setter();
  EXPECT_TRUE(telvane_->uploadDataArray(
      entries, [deliver](bool ok, const std::optional<Error>& error) mutable { deliver({ok, error}); }));
  auto outcome = uploaded.wait();
  ASSERT_TRUE(outcome.has_value());
  EXPECT_FALSE(outcome->first);
  ASSERT_TRUE(outcome->second.has_value());
  EXPECT_EQ(outcome->second->code, 500);
  EXPECT_EQ(outcome->second->description, "server refused");
  auto uploads = daemon_.calls(Op::UploadLogData);
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0].arguments, Array{entries});
}

TEST_F(TelvaneUploadTest, DigestKeyIsRequired) {
  log::LogCapture capture;
  EXPECT_FALSE(telvane_->setDigestKey(std::nullopt, 1));
  EXPECT_TRUE(capture.contains("setDigestKey: digestKey should not be nil!!!"));
  EXPECT_TRUE(telvane_->setDigestKey(Bytes{9, 8, 7}, 2));
  ASSERT_TRUE(daemon_.waitForCalls(Op::SetDigestKey, 1));
  auto calls = daemon_.calls(Op::SetDigestKey);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].arguments, (Array{Value(Bytes{9, 8, 7}), Value(2)}));
  EXPECT_FALSE(calls[0].expectsReply);
}

}  // namespace
}  // namespace telvane
