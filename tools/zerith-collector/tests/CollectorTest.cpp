// zerith-collector: its body decoding on hostile input, and the built
// executable receiving what a real HTTPS backend, libcurl uploads and
// static-file GETs send it.

#include <arpa/inet.h>
#include <curl/curl.h>
#include <netinet/in.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "backends/HTTPSPostBackend.h"
#include "config/Compression.h"
#include "config/DeviceInfo.h"
#include "platform/Defaults.h"
#include "platform/FileUtil.h"
#include "platform/PropertyList.h"
#include "tests/support/CollectorProcess.h"
#include "tests/support/Command.h"
#include "tests/support/TempRoot.h"
#include "tools/zerith-collector/CollectorBody.h"
#include "tools/zerith-collector/CollectorServer.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using collector::BodyLimits;
using collector::decodeRequestBody;
using Json = nlohmann::ordered_json;

// `text` gzip'd as a device sends a request body.
std::string gzipOf(const std::string& text) {
  const Data gzip = *gzipDeflate(plist::bytesOf(text));
  return std::string(gzip.begin(), gzip.end());
}

TEST(CollectorBody, GzipBombsTruncationAndTrailingBytesAreRefusedBeforeParsing) {
  const BodyLimits limits{.maxBodyBytes = 1 << 20, .maxInflatedBytes = 1 << 20, .maxJsonDepth = 8};
  const std::string bomb = gzipOf(std::string(8 << 20, '{'));
  ASSERT_LT(bomb.size(), 64u * 1024);
  auto decoded = decodeRequestBody("gzip", bomb, limits);
  EXPECT_FALSE(decoded.ok);
  EXPECT_NE(decoded.error.find("inflates beyond 1048576 bytes"), std::string::npos) << decoded.error;

  const std::string whole = gzipOf("{\"postTime\":1}");
  EXPECT_FALSE(decodeRequestBody("gzip", whole.substr(0, whole.size() - 3), limits).ok);
  decoded = decodeRequestBody("gzip", whole + "junk", limits);
  EXPECT_FALSE(decoded.ok);
  EXPECT_EQ(decoded.error, "gzip body has trailing bytes");
  // The magic bytes are enough, whatever the header says.
  decoded = decodeRequestBody("", whole, limits);
  ASSERT_TRUE(decoded.ok);
  EXPECT_TRUE(decoded.wasGzip);
  EXPECT_TRUE(decoded.envelope);

  EXPECT_FALSE(decodeRequestBody("", std::string((1 << 20) + 1, 'x'), limits).ok);
  EXPECT_FALSE(decodeRequestBody("br", "{}", limits).ok);
}

TEST(CollectorBody, OnlyBoundedObjectsWithPostTimeAreEnvelopes) {
  const BodyLimits limits{.maxJsonDepth = 8};
  EXPECT_TRUE(decodeRequestBody("", " {\"postTime\":1,\"clientId\":\"A\",\"events\":[{\"a\":1}]}", limits).envelope);
  EXPECT_TRUE(decodeRequestBody("", "{\"postTime\":1}", limits).envelope);
  EXPECT_FALSE(decodeRequestBody("", "{\"postTime\":1,\"events\":{}}", limits).envelope);
  EXPECT_FALSE(decodeRequestBody("", "{\"events\":[]}", limits).envelope);
  EXPECT_FALSE(decodeRequestBody("", "{\"postTime\":1", limits).envelope);
  EXPECT_FALSE(decodeRequestBody("", "[1]", limits).envelope);
  // Too deep to parse safely: kept as a file.
  const std::string deep = "{\"postTime\":1,\"x\":" + std::string(20, '[') + std::string(20, ']') + "}";
  const auto decoded = decodeRequestBody("", deep, limits);
  EXPECT_TRUE(decoded.ok);
  EXPECT_FALSE(decoded.envelope);
}

