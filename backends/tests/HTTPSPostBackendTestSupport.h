#pragma once

// Scenario helpers of the HTTPS backend tests: a fixture with a temporary
// root, the test CA trusted, a recording HTTPS server and a real
// connectivity helper, "/post" answered 200; profiles; flushes and posts that wait for their
// completion; what the backend counted; gzip inflation and an independent
// HMAC.

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <zlib.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "backends/HTTPSPostBackend.h"
#include "backends/tests/BackendTestSupport.h"
#include "config/ClientTypes.h"
#include "config/DeviceInfo.h"
#include "config/tests/ScopedEnv.h"
#include "platform/Defaults.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/TempRoot.h"
#include "tests/support/TestCA.h"
#include "transport/ReportingSessionConnectivityHelper.h"
#include "transport/URLSession.h"
#include "transport/tests/TransportTestSupport.h"

namespace zerith {
// Values in failure messages as JSON text.
inline void PrintTo(const Value& value, std::ostream* out) { *out << json::serialize(value); }
}  // namespace zerith

namespace zerith::test {

// The body as the server saw it, inflated when it came gzip'd (zlib itself,
// not the code under test, undoes it).
inline std::string inflateGzip(const std::string& body) {
  z_stream stream{};
  if (inflateInit2(&stream, 16 + MAX_WBITS) != Z_OK) {
    return {};
  }
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  std::string out;
  char buffer[65536];
  int rc = Z_OK;
  while (rc == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer);
    stream.avail_out = sizeof(buffer);
    rc = inflate(&stream, Z_NO_FLUSH);
    out.append(buffer, sizeof(buffer) - stream.avail_out);
  }
  inflateEnd(&stream);
  return rc == Z_STREAM_END ? out : std::string();
}

// The recording server's library undoes gzip itself when it can; a body
// still in gzip form is inflated here.
inline std::string jsonOf(const RecordedRequest& request) {
  const bool gzip = request.body.size() > 2 && static_cast<unsigned char>(request.body[0]) == 0x1f &&
                    static_cast<unsigned char>(request.body[1]) == 0x8b;
  return gzip ? inflateGzip(request.body) : request.body;
}

inline nlohmann::ordered_json envelopeOf(const RecordedRequest& request) {
  return nlohmann::ordered_json::parse(jsonOf(request));
}

