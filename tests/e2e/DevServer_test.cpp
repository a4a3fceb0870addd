// The development server on its own: its state folder, the signed storebags it serves
// (conditional requests, placeholders, document formats), and what it makes of event
// posts, uploads, log-data archives and dashboard datagrams, over real sockets.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cstring>
#include <ctime>
#include <filesystem>

#include "backends/dashboard/DashboardBackend.h"
#include "e2e/DevServerProcess.h"
#include "platform/Crypto.h"
#include "platform/Json.h"
#include "platform/SettingsStore.h"
#include "platform/PropertyList.h"
#include "platform/UniqueFd.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/ToolRunner.h"
#include "support/WaitUntil.h"
#include "util/Compression.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

// "Sun, 06 Nov 1994 08:49:37 GMT" of a time.
std::string httpDateOf(std::time_t time) {
  static const char* const kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
  static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  std::tm utc{};
  gmtime_r(&time, &utc);
  char text[64];
  std::snprintf(text, sizeof text, "%s, %02d %s %04d %02d:%02d:%02d GMT", kDays[utc.tm_wday], utc.tm_mday,
                kMonths[utc.tm_mon], utc.tm_year + 1900, utc.tm_hour, utc.tm_min, utc.tm_sec);
  return text;
}

void setModificationTime(const std::filesystem::path& path, std::time_t time) {
  timespec times[2] = {{time, 0}, {time, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

Bytes bytesOf(const std::string& text) { return Bytes(text.begin(), text.end()); }
std::string textOf(const Bytes& bytes) { return std::string(bytes.begin(), bytes.end()); }

// An HTTPS client that trusts only the given CA file and checks the host name.
std::unique_ptr<httplib::SSLClient> clientFor(const DevServerProcess& server, const std::string& caFile) {
  auto client = std::make_unique<httplib::SSLClient>("127.0.0.1", server.httpsPort());
  client->set_ca_cert_path(caFile.c_str());
  client->enable_server_certificate_verification(true);
  client->set_connection_timeout(10, 0);
  client->set_read_timeout(10, 0);
  return client;
}
std::unique_ptr<httplib::SSLClient> clientFor(const DevServerProcess& server) {
  return clientFor(server, server.caFile());
}

// The document inside an envelope, after checking its signature with the key file.
std::optional<Value> verifiedDocument(const std::string& envelopeBytes, const std::string& publicKeyFile) {
  auto envelope = plist::decode(envelopeBytes);
  if (!envelope || !envelope->isDictionary()) return std::nullopt;
  auto signature = crypto::base64Decode((*envelope)["signature"].stringOrEmpty());
  auto bag = crypto::base64Decode((*envelope)["bag"].stringOrEmpty());
  if (!signature || !bag) return std::nullopt;
  auto key = crypto::PublicKey::fromDer(bytesOf(readFile(publicKeyFile)));
  if (!key) return std::nullopt;
  if (!key->verifySha1(bag->data(), bag->size(), *signature)) return std::nullopt;
  auto document = plist::decode(*bag);
  if (!document) return std::nullopt;
  return *document;
}

bool isKind(const Value& arrival, const std::string& kind) { return arrival["kind"].stringOrEmpty() == kind; }

// A dashboard datagram: the 64-byte header of the backend, then the text.
std::string dashboardDatagram(std::uint32_t sessionID, std::uint16_t clientVersion, std::uint16_t method,
                              std::uint16_t responseCode, std::uint16_t eventID, const std::string& text) {
  std::string datagram(64, '\0');
  auto put16 = [&](std::size_t at, std::uint16_t v) {
    datagram[at] = static_cast<char>(v >> 8);
    datagram[at + 1] = static_cast<char>(v & 0xFF);
  };
  auto put32 = [&](std::size_t at, std::uint32_t v) {
    put16(at, static_cast<std::uint16_t>(v >> 16));
    put16(at + 2, static_cast<std::uint16_t>(v & 0xFFFF));
  };
  datagram[0] = 3;   // the daemon's major version
  datagram[1] = 7;   // component type
  datagram[2] = 1;
  datagram[3] = 86;  // 344 ms
  put32(4, 12);
  put32(8, ~sessionID);
  put16(12, static_cast<std::uint16_t>(~clientVersion));
  put16(14, static_cast<std::uint16_t>(~(64 + text.size())));
  put16(16, method);
  put16(18, responseCode);
  std::memcpy(&datagram[20], std::string(40, 'a').data(), 40);
  put16(60, eventID);
  put16(62, 1);  // reliable, address from a profile
  return datagram + text;
}

class UdpPeer {
 public:
  explicit UdpPeer(int port) : socket_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  void send(const std::string& datagram) {
    EXPECT_EQ(::send(socket_.get(), datagram.data(), datagram.size(), 0), static_cast<ssize_t>(datagram.size()));
  }
  // The next datagram that arrives within the deadline.
  std::optional<std::string> receive(std::chrono::milliseconds timeout = 10s) {
    pollfd watched{socket_.get(), POLLIN, 0};
    if (::poll(&watched, 1, static_cast<int>(timeout.count())) <= 0) return std::nullopt;
    std::string buffer(2048, '\0');
    ssize_t received = ::recv(socket_.get(), buffer.data(), buffer.size(), 0);
    if (received < 0) return std::nullopt;
    buffer.resize(static_cast<std::size_t>(received));
    return buffer;
  }

 private:
  UniqueFd socket_;
};

std::uint16_t eventIdOfAcknowledgement(const std::string& ack) {
  return static_cast<std::uint16_t>((static_cast<unsigned char>(ack[60]) << 8) | static_cast<unsigned char>(ack[61]));
}

}  // namespace

TEST(DevServer, FirstRunMakesKeysAndCertificateLaterRunsReuseThem) {
  TempDir dir;
  Bytes firstKey;
  std::string firstCertificate;
  {
    DevServerProcess server(dir.str());
    ASSERT_TRUE(server.start()) << server.errors();
    EXPECT_EQ(server.publicKeyFile(), server.stateDir() + "/publicKey.der");
    EXPECT_EQ(server.caFile(), server.stateDir() + "/tls-cert.pem");
    EXPECT_EQ(server.storebagURL(), server.url() + "/storebags");
    EXPECT_EQ(server.url(), "https://127.0.0.1:" + std::to_string(server.httpsPort()));
    EXPECT_GT(server.udpPort(), 0);
    EXPECT_EQ(server.value("TELVANE_DEVSERVER_EVENTS_FILE"), server.eventsFile());
    // The private keys are the owner's only.
    struct stat info {};
    ASSERT_EQ(::stat((server.stateDir() + "/storebag-private.pem").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    ASSERT_EQ(::stat((server.stateDir() + "/tls-key.pem").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    // The public key is an RSA key the daemon can load.
    firstKey = bytesOf(readFile(server.publicKeyFile()));
    EXPECT_TRUE(crypto::PublicKey::fromDer(firstKey).ok());
    firstCertificate = readFile(server.caFile());
    std::string output = server.output();
    EXPECT_NE(output.find("(new storebag signing key) (new TLS certificate)"), std::string::npos) << output;
    EXPECT_NE(output.find("  TELVANED_CA_FILE=" + server.caFile() + "\n"), std::string::npos) << output;
    EXPECT_NE(output.find("  TELVANED_PUBLIC_KEY=" + server.publicKeyFile() + "\n"), std::string::npos) << output;
    EXPECT_NE(output.find("telvane-defaults write com.zembra.telvane telvane_storebag_url -string " +
                          server.storebagURL() + "\n"),
              std::string::npos)
        << output;
    EXPECT_EQ(server.stop(), 0) << server.errors();
    EXPECT_FALSE(std::filesystem::exists(server.readyFile())) << "a stopped server leaves no ready file behind";
  }
  {
    DevServerProcess server(dir.str());
    ASSERT_TRUE(server.start()) << server.errors();
    EXPECT_EQ(bytesOf(readFile(server.publicKeyFile())), firstKey);
    EXPECT_EQ(readFile(server.caFile()), firstCertificate);
    EXPECT_EQ(server.output().find("(new storebag signing key)", server.output().rfind("telvane-devserver ready")),
              std::string::npos);
    EXPECT_EQ(server.stop(), 0);
  }
}

TEST(DevServer, ServesTheSampleStorebagSignedWithItsKeyOverItsOwnCertificate) {
  TempDir dir;
  DevServerProcess server(dir.str());  // no --storebags: the sample folder
  ASSERT_TRUE(server.start()) << server.errors();
  auto client = clientFor(server);
  auto response = client->Get("/storebags/confera?version=0.1.0");
  ASSERT_TRUE(response) << httplib::to_string(response.error());
  EXPECT_EQ(response->status, 200);
  EXPECT_EQ(response->get_header_value("Cache-Control"), "max-age=300");
  EXPECT_FALSE(response->get_header_value("Last-Modified").empty());

  auto document = verifiedDocument(response->body, server.publicKeyFile());
  ASSERT_TRUE(document.has_value()) << "the envelope verifies with the printed public key";
  EXPECT_EQ((*document)["version"].stringOrEmpty(), "devserver-sample-1");
  for (const char* environment : {"development", "zembra_internal", "seed", "release"}) {
    SCOPED_TRACE(environment);
    const Value& section = (*document)[environment];
    const Value& rule = section["brindle"]["clients"].asArray() ? (*section["brindle"]["clients"].asArray())[0]
                                                                 : Value();
    EXPECT_EQ(rule["post_url"].stringOrEmpty(), server.url() + "/events");
    EXPECT_EQ(rule["realtime_post_url"].stringOrEmpty(), server.url() + "/events/realtime");
    EXPECT_EQ(rule["sampling_threshold"].integerValue(), 1);
    ASSERT_TRUE(rule["filters"].asArray());
    EXPECT_EQ(rule["filters"].asArray()->size(), 1u);
    EXPECT_EQ(rule["locale_whitelist"].stringOrEmpty(), "==countries") << "expanded by the daemon, not the server";
    EXPECT_EQ(section["upload_server"]["post_url"].stringOrEmpty(), server.url() + "/upload");
    EXPECT_TRUE(section["dashboard"]["port"].isInteger());
    EXPECT_EQ(section["dashboard"]["port"].integerValue(), server.udpPort());
    EXPECT_EQ(section["dashboard"]["ip"].stringOrEmpty(), "127.0.0.1");
  }

  auto arrivals = server.waitForEvents([](const Value& a) { return isKind(a, "storebag"); });
  ASSERT_EQ(arrivals.size(), 1u);
  EXPECT_EQ(arrivals[0]["name"].stringOrEmpty(), "confera");
  EXPECT_EQ(arrivals[0]["status"].integerValue(), 200);
  EXPECT_EQ(arrivals[0]["daemonVersion"].stringOrEmpty(), "0.1.0");
  EXPECT_EQ(arrivals[0]["version"].stringOrEmpty(), "devserver-sample-1");
  EXPECT_TRUE(server.waitForArrivalLine(
      "storebag confera 200 (version devserver-sample-1, max-age=300) query version=0.1.0"));

  // Trust depends on the certificate: a client trusting another CA refuses the server.
  auto stranger = clientFor(server, TestCertificates::shared().otherCaFile());
  EXPECT_FALSE(stranger->Get("/storebags/confera"));
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, AnswersNotModifiedForAnIfModifiedSinceAtOrAfterTheDocumentsTime) {
  TempDir dir;
  std::filesystem::create_directories(dir / "bags");
  writeFile(dir / "bags" / "quillon.json", R"({"version": "q1", "release": {}})");
  // A modification time after the server's start decides Last-Modified.
  const std::time_t modified = std::time(nullptr) + 3600;
  setModificationTime(dir / "bags" / "quillon.json", modified);
  DevServerProcess server(dir.str(), {"--storebags", (dir / "bags").string(), "--max-age", "600"});
  ASSERT_TRUE(server.start()) << server.errors();
  auto client = clientFor(server);

  auto first = client->Get("/storebags/quillon");
  ASSERT_TRUE(first);
  EXPECT_EQ(first->status, 200);
  EXPECT_EQ(first->get_header_value("Last-Modified"), httpDateOf(modified));
  EXPECT_EQ(first->get_header_value("Cache-Control"), "max-age=600");

  auto same = client->Get("/storebags/quillon", {{"If-Modified-Since", httpDateOf(modified)}});
  ASSERT_TRUE(same);
  EXPECT_EQ(same->status, 304);
  EXPECT_TRUE(same->body.empty());
  EXPECT_EQ(same->get_header_value("Cache-Control"), "max-age=600");

  auto later = client->Get("/storebags/quillon", {{"If-Modified-Since", httpDateOf(modified + 60)}});
  ASSERT_TRUE(later);
  EXPECT_EQ(later->status, 304);

  auto older = client->Get("/storebags/quillon", {{"If-Modified-Since", httpDateOf(modified - 1)}});
  ASSERT_TRUE(older);
  EXPECT_EQ(older->status, 200);
  EXPECT_TRUE(verifiedDocument(older->body, server.publicKeyFile()).has_value());

  auto garbage = client->Get("/storebags/quillon", {{"If-Modified-Since", "yesterday"}});
  ASSERT_TRUE(garbage);
  EXPECT_EQ(garbage->status, 200);

  // An edited document is newer than what the client holds.
  setModificationTime(dir / "bags" / "quillon.json", modified + 120);
  auto edited = client->Get("/storebags/quillon", {{"If-Modified-Since", httpDateOf(modified)}});
  ASSERT_TRUE(edited);
  EXPECT_EQ(edited->status, 200);
  EXPECT_EQ(edited->get_header_value("Last-Modified"), httpDateOf(modified + 120));

  EXPECT_TRUE(server.waitForArrivalLine("storebag quillon 304 (not modified since " + httpDateOf(modified) + ")"));
  auto arrivals = server.waitForEvents([](const Value& a) { return isKind(a, "storebag"); }, 6);
  ASSERT_EQ(arrivals.size(), 6u);
  EXPECT_EQ(arrivals[1]["status"].integerValue(), 304);
  EXPECT_EQ(arrivals[1]["headers"]["If-Modified-Since"].stringOrEmpty(), httpDateOf(modified));
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, AnOlderDocumentCountsAsModifiedAtTheServersStart) {
  TempDir dir;
  std::filesystem::create_directories(dir / "bags");
  writeFile(dir / "bags" / "rill.json", R"({"version": "r1"})");
  setModificationTime(dir / "bags" / "rill.json", 1000000000);
  const std::time_t beforeStart = std::time(nullptr);
  DevServerProcess server(dir.str(), {"--storebags", (dir / "bags").string()});
  ASSERT_TRUE(server.start()) << server.errors();
  auto response = clientFor(server)->Get("/storebags/rill");
  ASSERT_TRUE(response);
  EXPECT_EQ(response->status, 200);
  const std::time_t afterResponse = std::time(nullptr);
  auto lastModified = response->get_header_value("Last-Modified");
  // This run's envelope carries this run's ports, so it is as new as the run.
  bool duringStart = false;
  for (std::time_t t = beforeStart; t <= afterResponse; ++t) duringStart = duringStart || lastModified == httpDateOf(t);
  EXPECT_TRUE(duringStart) << lastModified;
  auto stale = clientFor(server)->Get("/storebags/rill", {{"If-Modified-Since", httpDateOf(1000000000)}});
  ASSERT_TRUE(stale);
  EXPECT_EQ(stale->status, 200);
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, ReadsJsonAndPropertyListDocumentsAndFillsInItsPlaceholders) {
  TempDir dir;
  std::filesystem::create_directories(dir / "bags");
  writeFile(dir / "bags" / "vantor.json",
            R"({"version": "v1", "development": {"brindle": {"clients": [{"post_url": "${DEVSERVER_URL}/in"}]},
                "dashboard": {"ip": "${DEVSERVER_HOST}", "port": "${DEVSERVER_UDP_PORT}",
                              "display_url": "udp://${DEVSERVER_HOST}:${DEVSERVER_UDP_PORT}"}}})");
  Value plistDocument(Dictionary{{"version", "p1"}, {"release", Value(Dictionary{{"x", "${DEVSERVER_URL}"}})}});
  writeFile(dir / "bags" / "tessary.plist", *plist::encodeXml(plistDocument));
  auto binary = plist::encodeBinary(Value(Dictionary{{"version", "b1"}}));
  writeFile(dir / "bags" / "twine", textOf(*binary));
  DevServerProcess server(dir.str(), {"--storebags", (dir / "bags").string()});
  ASSERT_TRUE(server.start()) << server.errors();
  EXPECT_NE(server.output().find("(serving tessary, twine, vantor from "), std::string::npos) << server.output();
  auto client = clientFor(server);

  auto vantor = client->Get("/storebags/vantor");
  ASSERT_TRUE(vantor);
  ASSERT_EQ(vantor->status, 200);
  auto document = verifiedDocument(vantor->body, server.publicKeyFile());
  ASSERT_TRUE(document);
  const Value& section = (*document)["development"];
  EXPECT_EQ((*section["brindle"]["clients"].asArray())[0]["post_url"].stringOrEmpty(), server.url() + "/in");
  EXPECT_EQ(section["dashboard"]["ip"].stringOrEmpty(), "127.0.0.1");
  EXPECT_TRUE(section["dashboard"]["port"].isInteger()) << "a value that is only the port becomes a number";
  EXPECT_EQ(section["dashboard"]["port"].integerValue(), server.udpPort());
  EXPECT_EQ(section["dashboard"]["display_url"].stringOrEmpty(),
            "udp://127.0.0.1:" + std::to_string(server.udpPort()));

  auto tessary = client->Get("/storebags/tessary");
  ASSERT_TRUE(tessary);
  ASSERT_EQ(tessary->status, 200);
  auto plistResult = verifiedDocument(tessary->body, server.publicKeyFile());
  ASSERT_TRUE(plistResult);
  EXPECT_EQ((*plistResult)["release"]["x"].stringOrEmpty(), server.url());

  auto twine = client->Get("/storebags/twine");
  ASSERT_TRUE(twine);
  ASSERT_EQ(twine->status, 200);
  auto bare = verifiedDocument(twine->body, server.publicKeyFile());
  ASSERT_TRUE(bare);
  EXPECT_EQ((*bare)["version"].stringOrEmpty(), "b1");
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, RefusesUnknownNamesAndBrokenDocuments) {
  TempDir dir;
  std::filesystem::create_directories(dir / "bags");
  writeFile(dir / "bags" / "speckle.json", "{ not json");
  writeFile(dir / "bags" / "auguring.json", "[1, 2]");
  writeFile(dir / "bags" / "feathon.json", R"({"version": null})");
  writeFile(dir / "secret.json", R"({"version": "outside"})");
  DevServerProcess server(dir.str(), {"--storebags", (dir / "bags").string()});
  ASSERT_TRUE(server.start()) << server.errors();
  auto client = clientFor(server);

  auto missing = client->Get("/storebags/glimmerd");
  ASSERT_TRUE(missing);
  EXPECT_EQ(missing->status, 404);
  auto outside = client->Get("/storebags/..%2Fsecret");
  ASSERT_TRUE(outside);
  EXPECT_EQ(outside->status, 404) << "names never leave the folder";
  for (const char* name : {"speckle", "auguring", "feathon"}) {
    auto broken = client->Get(std::string("/storebags/") + name);
    ASSERT_TRUE(broken);
    EXPECT_EQ(broken->status, 500) << name;
  }
  auto arrivals = server.waitForEvents([](const Value& a) { return isKind(a, "storebag"); }, 5);
  ASSERT_EQ(arrivals.size(), 5u);
  EXPECT_EQ(arrivals[0]["status"].integerValue(), 404);
  EXPECT_EQ(arrivals[0]["problem"].stringOrEmpty(), "no document glimmerd.json, glimmerd.plist or glimmerd in " +
                                                        (dir / "bags").string());
  EXPECT_EQ(arrivals[1]["problem"].stringOrEmpty(), "not a storebag name");
  EXPECT_EQ(arrivals[3]["problem"].stringOrEmpty(),
            (dir / "bags" / "auguring.json").string() + ": the document is not a dictionary");
  EXPECT_TRUE(server.running()) << "a broken document does not stop the server";
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, ReportsEveryRecordOfPlainAndGzipEventPosts) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  auto client = clientFor(server);

  std::string plain = R"({"postTime": 1700000000.25, "clientId": "client-1", "events": [
      {"_clientName": "com.example.player", "_serviceName": "playback", "_sender": "CNF", "_method": 12,
       "_status": 3, "_eventNumber": 1, "eventTime": 60.5, "codec": "h264", "droppedFrames": 2},
      {"_clientName": "com.example.player", "_serviceName": "playback", "_sender": "CNF", "_method": 0,
       "_status": 1, "StorebagVersion": "v1"}]})";
  httplib::Headers headers = {{"X-TVX-Client-Name", "com.example.player"},
                              {"X-TVX-Service-Name", "playback"},
                              {"X-TVX-Sender", "CNF"},
                              {"X-TVX-Event-Map", "12 3"}};
  auto posted = client->Post("/events", headers, plain, "application/json");
  ASSERT_TRUE(posted);
  EXPECT_EQ(posted->status, 200);

  std::string realtime = R"({"postTime": 1700000001.5, "clientId": "client-1", "events": [
      {"_method": 12, "_status": 2, "reason": "network lost"}]})";
  auto compressed = gzipDeflate(realtime);
  ASSERT_TRUE(compressed);
  httplib::Headers gzipHeaders = {{"Content-Encoding", "gzip"}, {"X-TVX-Client-Name", "com.example.player"}};
  auto gzipped = client->Post("/events/realtime", gzipHeaders, textOf(*compressed), "application/json");
  ASSERT_TRUE(gzipped);
  EXPECT_EQ(gzipped->status, 200);

  auto events = server.waitForEvents([](const Value& a) { return isKind(a, "event"); }, 3);
  ASSERT_EQ(events.size(), 3u);
  EXPECT_EQ(events[0]["path"].stringOrEmpty(), "/events");
  EXPECT_EQ(events[0]["client"].stringOrEmpty(), "com.example.player");
  EXPECT_EQ(events[0]["service"].stringOrEmpty(), "playback");
  EXPECT_EQ(events[0]["category"].integerValue(), 12);
  EXPECT_EQ(events[0]["type"].integerValue(), 3);
  EXPECT_EQ(events[0]["index"].integerValue(), 0);
  EXPECT_EQ(events[0]["count"].integerValue(), 2);
  EXPECT_EQ(events[0]["clientId"].stringOrEmpty(), "client-1");
  EXPECT_FALSE(events[0]["gzip"].boolValue());
  EXPECT_EQ(events[0]["record"]["codec"].stringOrEmpty(), "h264");
  EXPECT_EQ(events[0]["headers"]["X-TVX-Event-Map"].stringOrEmpty(), "12 3");
  EXPECT_EQ(events[1]["category"].integerValue(), 0);
  EXPECT_EQ(events[1]["type"].integerValue(), 1);
  EXPECT_EQ(events[2]["path"].stringOrEmpty(), "/events/realtime");
  EXPECT_TRUE(events[2]["gzip"].boolValue());
  EXPECT_EQ(events[2]["headers"]["Content-Encoding"].stringOrEmpty(), "gzip");
  EXPECT_EQ(events[2]["client"].stringOrEmpty(), "com.example.player") << "from the header when the record has none";
  EXPECT_TRUE(events[2]["service"].isNull());
  EXPECT_EQ(events[2]["record"]["reason"].stringOrEmpty(), "network lost");

  EXPECT_TRUE(server.waitForArrivalLine(
      "https POST /events client=com.example.player service=playback sender=CNF category=12 type=3 "
      "keys=codec,droppedFrames (1/2)"));
  EXPECT_TRUE(server.waitForArrivalLine(
      "https POST /events client=com.example.player service=playback sender=CNF category=0 type=1 "
      "keys=StorebagVersion (2/2)"));
  EXPECT_TRUE(server.waitForArrivalLine(
      "https POST /events/realtime client=com.example.player service=- sender=- category=12 type=2 keys=reason "
      "gzip"));
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, RefusesAPostThatIsNotAnEventDocument) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  auto client = clientFor(server);
  auto notJson = client->Post("/events", "hello", "text/plain");
  ASSERT_TRUE(notJson);
  EXPECT_EQ(notJson->status, 400);
  auto noEvents = client->Post("/events", R"({"postTime": 1})", "application/json");
  ASSERT_TRUE(noEvents);
  EXPECT_EQ(noEvents->status, 400);
  auto refused = server.waitForEvents([](const Value& a) { return isKind(a, "refused"); }, 2);
  ASSERT_EQ(refused.size(), 2u);
  EXPECT_EQ(refused[1]["problem"].stringOrEmpty(), "the body is not an event post (no \"events\" array)");
  EXPECT_TRUE(server.waitForArrivalLine(
      "https POST /events 400: the body is not an event post (no \"events\" array)"));
  EXPECT_TRUE(server.events([](const Value& a) { return isKind(a, "event"); }).empty());
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, SavesAnUploadInflatedAndAnswersSuccess) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  const std::string contents = "line one\nline two\n";
  auto compressed = gzipDeflate(contents);
  ASSERT_TRUE(compressed);
  auto response = clientFor(server)->Post(
      "/upload?uuid=0123456789abcdef0123456789abcdef01234567&sequence=41&description=Callwave%20AFRC%20log%20"
      "(Uploaded%20by%20VTR)&filename=a%20b.log.gz&raw=true",
      {{"Content-Encoding", "gzip"}}, textOf(*compressed), "application/octet-stream");
  ASSERT_TRUE(response);
  EXPECT_EQ(response->status, 200);
  EXPECT_NE(response->body.find("success"), std::string::npos) << "the backend deletes the file on this word";

  auto uploads = server.waitForEvents([](const Value& a) { return isKind(a, "upload"); });
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_EQ(uploads[0]["filename"].stringOrEmpty(), "a b.log.gz");
  EXPECT_EQ(uploads[0]["device"].stringOrEmpty(), "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(uploads[0]["sequence"].stringOrEmpty(), "41");
  EXPECT_EQ(uploads[0]["description"].stringOrEmpty(), "Callwave AFRC log (Uploaded by VTR)");
  EXPECT_EQ(uploads[0]["query"]["raw"].stringOrEmpty(), "true");
  EXPECT_TRUE(uploads[0]["gzip"].boolValue());
  EXPECT_EQ(uploads[0]["bytes"].integerValue(), static_cast<std::int64_t>(contents.size()));
  const std::string saved = uploads[0]["savedAs"].stringOrEmpty();
  EXPECT_EQ(saved, server.stateDir() + "/uploads/0001-a_b.log");
  EXPECT_EQ(readFile(saved), contents);
  EXPECT_TRUE(server.waitForArrivalLine("upload POST /upload file=\"a b.log.gz\" 18 bytes gzip "
                                        "device=0123456789abcdef0123456789abcdef01234567 sequence=41 saved as " +
                                        saved));
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, SavesALogDataArchiveAndAnswersWhereItCanBeFetched) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  Value logData(Array{Value(Dictionary{{"LogData", Value(Bytes{1, 2, 3})}, {"StartTime", 10}, {"EndTime", 20}}),
                      Value(Dictionary{{"LogData", Value(Bytes{4})}, {"StartTime", 30}, {"EndTime", 40}})});
  auto archive = plist::encodeBinary(logData);
  ASSERT_TRUE(archive);
  auto client = clientFor(server);
  auto response = client->Post("/dashboard/logs", textOf(*archive), "application/octet-stream");
  ASSERT_TRUE(response);
  EXPECT_EQ(response->status, 200);
  const std::string location = response->body;
  EXPECT_EQ(location, server.url() + "/uploads/0001-logdata.plist");

  auto fetched = client->Get(location.substr(server.url().size()));
  ASSERT_TRUE(fetched);
  EXPECT_EQ(fetched->status, 200);
  EXPECT_EQ(fetched->body, textOf(*archive));

  auto arrivals = server.waitForEvents([](const Value& a) { return isKind(a, "logdata"); });
  ASSERT_EQ(arrivals.size(), 1u);
  EXPECT_EQ(arrivals[0]["entries"].integerValue(), 2);
  EXPECT_EQ(arrivals[0]["location"].stringOrEmpty(), location);
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, AcknowledgesEachDashboardDatagramWithItsEventIdAndDecodesIt) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  UdpPeer peer(server.udpPort());
  const std::string text = " n=5 note=hello world eq=a\\=b\\\\c blank=empty";
  peer.send(dashboardDatagram(41, 3, 12, 1, 300, text));
  auto ack = peer.receive();
  ASSERT_TRUE(ack.has_value()) << "every datagram is acknowledged";
  ASSERT_GE(ack->size(), 62u);
  EXPECT_EQ(eventIdOfAcknowledgement(*ack), 300);

  // Two datagrams with one event ID get one acknowledgement each.
  peer.send(dashboardDatagram(41, 3, 12, 1, 301, " a=1"));
  peer.send(dashboardDatagram(41, 3, 12, 1, 301, " a=2"));
  for (int i = 0; i < 2; ++i) {
    auto again = peer.receive();
    ASSERT_TRUE(again.has_value());
    EXPECT_EQ(eventIdOfAcknowledgement(*again), 301);
  }

  auto datagrams = server.waitForEvents([](const Value& a) { return isKind(a, "datagram"); }, 3);
  ASSERT_EQ(datagrams.size(), 3u);
  const Value& first = datagrams[0];
  EXPECT_TRUE(first["acknowledged"].boolValue());
  EXPECT_EQ(first["sessionID"].integerValue(), 41) << "the complemented fields are complemented back";
  EXPECT_EQ(first["clientVersion"].integerValue(), 3);
  EXPECT_EQ(first["declaredLength"].integerValue(), static_cast<std::int64_t>(64 + text.size()));
  EXPECT_EQ(first["bytes"].integerValue(), static_cast<std::int64_t>(64 + text.size()));
  EXPECT_EQ(first["category"].integerValue(), 12);
  EXPECT_EQ(first["type"].integerValue(), 1);
  EXPECT_EQ(first["eventID"].integerValue(), 300);
  EXPECT_EQ(first["componentType"].integerValue(), 7);
  EXPECT_EQ(first["majorVersion"].integerValue(), 3);
  EXPECT_DOUBLE_EQ(first["timestamp"].doubleValue(), 12.344);
  EXPECT_EQ(first["deviceID"].stringOrEmpty(), std::string(40, 'a'));
  EXPECT_TRUE(first["reliable"].boolValue());
  EXPECT_TRUE(first["addressFromProfile"].boolValue());
  EXPECT_EQ(first["fields"]["n"].stringOrEmpty(), "5");
  EXPECT_EQ(first["fields"]["note"].stringOrEmpty(), "hello world");
  EXPECT_EQ(first["fields"]["eq"].stringOrEmpty(), "a=b\\c") << "the sender's escapes are undone";
  EXPECT_EQ(first["fields"]["blank"].stringOrEmpty(), "empty");
  EXPECT_EQ(datagrams[2]["fields"]["a"].stringOrEmpty(), "2");
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, DecodesAndAcknowledgesTheDashboardBackendsOwnDatagram) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  BackendPlatform platform;
  platform.settings = makeMemorySettingsStore();
  auto backend = DashboardBackend::create(
      "dashboard",
      Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(server.udpPort())}, {"reliable", Value(200)}}),
      std::string("Laptop"), platform);
  ASSERT_NE(backend, nullptr);
  backend->setSelfVersion("8.1.2");
  backend->setCompType(7);
  backend->setSessionID(41);
  backend->setClientVersion(3);
  backend->setUdid(std::string(40, 'b'));
  const Value event(Dictionary{{"note", Value("hello world")}, {"eq", Value("a=b\\c")}, {"n", Value(5)}});
  backend->sendMessage(event, TimeValue{12, 345678}, 12, 1, static_cast<std::uint16_t>(300));

  auto datagrams = server.waitForEvents([](const Value& a) { return isKind(a, "datagram"); }, 1);
  ASSERT_EQ(datagrams.size(), 1u);
  const Value& d = datagrams[0];
  EXPECT_EQ(d["sessionID"].integerValue(), 41);
  EXPECT_EQ(d["clientVersion"].integerValue(), 3);
  EXPECT_EQ(d["declaredLength"].integerValue(), d["bytes"].integerValue());
  EXPECT_EQ(d["category"].integerValue(), 12);
  EXPECT_EQ(d["type"].integerValue(), 1);
  EXPECT_EQ(d["eventID"].integerValue(), 300);
  EXPECT_EQ(d["componentType"].integerValue(), 7);
  EXPECT_EQ(d["majorVersion"].integerValue(), 8);
  EXPECT_DOUBLE_EQ(d["timestamp"].doubleValue(), 12.344);
  EXPECT_EQ(d["deviceID"].stringOrEmpty(), std::string(40, 'b'));
  EXPECT_TRUE(d["reliable"].boolValue());
  EXPECT_TRUE(d["addressFromProfile"].boolValue());
  EXPECT_EQ(d["fields"]["note"].stringOrEmpty(), "hello world");
  EXPECT_EQ(d["fields"]["eq"].stringOrEmpty(), "a=b\\c");
  EXPECT_EQ(d["fields"]["n"].stringOrEmpty(), "5");
  // The server's acknowledgement takes the packet out of the backend's queue.
  EXPECT_TRUE(waitUntil([&] { return backend->messageQueueSnapshot().empty(); }, std::chrono::seconds(10)));
  backend->cleanup();
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, IgnoresADatagramShorterThanTheHeaderWithoutAcknowledging) {
  TempDir dir;
  DevServerProcess server(dir.str());
  ASSERT_TRUE(server.start()) << server.errors();
  UdpPeer peer(server.udpPort());
  peer.send(std::string(10, 'x'));
  peer.send(dashboardDatagram(7, 1, 2, 3, 42, " k=v"));
  // Loopback keeps the order: had the short one been answered, its answer came first.
  auto ack = peer.receive();
  ASSERT_TRUE(ack.has_value());
  EXPECT_EQ(eventIdOfAcknowledgement(*ack), 42);
  auto datagrams = server.waitForEvents([](const Value& a) { return isKind(a, "datagram"); }, 2);
  ASSERT_EQ(datagrams.size(), 2u);
  EXPECT_FALSE(datagrams[0]["acknowledged"].boolValue());
  EXPECT_EQ(datagrams[0]["bytes"].integerValue(), 10);
  EXPECT_TRUE(datagrams[1]["acknowledged"].boolValue());
  EXPECT_TRUE(server.waitForArrivalLine("udp " + datagrams[0]["from"].stringOrEmpty() +
                                        " ignored: 10 bytes, shorter than the header"));
  EXPECT_EQ(server.stop(), 0);
}