TEST(CollectorBodyCorpus, EveryCorpusInputDecodesWithoutCrashing) {
  const auto corpus = sourceDir() / "fuzz/corpus/collector_body_fuzz";
  ASSERT_TRUE(fs::is_directory(corpus)) << corpus;
  std::size_t inputs = 0;
  for (const auto& entry : fs::directory_iterator(corpus)) {
    const auto bytes = file::readAll(entry.path(), 1u << 20);
    ASSERT_TRUE(bytes) << entry.path();
    LLVMFuzzerTestOneInput(bytes->data(), bytes->size());
    ++inputs;
  }
  EXPECT_GT(inputs, 0u);
}

struct CurlAnswer {
  long status = 0;
  std::string body;
};

class CollectorToolTest : public ::testing::Test {
 protected:
  // The built collector on a free port with a certificate it makes in
  // `certs`, and `more` arguments.
  CollectorProcess start(std::vector<std::string> more) const {
    more.insert(more.begin(), {"--generate-cert", certs.string(), "--port", "0"});
    return CollectorProcess(ZERITH_COLLECTOR_TOOL, more);
  }

  // A real HTTPS backend that posts every event at once to `url`.
  std::shared_ptr<HTTPSPostBackend> backendFor(const std::string& url) {
    EXPECT_TRUE(URLSession::setExtraCAFile((certs / "ca.pem").string()));
    Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(true));
    transport = ReportingSessionConnectivityHelper::initWithDelegate({}, 4);
    Dictionary client{{"post_url", url}, {"event_threshold", 49}};
    auto b = HTTPSPostBackend::initWithName("httpsPost", Value(Dictionary{{"clients", Array{Value(client)}}}),
                                            std::string("Family"));
    b->setCompType(7);
    b->setSessionID(77);
    b->setUserInfoDict(Value(Dictionary{{"clientName", "demo"}, {"serviceName", "cli"}}));
    b->setReportingSessionConnectivityDelegate(transport);
    b->updateState();
    return b;
  }

  // A POST of `body` to `collector` with libcurl trusting the certificate
  // it made, or a GET without a body (its path sent as it is, "/../" included).
  CurlAnswer request(const CollectorProcess& collector, const std::string& path,
                     const std::optional<std::string>& body = std::nullopt,
                     const std::vector<std::string>& headers = {}) const {
    CURL* curl = curl_easy_init();
    CurlAnswer answer;
    curl_slist* list = nullptr;
    for (const auto& h : headers) {
      list = curl_slist_append(list, h.c_str());
    }
    curl_easy_setopt(curl, CURLOPT_URL, collector.url(path).c_str());
    curl_easy_setopt(curl, CURLOPT_CAINFO, (certs / "ca.pem").c_str());
    if (body) {
      curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body->data());
      curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body->size()));
    }
    curl_easy_setopt(curl, CURLOPT_PATH_AS_IS, 1L);
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, list);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, 20L);
    curl_easy_setopt(
        curl, CURLOPT_WRITEFUNCTION, +[](char* p, size_t s, size_t n, void* u) {
          static_cast<std::string*>(u)->append(p, s * n);
          return s * n;
        });
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &answer.body);
    if (curl_easy_perform(curl) == CURLE_OK) {
      curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &answer.status);
    }
    curl_slist_free_all(list);
    curl_easy_cleanup(curl);
    return answer;
  }

  TempRoot root;
  fs::path certs = root.path() / "certs";
  std::shared_ptr<ReportingSessionConnectivityHelper> transport;
};

