// The upload backend: creation from a profile, the request it makes of a client's
// file, the checks on what it is given, the maximum size, and the removal of the file
// after the server's answer.
#include "backends/upload/UploadBackend.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <future>
#include <thread>

#include "backends/BackendTestSupport.h"
#include "platform/UniqueFd.h"
#include "support/TempDir.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using namespace std::chrono_literals;
using test::headerOf;

constexpr const char* kUploadURL = "https://uploads.test/upload";
constexpr const char* kExpectedQuery =
    "?uuid=udid-0001&sequence=4242&description=Callwave%20AFRC%20log%20(Uploaded%20by%20VTR)";

Value uploadProfile(const char* url = kUploadURL) {
  return Value(Dictionary{{"post_url", Value(url)}, {"display_url", Value("uploads.test")}});
}

class UploadBackendTest : public test::BackendTestBase {
 protected:
  std::shared_ptr<UploadBackend> makeUpload(const Value& profile = uploadProfile()) {
    auto backend = UploadBackend::create("upload_server", profile, std::string("Laptop"), platform());
    if (!backend) return backend;
    backend->setSessionID(4242);
    backend->setUdid("udid-0001");
    backend->setReportingSessionConnectivityDelegate(helper);
    return backend;
  }

  std::filesystem::path file(const std::string& name, const std::string& contents) {
    auto path = dir / name;
    test::writeFile(path, contents);
    return path;
  }

  // Uploads through a descriptor opened as the client library opens it, on another
  // thread (the call blocks until the helper answers). The descriptor stays open until
  // the call returns, as the session keeps it.
  std::future<bool> startUpload(std::shared_ptr<UploadBackend> backend, const std::filesystem::path& path,
                                int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC) {
    return std::async(std::launch::async, [this, backend, path, flags] {
      UniqueFd descriptor(::open(path.c_str(), flags));
      FileAccessToken token;
      token.descriptor = descriptor.get();
      const bool result = backend->uploadFileAtPath(path.string(), token);
      std::lock_guard<std::mutex> lock(mutex);
      removalLeftToClient = token.removalLeftToClient;
      return result;
    });
  }

  // Runs an upload the helper answers with the status and body.
  bool uploadAnswered(std::shared_ptr<UploadBackend> backend, const std::filesystem::path& path, long status,
                      std::optional<std::string> body, std::optional<TelvaneError> error = std::nullopt) {
    const std::size_t before = helper->postCount();
    auto result = startUpload(std::move(backend), path);
    EXPECT_TRUE(test::waitUntil([&] { return helper->postCount() == before + 1; }));
    helper->answerPostWithData(before, status, std::move(body), std::move(error));
    return result.get();
  }

  // Runs an upload that ends before anything is posted.
  bool uploadUnposted(std::shared_ptr<UploadBackend> backend, const std::filesystem::path& path,
                      int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC) {
    const bool result = startUpload(std::move(backend), path, flags).get();
    EXPECT_EQ(helper->postCount(), 0u);
    return result;
  }

  test::TempDir dir;
  bool removalLeftToClient = false;  // guarded by mutex
};

TEST_F(UploadBackendTest, ProfileWithoutPostURLMakesNoBackend) {
  EXPECT_EQ(UploadBackend::create("upload_server", Value(Dictionary{{"display_url", Value("x")}}), std::nullopt,
                                  platform()),
            nullptr);
  EXPECT_EQ(UploadBackend::create("upload_server", Value(Dictionary{{"post_url", Value(7)}}), std::nullopt, platform()),
            nullptr);
  EXPECT_EQ(UploadBackend::create("upload_server", Value(), std::nullopt, platform()), nullptr);
  EXPECT_EQ(capture.count("UploadBackend(initWithName): can't resolve upload post URL."), 3u);
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(initWithName): can't resolve upload post URL."));
}

TEST_F(UploadBackendTest, ProfileGivesUploadAndDisplayURLs) {
  auto backend = makeUpload();
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Upload);
  EXPECT_EQ(backend->uploadURL(), std::optional<std::string>(kUploadURL));
  EXPECT_EQ(backend->displayURL(), std::optional<std::string>("uploads.test"));
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->maxUploadFileSize(), 16 * 1024 * 1024);
}