TEST(DevServer, CommandLineMistakesAreRefused) {
  const std::string devserver = builtToolPath("telvane-devserver");
  auto help = runTool(devserver, {"--help"});
  EXPECT_EQ(help.exitCode, 0);
  for (const char* option : {"--port", "--udp-port", "--state", "--storebags", "--events", "--once-ready-file",
                             "--max-age", "--exit-with-parent", "TELVANED_CA_FILE", "TELVANED_PUBLIC_KEY", "telvane_storebag_url"}) {
    EXPECT_NE(help.out.find(option), std::string::npos) << option;
  }
  auto unknown = runTool(devserver, {"--bogus"});
  EXPECT_EQ(unknown.exitCode, 2);
  EXPECT_NE(unknown.err.find("telvane-devserver: unknown argument '--bogus'"), std::string::npos) << unknown.err;
  auto badPort = runTool(devserver, {"--port", "70000"});
  EXPECT_EQ(badPort.exitCode, 2);
  EXPECT_NE(badPort.err.find("--port takes a port number from 0 to 65535, not '70000'"), std::string::npos);
  TempDir dir;
  auto noFolder = runTool(devserver, {"--port", "0", "--udp-port", "0", "--state", (dir / "state").string(),
                                      "--storebags", (dir / "missing").string()});
  EXPECT_EQ(noFolder.exitCode, 1);
  EXPECT_NE(noFolder.err.find("the storebag folder " + (dir / "missing").string() + " does not exist"),
            std::string::npos)
      << noFolder.err;
}