TEST_F(CollectorToolTest, BackendRecordsArriveOneLinePerRecordWithSenderSessionAndCheckedDigest) {
  CollectorProcess collector = start({"--digest-key", "secret"});
  ASSERT_GT(collector.port(), 0);
  auto b = backendFor(collector.url("/post"));
  b->setDigestKey(Data{'s', 'e', 'c', 'r', 'e', 't'});
  b->setBatchEvents(true);
  timeval now{};
  gettimeofday(&now, nullptr);
  b->sendMessage(Value(Dictionary{{"ClientData", Dictionary{{"n", 1}}}}), now, 4, 5, 0);
  b->sendMessage(Value(Dictionary{{"ClientData", Dictionary{{"n", 2}}}}), now, 4, 5, 0);
  b->flushMessagesWithCompletion(nullptr);
  for (int n : {1, 2}) {
    const auto line = collector.nextLine();
    ASSERT_TRUE(line);
    EXPECT_TRUE(hasMembers(*line, R"({"kind":"record","path":"/post","_sender":"YJ","_sessionID":77})"));
    EXPECT_TRUE(hasMembers(*line, R"({"digest":"valid","gzip":true,"record":{"n":)" + std::to_string(n) + "}}"));
    EXPECT_EQ((*line)["headers"][0][0], "Host");
    // The keys a reader looks for come first, the request's headers last.
    std::vector<std::string> keys;
    for (const auto& [key, value] : line->items()) {
      keys.push_back(key);
    }
    EXPECT_EQ(keys, (std::vector<std::string>{"time", "kind", "status", "method", "path", "query", "digest", "_sender",
                                              "_sessionID", "record", "clientId", "postTime", "gzip", "bodySize", "headers"}));
  }

  // A wrong key on the device side shows as an invalid digest.
  b->setDigestKey(Data{'x'});
  b->sendMessage(Value(Dictionary{}), now, 4, 5, 1);
  const auto line = collector.nextLine();
  ASSERT_TRUE(line);
  EXPECT_EQ((*line)["digest"], "invalid");
}

TEST_F(CollectorToolTest, UploadsAreStoredInflatedAndLogDataIsAnsweredWithItsLocation) {
  const fs::path store = root.path() / "store";
  CollectorProcess collector = start({"--store", store.string(), "--log-data-path", "/logs"});
  const std::string file = "diagnostic log\n" + std::string(5000, 'z');
  const auto upload = request(collector, "/upload?uuid=abc&sequence=3&filename=x.log.gz&raw=true", gzipOf(file),
                              {"Content-Type: application/octet-stream", "Content-Encoding: gzip"});
  EXPECT_EQ(upload.status, 200);
  EXPECT_EQ(upload.body, "success");
  auto line = collector.nextLine();
  ASSERT_TRUE(line);
  EXPECT_TRUE(hasMembers(*line, R"({"kind":"upload","query":"uuid=abc&sequence=3&filename=x.log.gz&raw=true"})"));
  EXPECT_EQ((*line)["size"], file.size());
  EXPECT_EQ((*line)["sha256"], collector::sha256Hex(file));
  const auto stored = file::readAll((*line)["stored"].get<std::string>(), 1 << 20);
  ASSERT_TRUE(stored);
  EXPECT_EQ(std::string(stored->begin(), stored->end()), file);

  const auto logData = request(collector, "/logs", "archived log data");
  line = collector.nextLine();
  ASSERT_TRUE(line);
  EXPECT_EQ((*line)["kind"], "logdata");
  EXPECT_EQ(logData.body, (*line)["stored"]);
  EXPECT_EQ(fs::path(logData.body).parent_path(), store);
}

TEST_F(CollectorToolTest, HostileBodiesAreRefusedWithoutStoppingTheCollector) {
  CollectorProcess collector = start({"--max-body", "100000", "--max-inflated", "200000"});
  const struct {
    const char* name;
    std::string body;
    std::vector<std::string> headers;
    long status;
    const char* kind;
  } requests[] = {
      {"gzip bomb", gzipOf(std::string(4 << 20, 'a')), {"Content-Encoding: gzip"}, 413, "refused"},
      {"too large", std::string(100001, 'a'), {}, 413, "refused"},
      {"broken gzip", "\x1f\x8bnot gzip", {}, 415, "refused"},
      {"fine, still answered", "{\"postTime\":1}", {}, 200, "envelope"},
  };
  for (const auto& r : requests) {
    EXPECT_EQ(request(collector, "/post", r.body, r.headers).status, r.status) << r.name;
    const auto line = collector.nextLine();
    ASSERT_TRUE(line) << r.name;
    EXPECT_EQ((*line)["kind"], r.kind) << r.name;
  }
}