TEST_F(UploadBackendTest, PercentEncodingKeepsWhatAQueryAllows) {
  EXPECT_EQ(UploadBackend::percentEncodeForQuery("a b.log.gz"), "a%20b.log.gz");
  EXPECT_EQ(UploadBackend::percentEncodeForQuery("AZaz09!$&'()*+,-./:;=?@_~"), "AZaz09!$&'()*+,-./:;=?@_~");
  EXPECT_EQ(UploadBackend::percentEncodeForQuery("#%\"<>[]\\^`{|}"), "%23%25%22%3C%3E%5B%5D%5C%5E%60%7B%7C%7D");
  EXPECT_EQ(UploadBackend::percentEncodeForQuery("line\nbreak"), "line%0Abreak");
  EXPECT_EQ(UploadBackend::percentEncodeForQuery("gr\xC3\xBC\xC3\x9F"), "gr%C3%BC%C3%9F");
  EXPECT_EQ(UploadBackend::percentEncodeForQuery(std::string("bad\xFF\x00", 5)), "bad%FF%00");
}

TEST_F(UploadBackendTest, PostsTheCompressedFileWithTheQueryAndHeaders) {
  auto backend = makeUpload();
  const std::string contents = "first line\nsecond line\n" + std::string(5000, 'x');
  auto path = file("session.log", contents);
  EXPECT_TRUE(uploadAnswered(backend, path, 200, std::string("{\"result\":\"success\"}")));
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url, std::string(kUploadURL) + kExpectedQuery + "&filename=session.log.gz&raw=true");
  EXPECT_EQ(request.headers, (std::vector<std::pair<std::string, std::string>>{
                                 {"Content-Type", "application/octet-stream"}, {"Content-Encoding", "gzip"}}));
  EXPECT_EQ(test::gunzip(request.body), std::optional<std::string>(contents));
  EXPECT_LT(request.body.size(), contents.size());
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): Uploading file " + path.string()));
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): sending to |" + request.url +
                               "|, Json output: {\"result\":\"success\"}"));
  EXPECT_FALSE(std::filesystem::exists(path));
  std::lock_guard<std::mutex> lock(mutex);
  EXPECT_FALSE(removalLeftToClient);
}

TEST_F(UploadBackendTest, FileNameWithASpaceIsPercentEncoded) {
  auto backend = makeUpload();
  auto path = file("a b.log", "spaced");
  EXPECT_TRUE(uploadAnswered(backend, path, 200, std::string("no")));
  EXPECT_EQ(helper->postedRequest(0).url, std::string(kUploadURL) + kExpectedQuery + "&filename=a%20b.log.gz&raw=true");
}

TEST_F(UploadBackendTest, AnUnsuccessfulBodyStillContainsSuccessAndRemovesTheFile) {
  auto backend = makeUpload();
  auto path = file("report.log", "r");
  EXPECT_TRUE(uploadAnswered(backend, path, 200, std::string("upload unsuccessful")));
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(UploadBackendTest, FileIsKeptWithoutSuccessInTheAnswer) {
  auto backend = makeUpload();
  auto path = file("report.log", "r");
  EXPECT_TRUE(uploadAnswered(backend, path, 200, std::string("{\"result\":\"stored later\"}")));
  EXPECT_TRUE(std::filesystem::exists(path));
  // A server error answers true too, and the file stays.
  EXPECT_TRUE(uploadAnswered(backend, path, 503, std::string("Service Unavailable")));
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): sending to |" + helper->postedRequest(1).url +
                               "|, Json output: Service Unavailable"));
  // A body that is not UTF-8 reads as no text, even with the word in it.
  EXPECT_TRUE(uploadAnswered(backend, path, 200, std::string("success\xFF")));
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): sending to |" + helper->postedRequest(2).url +
                               "|, Json output: (null)"));
}

TEST_F(UploadBackendTest, FailedPostIsLoggedKeepsTheFileAndAnswersTrue) {
  auto backend = makeUpload();
  auto path = file("report.log", "r");
  EXPECT_TRUE(uploadAnswered(backend, path, 0, std::nullopt,
                             TelvaneError{"TelvaneHTTPErrorDomain", -1, "Couldn't connect to server"}));
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): post Couldn't connect to server"));
  EXPECT_FALSE(capture.containsPrefix("UploadBackend(uploadFileAtPath): sending to"));
}

