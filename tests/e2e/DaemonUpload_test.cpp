// File uploads from the real client library and the `telvane` tool through the real
// daemon to an upload server on loopback HTTPS, under a signed storebag with an
// "upload_server" backend: the request exactly, the removal of the file after a
// "success" answer (also when the daemon runs as a user that may not remove it), what
// is kept after other answers, and the refusals of what is not a readable regular file
// of an acceptable size, while the daemon keeps serving.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "e2e/StorebagDaemonTest.h"
#include "platform/UniqueFd.h"
#include "support/Gunzip.h"
#include "support/TempDir.h"
#include "support/ToolRunner.h"
#include "support/WaitUntil.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

constexpr unsigned kSessionID = 3141;
constexpr const char* kDescription = "description=Callwave%20AFRC%20log%20(Uploaded%20by%20VTR)";

// The body as the file's bytes. The test server inflates a body sent with
// "Content-Encoding: gzip" itself (and fails the request when it is not gzip), so a
// body arrives either still compressed or already inflated by the server.
std::string fileBytesOf(const std::string& body) { return gunzip(body).value_or(body); }

std::string expectedQuery(unsigned sessionID, const std::string& encodedName) {
  return "uuid=" + std::string(StorebagDaemonTest::kDeviceID) + "&sequence=" + std::to_string(sessionID) + "&" + kDescription +
         "&filename=" + encodedName + "&raw=true";
}

class DaemonUpload : public StorebagDaemonTest {
 protected:
  void SetUp() override {
    StorebagDaemonTest::SetUp();
    answer("success");
    files_ = std::make_unique<TempDir>();
  }

  void answer(const std::string& body, int status = 200) { answerPath("/upload", body, status); }

  void startDaemon(const std::string& postURL = "", DaemonOptions options = {}) {
    StorebagBuilder builder;
    builder.version("uploads-1");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      builder.backend(section, "upload_server",
                      Value(Dictionary{{"post_url", Value(postURL.empty() ? server_.url("/upload") : postURL)},
                                       {"display_url", Value("uploads.test")}}));
    }
    startDaemonWith(builder, std::move(options));
  }

  Telvane& open(unsigned sessionID = kSessionID) { return StorebagDaemonTest::open(sessionID); }

  // Uploads through the library and waits for the daemon's answer.
  std::optional<bool> upload(Telvane& session, const fs::path& path) {
    auto promise = std::make_shared<std::promise<bool>>();
    if (!session.uploadFileWithURL(path.string(), [promise](bool ok) { promise->set_value(ok); })) return std::nullopt;
    auto future = promise->get_future();
    if (future.wait_for(60s) != std::future_status::ready) return std::nullopt;
    return future.get();
  }

  fs::path file(const std::string& name, const std::string& contents) {
    fs::path path = files_->path() / name;
    writeFile(path, contents);
    return path;
  }

  ToolRun tool(const std::vector<std::string>& arguments) {
    std::vector<std::string> all = {"upload", "--component-type", "7", "--client", "com.example.conference",
                                    "--service", "calls", "--session-id", "77", "--timeout", "30"};
    all.insert(all.end(), arguments.begin(), arguments.end());
    return runTool(builtToolPath("telvane"), all, {"TELVANED_SOCKET=" + daemon_->socketPath()});
  }

  std::unique_ptr<TempDir> files_;
};

TEST_F(DaemonUpload, TheFileArrivesCompressedWithTheQueryAndHeadersAndIsRemovedAfterSuccess) {
  startDaemon();
  Telvane& session = open();
  EXPECT_TRUE(session.serverSupportsFileUpload());
  const std::string contents = "12:00:01 call started\n12:00:09 call ended\n" + std::string(20000, '.');
  fs::path path = file("call 7.log", contents);
  EXPECT_EQ(upload(session, path), std::optional<bool>(true)) << daemon_->log();

  auto requests = server_.requestsForPath("/upload");
  ASSERT_EQ(requests.size(), 1u);
  const ReceivedRequest& request = requests[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.query, expectedQuery(kSessionID, "call%207.log.gz"));
  EXPECT_EQ(request.header("Content-Type"), "application/octet-stream");
  EXPECT_EQ(request.header("Content-Encoding"), "gzip");
  EXPECT_TRUE(fileBytesOf(request.body) == contents) << "the body does not inflate to the file";
  EXPECT_FALSE(fs::exists(path));
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): Uploading file " + path.string()));
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): sending to |" + server_.url("/upload") + "?" +
                                      request.query + "|, Json output: success"));
  EXPECT_TRUE(daemon_->waitForLogLine("uploadFileWithURL: File upload successful for " + path.string()));
}