// Each connection holds a thread of the collector: beyond --max-connections
// a connection is closed as it comes, and its place is free again once a
// connection ends.
TEST_F(CollectorToolTest, ConnectionsBeyondItsLimitAreClosedUntilOneEnds) {
  CollectorProcess collector = start({"--max-connections", "1"});
  // A connection that says nothing holds the one place (the collector
  // accepts in the order connections came).
  file::UniqueFd silent(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<std::uint16_t>(collector.port()));
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(::connect(silent.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
  const std::string envelope = "{\"postTime\":1}";
  EXPECT_EQ(request(collector, "/post", envelope).status, 0);
  silent.reset();
  long status = 0;
  for (int attempt = 0; attempt < 100 && status != 200; ++attempt) {
    if (attempt > 0) {
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    status = request(collector, "/post", envelope).status;
  }
  EXPECT_EQ(status, 200);
  const auto line = collector.nextLine();
  ASSERT_TRUE(line);
  EXPECT_EQ((*line)["kind"], "envelope");
}

TEST_F(CollectorToolTest, ServesStaticFilesWithLastModifiedAndNothingOutsideItsFolder) {
  const fs::path www = root.path() / "www";
  fs::create_directories(www);
  std::ofstream(www / "dravon") << "signed bag";
  std::ofstream(root.path() / "secret") << "no";
  CollectorProcess collector = start({"--serve", www.string()});
  const auto bag = request(collector, "/dravon?version=8.1");
  EXPECT_EQ(bag.status, 200);
  EXPECT_EQ(bag.body, "signed bag");
  EXPECT_EQ(request(collector, "/dravon", std::nullopt, {"If-Modified-Since: Fri, 01 Jan 2100 00:00:00 GMT"}).status,
            304);
  EXPECT_EQ(request(collector, "/../secret").status, 404);
  EXPECT_EQ(request(collector, "/missing").status, 404);
}

TEST_F(CollectorToolTest, RefusesToStartWithoutCertificateOrWithABadOne) {
  std::ofstream(root.path() / "bad.pem") << "not a certificate";
  const std::string bad = shellQuote((root.path() / "bad.pem").string());
  for (const auto& args : std::vector<std::string>{"--port 0", "--cert " + bad + " --key " + bad}) {
    // It ends on its own (timeout's 124 would mean it kept running), with
    // an error of its own (not the shell's 127 for a missing program).
    const auto r = runCommand(std::string(ZERITH_COLLECTOR_TOOL) + " " + args + " 2>/dev/null", 20);
    EXPECT_NE(r.status, 0) << args;
    EXPECT_NE(r.status, 124) << args;
    EXPECT_NE(r.status, 127) << args;
  }
}

TEST(CollectorBehaviour, OnlyTheFourBehavioursWithSaneNumbersAreTaken) {
  using Kind = collector::Behaviour::Kind;
  const std::tuple<const char*, Kind, int> taken[] = {{"", Kind::answer, 0},
                                                      {"answer\n", Kind::answer, 0},
                                                      {"close", Kind::close, 0},
                                                      {"status 503\n", Kind::status, 503},
                                                      {"stall 250", Kind::stall, 250}};
  for (const auto& [text, kind, value] : taken) {
    const auto parsed = collector::Behaviour::parse(text);
    ASSERT_TRUE(parsed) << text;
    EXPECT_EQ(std::pair(parsed->kind, parsed->value), std::pair(kind, value)) << text;
  }
  for (const char* bad : {"status", "status 99", "status 600", "stall -1", "stall 600001", "stall x", "refuse"}) {
    EXPECT_FALSE(collector::Behaviour::parse(bad)) << bad;
  }
}

}  // namespace
}  // namespace zerith::test