TEST_F(UploadBackendTest, DirectoryAndSymbolicLinkAreRefused) {
  auto backend = makeUpload();
  std::filesystem::create_directory(dir / "folder");
  EXPECT_FALSE(uploadUnposted(backend, dir / "folder", O_RDONLY | O_CLOEXEC));
  auto target = file("target.log", "secret");
  std::filesystem::create_symlink(target, dir / "link.log");
  // The client hands a link over as the link itself.
  EXPECT_FALSE(uploadUnposted(backend, dir / "link.log", O_PATH | O_NOFOLLOW | O_CLOEXEC));
  EXPECT_EQ(capture.count("UploadBackend(uploadFileAtPath): Only upload a regular file."), 2u);
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Only upload a regular file."));
  EXPECT_TRUE(std::filesystem::exists(target));
}

TEST_F(UploadBackendTest, FifoIsRefusedWithoutReading) {
  auto backend = makeUpload();
  ASSERT_EQ(::mkfifo((dir / "pipe").c_str(), 0600), 0);
  EXPECT_FALSE(uploadUnposted(backend, dir / "pipe"));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Only upload a regular file."));
}

TEST_F(UploadBackendTest, MissingOrClosedDescriptorIsRefused) {
  auto backend = makeUpload();
  FileAccessToken none;
  EXPECT_FALSE(backend->uploadFileAtPath("/var/tmp/gone.log", none));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Cannot read the attributes of "
                                                  "/var/tmp/gone.log: no file descriptor was passed"));
  FileAccessToken closed;
  {
    UniqueFd descriptor(::open(file("x.log", "x").c_str(), O_RDONLY | O_CLOEXEC));
    closed.descriptor = descriptor.get();
  }
  EXPECT_FALSE(backend->uploadFileAtPath((dir / "x.log").string(), closed));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Cannot read the attributes of " +
                                                      (dir / "x.log").string() + ": Bad file descriptor"));
  EXPECT_EQ(capture.count("UploadBackend(uploadFileAtPath): Only upload a regular file."), 2u);
  EXPECT_EQ(helper->postCount(), 0u);
}

TEST_F(UploadBackendTest, EmptyOrUnreadableFileIsRefused) {
  auto backend = makeUpload();
  EXPECT_FALSE(uploadUnposted(backend, file("empty.log", "")));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  // A descriptor opened for writing only cannot be read: what was read is nothing.
  auto path = file("write-only.log", "data");
  EXPECT_FALSE(uploadUnposted(backend, path, O_WRONLY | O_CLOEXEC));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "UploadBackend(uploadFileAtPath): Unable to read " + path.string() + ": Bad file descriptor"));
  EXPECT_EQ(capture.count("UploadBackend(uploadFileAtPath): Input file is empty"), 2u);
}

TEST_F(UploadBackendTest, FileOverTheMaximumIsRefusedBeforeItIsRead) {
  ASSERT_TRUE(settings->write(kBackendDefaultsDomain, UploadBackend::kMaxUploadFileSizeDefaultsKey, Value(10)));
  auto backend = makeUpload();
  EXPECT_EQ(backend->maxUploadFileSize(), 10);
  auto path = file("big.log", "eleven byte");
  EXPECT_FALSE(uploadUnposted(backend, path));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): File " + path.string() +
                                                      " of 11 bytes exceeds the maximum upload size of 10 bytes"));
  // Exactly at the maximum it goes.
  EXPECT_TRUE(uploadAnswered(backend, file("fits.log", "ten bytes!"), 200, std::string("ok")));
}

TEST_F(UploadBackendTest, MaximumSettingThatIsNotAPositiveNumberKeepsTheDefault) {
  for (Value stored : {Value("lots"), Value(-5), Value(0)}) {
    ASSERT_TRUE(settings->write(kBackendDefaultsDomain, UploadBackend::kMaxUploadFileSizeDefaultsKey, stored));
    EXPECT_EQ(makeUpload()->maxUploadFileSize(), UploadBackend::kDefaultMaxUploadFileSize);
  }
}

TEST_F(UploadBackendTest, FileWhoseSizeChangesWhileItIsReadIsRefused) {
  auto backend = makeUpload();
  // Kernel files state a size their contents do not have: fewer bytes than stated
  // arrive as from a file that shrank, more as from one that grew.
  const std::filesystem::path shrinking = "/sys/kernel/mm/transparent_hugepage/enabled";
  const std::filesystem::path growing = "/proc/self/status";
  if (!std::filesystem::exists(shrinking) || !std::filesystem::exists(growing)) {
    GTEST_SKIP() << "no kernel file with a stated size that differs from its contents";
  }
  EXPECT_FALSE(uploadUnposted(backend, shrinking));
  EXPECT_TRUE(capture.containsPrefix("UploadBackend(uploadFileAtPath): File " + shrinking.string() +
                                     " changed while it was read (4096 bytes expected, "));
  EXPECT_FALSE(uploadUnposted(backend, growing));
  EXPECT_TRUE(capture.containsPrefix("UploadBackend(uploadFileAtPath): File " + growing.string() +
                                     " changed while it was read (0 bytes expected, "));
}