TEST(DevServer, StopsCleanlyWhenTheProcessThatStartedItEnds) {
  TempDir dir;
  const std::string ready = (dir / "ready").string();
  // A shell starts the server, waits until it is ready, prints its pid and ends.
  const std::string script =
      "\"$0\" --port 0 --udp-port 0 --state \"$1\" --once-ready-file \"$2\" --exit-with-parent "
      ">/dev/null 2>&1 & pid=$!; while [ ! -f \"$2\" ] && kill -0 $pid 2>/dev/null; do sleep 0.05; done; echo $pid";
  auto run = runTool("/bin/sh", {"-c", script, builtToolPath("telvane-devserver"), (dir / "state").string(), ready});
  ASSERT_EQ(run.exitCode, 0) << run.err;
  const pid_t server = static_cast<pid_t>(std::stol(run.out));
  auto ended = [server] {
    std::ifstream status("/proc/" + std::to_string(server) + "/status");
    std::string line;
    while (std::getline(status, line)) {
      if (line.rfind("State:", 0) == 0) return line.find('Z') != std::string::npos;
    }
    return true;  // gone and reaped
  };
  EXPECT_TRUE(waitUntil(ended, 20s)) << "the server outlived the process that started it";
  EXPECT_FALSE(std::filesystem::exists(ready)) << "it stopped the normal way, removing its ready file";
}