TEST_F(DaemonUpload, TheFileIsKeptAfterAnswersWithoutSuccessAndTheReplyIsStillTrue) {
  startDaemon();
  Telvane& session = open();
  fs::path path = file("kept.log", "keep me");
  answer("stored for later");
  EXPECT_EQ(upload(session, path), std::optional<bool>(true));
  EXPECT_TRUE(fs::exists(path));
  answer("Service Unavailable", 503);
  EXPECT_EQ(upload(session, path), std::optional<bool>(true));
  EXPECT_TRUE(fs::exists(path));
  EXPECT_TRUE(daemon_->waitForLogContaining("UploadBackend(uploadFileAtPath): sending to |", "Service Unavailable"));
  EXPECT_EQ(server_.requestsForPath("/upload").size(), 2u);
}

TEST_F(DaemonUpload, AnUnreachableServerIsLoggedTheFileKeptAndTheReplyTrue) {
  // A port nothing listens on: the connection is refused.
  startDaemon("https://127.0.0.1:1/upload");
  Telvane& session = open();
  fs::path path = file("offline.log", "not sent");
  EXPECT_EQ(upload(session, path), std::optional<bool>(true));
  EXPECT_TRUE(fs::exists(path));
  EXPECT_TRUE(daemon_->waitForLogPrefix("UploadBackend(uploadFileAtPath): post "));
}

TEST_F(DaemonUpload, TheToolUploadsAndTheFileIsGone) {
  startDaemon();
  fs::path path = file("tool.log", "from the tool");
  ToolRun run = tool({path.string()});
  EXPECT_EQ(run.exitCode, 0) << run.out << run.err << daemon_->log();
  EXPECT_NE(run.out.find("file upload supported: yes\n"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("upload: succeeded\n"), std::string::npos) << run.out;
  EXPECT_FALSE(fs::exists(path));
  auto requests = server_.requestsForPath("/upload");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].query, expectedQuery(77, "tool.log.gz"));
  EXPECT_EQ(fileBytesOf(requests[0].body), "from the tool");
}

TEST_F(DaemonUpload, TheToolsUploadsOfADirectoryALinkOrAnEmptyFileAreRefused) {
  startDaemon();
  fs::create_directory(files_->path() / "folder");
  fs::path target = file("target.log", "target");
  fs::create_symlink(target, files_->path() / "link.log");
  fs::path empty = file("empty.log", "");

  for (const fs::path& refused : {files_->path() / "folder", files_->path() / "link.log"}) {
    ToolRun run = tool({refused.string()});
    EXPECT_EQ(run.exitCode, 1) << run.out << run.err;
    EXPECT_NE(run.out.find("upload: failed\n"), std::string::npos) << run.out;
    EXPECT_NE(run.err.find("Only upload a regular file."), std::string::npos) << run.err;
  }
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): Only upload a regular file.", 20s, 2));
  ToolRun run = tool({empty.string()});
  EXPECT_EQ(run.exitCode, 1) << run.out << run.err;
  EXPECT_NE(run.err.find("Input file is empty"), std::string::npos) << run.err;
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_TRUE(daemon_->waitForLogLine("uploadFileWithURL: File upload failed for " + empty.string()));
  EXPECT_TRUE(fs::exists(target));
  EXPECT_TRUE(fs::exists(empty));
  EXPECT_TRUE(server_.requestsForPath("/upload").empty());
}