TEST_F(UploadBackendTest, WithoutUploadURLNothingHappens) {
  auto backend = makeUpload();
  backend->setUploadURL(std::nullopt);
  EXPECT_FALSE(uploadUnposted(backend, file("report.log", "r")));
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): Uploading file " + (dir / "report.log").string()));
}

TEST_F(UploadBackendTest, URLThatCannotBeMadeIsRefused) {
  auto backend = makeUpload(uploadProfile("not a url"));
  ASSERT_NE(backend, nullptr);
  EXPECT_FALSE(uploadUnposted(backend, file("report.log", "r")));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Unable to create URL request"));
}

TEST_F(UploadBackendTest, WithoutConnectivityDelegateTheUploadIsTrueAndNothingIsSent) {
  auto backend = makeUpload();
  backend->setReportingSessionConnectivityDelegate(nullptr);
  auto path = file("report.log", "r");
  EXPECT_TRUE(uploadUnposted(backend, path));
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_FALSE(capture.containsPrefix("UploadBackend(uploadFileAtPath): sending to"));
}

TEST_F(UploadBackendTest, FileReplacedBeforeTheAnswerIsNotRemoved) {
  auto backend = makeUpload();
  auto path = file("report.log", "first");
  auto result = startUpload(backend, path);
  ASSERT_TRUE(test::waitUntil([&] { return helper->postCount() == 1; }));
  std::filesystem::remove(path);
  test::writeFile(path, "another file under the same name");
  helper->answerPostWithData(0, 200, std::string("success"));
  EXPECT_TRUE(result.get());
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_TRUE(capture.contains(log::Level::Error, "UploadBackend(uploadFileAtPath): Not removing " + path.string() +
                                                      ": it is no longer the uploaded file"));
}

TEST_F(UploadBackendTest, RemovalTheDaemonMayNotMakeIsLeftToTheClient) {
  auto backend = makeUpload();
  auto path = file("report.log", "r");
  // An immutable folder refuses the unlink even to a privileged process.
  UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  int flags = 0;
  if (!folder || ::ioctl(folder.get(), FS_IOC_GETFLAGS, &flags) != 0) GTEST_SKIP() << "no file attributes here";
  const int immutable = flags | FS_IMMUTABLE_FL;
  if (::ioctl(folder.get(), FS_IOC_SETFLAGS, &immutable) != 0) {
    GTEST_SKIP() << "cannot make a folder immutable here (needs CAP_LINUX_IMMUTABLE and a file system with attributes)";
  }
  const bool answered = uploadAnswered(backend, path, 200, std::string("success"));
  ::ioctl(folder.get(), FS_IOC_SETFLAGS, &flags);
  EXPECT_TRUE(answered);
  EXPECT_TRUE(std::filesystem::exists(path));
  std::lock_guard<std::mutex> lock(mutex);
  EXPECT_TRUE(removalLeftToClient);
  EXPECT_TRUE(capture.contains("UploadBackend(uploadFileAtPath): Leaving the removal of " + path.string() +
                               " to the client: Operation not permitted"));
}

TEST_F(UploadBackendTest, UploadsOfOneBackendFromSeveralThreads) {
  auto backend = makeUpload();
  std::vector<std::future<bool>> uploads;
  for (int i = 0; i < 4; ++i) uploads.push_back(startUpload(backend, file("f" + std::to_string(i) + ".log", "data")));
  ASSERT_TRUE(test::waitUntil([&] { return helper->postCount() == 4; }));
  for (std::size_t i = 0; i < 4; ++i) helper->answerPostWithData(i, 200, std::string("success"));
  for (auto& upload : uploads) EXPECT_TRUE(upload.get());
  for (int i = 0; i < 4; ++i) EXPECT_FALSE(std::filesystem::exists(dir / ("f" + std::to_string(i) + ".log")));
}

}  // namespace
}  // namespace telvane