// HMAC-SHA-1 through OpenSSL's own one-shot call, in the header's form.
inline std::string independentDigest(const std::string& key, const std::string& message) {
  unsigned char out[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  HMAC(EVP_sha1(), key.data(), static_cast<int>(key.size()), reinterpret_cast<const unsigned char*>(message.data()),
       message.size(), out, &length);
  std::string text = "<";
  char hex[3];
  for (unsigned int i = 0; i < length; ++i) {
    if (i > 0 && i % 4 == 0) {
      text += ' ';
    }
    std::snprintf(hex, sizeof(hex), "%02x", out[i]);
    text += hex;
  }
  return text + ">";
}

// Completions of flushes and posts, in order.
class ResultLog : public Recorder<std::optional<Error>>, public std::enable_shared_from_this<ResultLog> {
 public:
  static std::shared_ptr<ResultLog> make() { return std::make_shared<ResultLog>(); }
  ZerithBackend::FlushCompletion handler() {
    return [self = shared_from_this()](const Value&, const std::optional<Error>& error) { self->add(error); };
  }
  bool waitFor(std::size_t count) const {
    return waitUntil([&](const auto& errors) { return errors.size() >= count; }, std::chrono::seconds(30));
  }
  std::vector<std::optional<Error>> errors() const { return items(); }
};

// An event as the session hands it on: the client's payload {"n": n}.
inline Value clientEvent(int n) { return Value(Dictionary{{"ClientData", Dictionary{{"n", n}}}}); }

inline Value userInfo(const std::string& client = "demo", const std::string& service = "cli") {
  return Value(Dictionary{{"clientName", client}, {"serviceName", service}});
}

// One client entry that enables everything for `demo`/`cli` in GB, with
// `changes` set over it (a nil change removes the key).
inline Dictionary enablingClient(const std::string& postURL, const Dictionary& changes = {}) {
  Dictionary client{{"client", "demo"},
                    {"service", "cli"},
                    {"override_dnu", 1},
                    {"locale_whitelist", Array{Value("GB"), Value("US")}},
                    {"filters", Array{Value(Dictionary{{"key", "none"}, {"action", "keep"}})}},
                    {"sampling_threshold", 1.0},
                    {"event_threshold", 49},
                    {"post_url", postURL}};
  for (const auto& [key, value] : changes) {
    if (value.isNil()) {
      client.erase(key);
    } else {
      client.set(key, value);
    }
  }
  return client;
}

inline Value profileWith(std::vector<Dictionary> clients) {
  Array list;
  for (auto& c : clients) {
    list.emplace_back(std::move(c));
  }
  return Value(Dictionary{{"clients", Value(std::move(list))}});
}

class HTTPSBackendTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(URLSession::setExtraCAFile(TestCA::shared().caFile().string()));
    transport = ReportingSessionConnectivityHelper::initWithDelegate({}, 4);
    Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(true));
    server.on("/post", Reply{});  // a collector that takes everything, unless a test says otherwise
  }
  void TearDown() override {
    transport->invalidate();
    server.stop();
  }

  // A backend as a session sets it up: client type 7, version 12, session
  // 42, started at 1000.5 s, framework 8.1.0, then its state decided.
  std::shared_ptr<HTTPSPostBackend> backend(const Value& profile, Value info = userInfo(), bool requireUserInfo = true,
                                            bool batch = false) {
    auto b = HTTPSPostBackend::initWithName("httpsPost", profile, std::string("TestFamily"));
    if (!b) {
      return nullptr;
    }
    b->setSessionID(42);
    b->setCompType(7);
    b->setClientVersion(12);
    b->setProductVersion("12.4");
    b->setBuildVersion("Z1234");
    b->setHardwareType("Board9,1");
    b->setRequireUserInfo(requireUserInfo);
    b->setBatchEvents(batch);
    b->setUserInfoDict(std::move(info));
    b->setSelfVersion("8.1.0");
    b->setStartTimestamp(timeval{1000, 500000});
    b->setReportingSessionConnectivityDelegate(transport);
    b->updateState();
    return b;
  }

  // Enabled for `demo`/`cli` (with `changes` to that client entry), posting
  // each event at once or batching them.
  std::shared_ptr<HTTPSPostBackend> immediate(const std::string& url, const Dictionary& changes = {}) {
    return backend(profileWith({enablingClient(url, changes)}));
  }
  std::shared_ptr<HTTPSPostBackend> batching(const std::string& url, const Dictionary& changes = {}) {
    return backend(profileWith({enablingClient(url, changes)}), userInfo(), true, true);
  }

  static timeval at(long seconds, long micros = 0) { return timeval{seconds, micros}; }

  // Flushes, or posts `json` as it is, and waits for the completion; its error, if any.
  static std::optional<Error> flush(HTTPSPostBackend& b) { return completed(b, std::nullopt); }
  static std::optional<Error> post(HTTPSPostBackend& b, const std::string& json) { return completed(b, json); }
  static std::optional<Error> completed(HTTPSPostBackend& b, const std::optional<std::string>& json) {
    auto results = ResultLog::make();
    if (json) {
      b.postJSONMessage(*json, 0, std::nullopt, std::nullopt, results->handler());
    } else {
      b.flushMessagesWithCompletion(results->handler());
    }
    EXPECT_TRUE(results->waitFor(1));
    return results->errors().empty() ? std::nullopt : results->errors()[0];
  }

  TempRoot root;
  ScopedEnv locale{"LC_ALL", "en_GB.UTF-8"};
  log::LogCapture logs;
  HttpsTestServer server;
  std::shared_ptr<ReportingSessionConnectivityHelper> transport;
};

}  // namespace zerith::test