TEST_F(DaemonUpload, BadUploadsAreAnsweredAndTheDaemonKeepsServing) {
  ASSERT_TRUE(settings_->write("com.zembra.telvane", "maxUploadFileSize", Value(5000)));
  startDaemon();
  RawSession raw = openRawSession(daemon_->socketPath(), sessionInfoFor(7, 55),
                                  Value(Dictionary{{"_clientName", Value("com.example.raw")}}));
  ASSERT_TRUE(raw.connection);
  ASSERT_TRUE(callAndWait(*raw.connection, ipc::Operation::StartConfig, Array{}));
  auto uploadRaw = [&](const std::string& path, std::vector<UniqueFd> descriptors) {
    auto promise = std::make_shared<std::promise<Array>>();
    raw.connection->call(ipc::Operation::UploadFileAtPath, Array{Value(path), Value()},
                         [promise](Array reply) { promise->set_value(std::move(reply)); }, std::move(descriptors));
    auto future = promise->get_future();
    return future.wait_for(30s) == std::future_status::ready ? future.get() : Array{Value("no reply")};
  };
  const Array refused{Value(false), Value(false)};

  // No descriptor at all, and a closed one.
  EXPECT_EQ(uploadRaw("/var/tmp/none.log", {}), refused);
  EXPECT_TRUE(daemon_->waitForLogLine(
      "UploadBackend(uploadFileAtPath): Cannot read the attributes of /var/tmp/none.log: no file descriptor was passed"));

  // Over the maximum.
  fs::path big = file("big.log", std::string(5001, 'b'));
  std::vector<UniqueFd> bigFd;
  bigFd.emplace_back(::open(big.c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(uploadRaw(big.string(), std::move(bigFd)), refused);
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): File " + big.string() +
                                      " of 5001 bytes exceeds the maximum upload size of 5000 bytes"));

  // A file that holds fewer bytes than it says it has, as one that shrinks while read.
  const fs::path shrinking = "/sys/kernel/mm/transparent_hugepage/enabled";
  if (fs::exists(shrinking)) {
    std::vector<UniqueFd> fd;
    fd.emplace_back(::open(shrinking.c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(uploadRaw(shrinking.string(), std::move(fd)), refused);
    EXPECT_TRUE(daemon_->waitForLogContaining("UploadBackend(uploadFileAtPath): File " + shrinking.string(),
                                              "changed while it was read"));
  }

  // A path with a line break and bytes that are not UTF-8: only a name in the query.
  fs::path odd = file("odd\nname\xFF.log", "odd contents");
  std::vector<UniqueFd> oddFd;
  oddFd.emplace_back(::open(odd.c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(uploadRaw(odd.string(), std::move(oddFd)), (Array{Value(true), Value(false)}));
  auto requests = server_.requestsForPath("/upload");
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].query, expectedQuery(55, "odd%0Aname%FF.log.gz"));
  EXPECT_EQ(fileBytesOf(requests[0].body), "odd contents");
  EXPECT_FALSE(fs::exists(odd));

  // Another session is served all along.
  Telvane& session = open(kSessionID + 1);
  EXPECT_EQ(upload(session, file("after.log", "after")), std::optional<bool>(true));
  EXPECT_EQ(server_.requestsForPath("/upload").size(), 2u);
}

TEST_F(DaemonUpload, WhenTheDaemonMayNotRemoveTheFileTheClientDoes) {
  if (::geteuid() != 0) GTEST_SKIP() << "running the daemon as another user needs root";
  DaemonOptions options;
  options.runAsUid = 65534;
  startDaemon("", options);
  Telvane& session = open();
  // The client's folder is not writable for the daemon's user.
  ASSERT_EQ(::chmod(files_->path().c_str(), 0755), 0);
  fs::path path = file("mine.log", "only the client may remove this");
  EXPECT_EQ(upload(session, path), std::optional<bool>(true)) << daemon_->log();
  EXPECT_EQ(server_.requestsForPath("/upload").size(), 1u);
  EXPECT_TRUE(daemon_->waitForLogLine("UploadBackend(uploadFileAtPath): Leaving the removal of " + path.string() +
                                      " to the client: Permission denied"));
  EXPECT_FALSE(fs::exists(path));
}

}  // namespace
