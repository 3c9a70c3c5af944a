#include "config/StorebagFetch.h"

#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <future>
#include <thread>

#include "config/StorebagServers.h"
#include "config/StorebagVerify.h"
#include "config/tests/StorebagTestFixture.h"
#include "platform/Defaults.h"
#include "tests/support/HttpsTestServer.h"
#include "tests/support/NginxServer.h"
#include "transport/URLSession.h"

namespace zerith {
namespace {

using log::Level;
using test::sampleStorebag;
using test::signedContainer;
using test::withEntry;
using test::withoutKey;
namespace fs = std::filesystem;

Value releaseSection() { return sampleStorebag()["release"]; }

// A file's modification time as an HTTP date, as a static server sends it.
std::string httpDate(const fs::path& path) {
  struct stat st {};
  ::stat(path.c_str(), &st);
  std::tm tm{};
  gmtime_r(&st.st_mtim.tv_sec, &tm);
  char buf[64];
  std::strftime(buf, sizeof buf, "%a, %d %b %Y %H:%M:%S GMT", &tm);
  return buf;
}

struct FetchResult {
  Value section;
  std::int32_t maxAge = -1;
  Value version;
  bool unchanged = true;
};

class StorebagFetchTest : public test::StorebagTest {
 protected:
  StorebagFetchTest() {
    URLSession::setExtraCAFile(test::TestCA::shared().caFile().string());
    setEnvironment(4);
  }

  static FetchResult fetch(std::int32_t clientType) {
    FetchResult r;
    r.section = fetchStorebagForEnvironmentAndClientType(clientType, r.maxAge, r.version, r.unchanged);
    return r;
  }

  // A cached copy that is still fresh, so that no network is involved.
  void cacheFresh(const Value& bag) { cache("ambrel", signedContainer(bag), 86400); }
};

// --- No server -------------------------------------------------------------

// (That the daemon loads it when the server fails, and refuses it, is the end-to-end start test's.)
TEST_F(StorebagFetchTest, FallbackStorebagIsTheBuiltInUnsignedList) {
  const Data fallback = buildFallbackStorebag();
  ASSERT_TRUE(plist::looksBinary(plist::bytesOf(fallback)));
  const Value section(Dictionary{{"kovu", Value(Dictionary{{"active", true}})}});
  EXPECT_EQ(*plist::decode(plist::bytesOf(fallback)),
            Value(Dictionary{{"velmar_internal", section},
                             {"development", section},
                             {"release", section},
                             {"version", "1.0.0-Corvid-Fallback"},
                             {"refresh_cycle", 3600}}));
}

TEST_F(StorebagFetchTest, ClientTypeWithoutStorebagNameIsReported) {
  EXPECT_TRUE(fetch(0).section.isNil());
  EXPECT_TRUE(logs_.has(Level::Error,
                        "fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type 0"));
}

TEST_F(StorebagFetchTest, ServerURLComesFromTheDefaultsAtEveryCall) {
  setServer("https://a.example/bags");
  EXPECT_EQ(storebagRequestURL("ambrel"), "https://a.example/bags/ambrel?version=8.0");
  setServer("https://b.example");
  setFrameworkVersion("8.1.0");
  EXPECT_EQ(storebagRequestURL("dravon"), "https://b.example/dravon?version=8.1.0");
  setDefaultsObjectForKey("zerith_storebag_url", Value());
  EXPECT_EQ(storebagServerURL(), isInternalBuild() ? kZerithInternalStorebagURL : kZerithDefaultStorebagURL);
}

// --- Sections, versions and max age from a fresh cached copy ----------------

// A fresh cached copy answers each environment with its section, its
// version (none unless a string) and the max age; a seed device without a
// seed section gets the release one; a missing or malformed section fails
// naming the environment.
TEST_F(StorebagFetchTest, EachEnvironmentGetsItsSectionOrAnErrorNamingIt) {
  const Value noSeed = withoutKey(sampleStorebag(), "seed");
  const std::string notFound = "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type 5 with ";
  const std::string seedMissing = "fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.";
  const struct {
    const char* name;
    Value bag;
    int environment;
    Value section;
    std::string error;  // the one error line, if any
  } rows[] = {
      {"seed", sampleStorebag(), 3, sampleStorebag()["seed"], ""},
      {"release", sampleStorebag(), 4, releaseSection(), ""},
      {"seed without a seed section", noSeed, 3, releaseSection(), seedMissing},
      {"seed without seed or release", withoutKey(noSeed, "release"), 3, Value(), notFound + "release environment"},
      {"development missing", withoutKey(sampleStorebag(), "development"), 1, Value(), notFound + "development environment"},
      {"release not a section", withEntry(sampleStorebag(), "release", "not a section"), 4, Value(),
       notFound + "release environment"},
      {"no environment selected", sampleStorebag(), 0, Value(), notFound + "(null) environment"},
      {"version not a string", withEntry(sampleStorebag(), "version", 7), 4, releaseSection(), ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    cacheFresh(row.bag);
    setEnvironment(row.environment);
    logs_.clear();
    const auto r = fetch(5);
    EXPECT_EQ(r.section, row.section);
    if (!row.section.isNil()) {
      EXPECT_EQ(r.version, row.bag["version"].string() ? Value("2.4.0") : Value());
      EXPECT_EQ(r.maxAge, 86400);
      EXPECT_FALSE(r.unchanged);
      EXPECT_TRUE(logs_.has(Level::Default, "fetchStorebagWithName: storebag 'ambrel' loaded from disk cache. Disk "
                                            "cache is valid and will not be refreshed"));
      EXPECT_FALSE(logs_.contains("fetchNetworkStorebag"));
    }
    EXPECT_EQ(logs_.count("Seed section is missing"), row.environment == 3 && !row.error.empty() ? 1u : 0u);
    if (!row.error.empty()) {
      EXPECT_TRUE(logs_.has(Level::Error, row.error));
    }
  }
}

TEST_F(StorebagFetchTest, RefreshCycleReplacesTheMaxAgeUpTo86400) {
  const std::pair<Value, std::int32_t> cases[] = {{Value(100000), 86400}, {Value(600), 600}, {Value(86400), 86400},
                                                  {Value("120"), 120}};
  for (const auto& [cycle, expected] : cases) {
    cacheFresh(withEntry(sampleStorebag(), "refresh_cycle", cycle));
    logs_.clear();
    EXPECT_EQ(fetch(5).maxAge, expected) << cycle.description();
    EXPECT_TRUE(logs_.has(Level::Default, "fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=" +
                                              std::to_string(expected)));
  }
}

// --- Exact requests and answers: the in-process server ----------------------

class StorebagServerTest : public StorebagFetchTest {
 protected:
  StorebagServerTest() { setServer(server_.url("/bags")); }
  // The server answers the next requests for "ambrel" with 200 and `container`.
  void serve(const Data& container, std::vector<std::pair<std::string, std::string>> headers = {}) {
    server_.on("/bags/ambrel",
               test::Reply{.status = 200, .headers = std::move(headers), .body = test::text(container)});
  }
  test::HttpsTestServer server_;
};

TEST_F(StorebagServerTest, AnAnswerOtherThan200NamesItsStatusAsTheCause) {
  for (const int status : {404, 503}) {
    logs_.clear();
    server_.on("/bags/ambrel", test::Reply{.status = status, .headers = {}, .body = "no storebag here"});
    EXPECT_TRUE(fetch(5).section.isNil());
    const std::string url = server_.url("/bags/ambrel?version=8.0");
    EXPECT_TRUE(logs_.has(Level::Error, "fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client "
                                        "type 5: HTTP status " + std::to_string(status) + " from " + url));
    // Only the client types that have one fall back to the built-in storebag.
    EXPECT_FALSE(logs_.contains("Loading default storebag"));
  }
  EXPECT_FALSE(cached("ambrel"));
}

TEST_F(StorebagServerTest, FirstFetchIsAPlainGetOfTheVersionedURL) {
  setFrameworkVersion("8.1.0");
  serve(signedContainer(sampleStorebag()),
        {{"Cache-Control", "max-age=600"}, {"Last-Modified", "Tue, 14 Nov 2023 22:13:20 GMT"}});
  const auto r = fetch(5);
  EXPECT_EQ(r.section, releaseSection());
  EXPECT_EQ(r.maxAge, 600);
  ASSERT_EQ(server_.requestCount(), 1u);
  const auto request = server_.requests()[0];
  EXPECT_EQ(request.method, "GET");
  EXPECT_EQ(request.target, "/bags/ambrel?version=8.1.0");
  EXPECT_FALSE(request.header("If-Modified-Since"));
  EXPECT_TRUE(logs_.has(Level::Debug, "fetchNetworkStorebag: Storebag Server URL: " +
                                          server_.url("/bags/ambrel?version=8.1.0")));
  EXPECT_TRUE(logs_.has(Level::Default, "fetchStorebagWithName: storebag 'ambrel' has been saved to disk cache"));
  EXPECT_EQ(cached("ambrel"), signedContainer(sampleStorebag()));
  EXPECT_EQ(metric("ambrel", "Last-Modified"), Value("Tue, 14 Nov 2023 22:13:20 GMT"));
}

// What lint finds in a bag is logged once, as it arrives from the server;
// the disk copy read back later is not linted again.
TEST_F(StorebagServerTest, ABagFromTheServerIsLintedAsItArrives) {
  serve(signedContainer(withEntry(sampleStorebag(), "relase", Value(Dictionary{}))), {{"Cache-Control", "max-age=600"}});
  EXPECT_EQ(fetch(5).section, releaseSection());
  const std::string finding = "fetchStorebagWithName: storebag 'ambrel': warning: unknown key \"relase\" (did you mean "
                              "\"release\"?): the daemon does not read it";
  EXPECT_TRUE(logs_.has(Level::Default, finding));
  logs_.clear();
  EXPECT_EQ(fetch(5).section, releaseSection());
  EXPECT_FALSE(logs_.contains("unknown key"));
}

// (Which Cache-Control headers have a usable max age is the parser's table.)
TEST_F(StorebagServerTest, AnswerWithoutCacheHeadersIsKeptFor86400) {
  serve(signedContainer(sampleStorebag()));
  EXPECT_EQ(fetch(5).maxAge, 86400);
  // The metrics live in the shared defaults domain under the storebag's name.
  EXPECT_EQ(Defaults("com.velmar.zerith").objectForKey("CACHED_ambrel_max-age"), Value(86400));
  EXPECT_TRUE(metric("ambrel", "Last-Modified").isNil());
  EXPECT_TRUE(logs_.has(Level::Debug, "saveLastLoadedStorebagMetricsWithName: New storebag 'ambrel' received: maxAge "
                                      "86400, Last-Modified '(null)'"));
}

TEST_F(StorebagServerTest, ExpiredCopyIsUsedWhileAnEmptyAnswerChangesOnlyTheMetrics) {
  const Data container = signedContainer(sampleStorebag());
  cache("ambrel", container, 0, "Mon, 01 Jan 2024 00:00:00 GMT");
  const auto before = storebagCacheModificationDate("ambrel");
  serve({}, {{"Cache-Control", "max-age=1234"}, {"Last-Modified", "Tue, 02 Jan 2024 00:00:00 GMT"}});

  const auto r = fetch(5);
  EXPECT_EQ(r.section, releaseSection());  // the cached copy serves at once
  EXPECT_TRUE(logs_.has(Level::Default,
                        "fetchStorebagWithName: storebag 'ambrel' loaded from disk cache. Disk cache expired and will "
                        "be refreshed"));
  ASSERT_TRUE(logs_.waitFor("received zero-length storebag"));
  EXPECT_TRUE(logs_.has(Level::Debug,
                        "fetchNetworkStorebag: received zero-length storebag for 'ambrel\u2018, treat as unchanged"));
  EXPECT_TRUE(logs_.has(Level::Debug,
                        "fetchNetworkStorebag: Adding 'Last-Modified: Mon, 01 Jan 2024 00:00:00 GMT' to the header"));
  EXPECT_EQ(server_.requests()[0].header("If-Modified-Since"), "Mon, 01 Jan 2024 00:00:00 GMT");
  EXPECT_EQ(metric("ambrel", "max-age"), Value(1234));
  EXPECT_EQ(metric("ambrel", "Last-Modified"), Value("Tue, 02 Jan 2024 00:00:00 GMT"));
  EXPECT_EQ(cached("ambrel"), container);
  EXPECT_EQ(storebagCacheModificationDate("ambrel"), before);
}

TEST_F(StorebagServerTest, FailedOrTamperedRefreshKeepsTheLastGoodCopy) {
  const Data container = signedContainer(sampleStorebag("1.0"));
  cache("ambrel", container, 0, "Mon, 01 Jan 2024 00:00:00 GMT");

  server_.on("/bags/ambrel", test::Reply{.status = 503, .headers = {{"Cache-Control", "max-age=5"}}, .body = "busy"});
  EXPECT_EQ(fetch(5).version, Value("1.0"));
  ASSERT_TRUE(logs_.waitFor("does not need update"));
  EXPECT_TRUE(logs_.has(Level::Debug,
                        "fetchNetworkStorebag: storebag 'ambrel' does not need update as its content has not changed "
                        "on the server"));
  EXPECT_EQ(metric("ambrel", "max-age"), Value(0));  // an error answer leaves the metrics alone

  serve(signedContainer(sampleStorebag("6.6"), test::otherStorebagKeys()));
  logs_.clear();
  EXPECT_EQ(fetch(5).version, Value("1.0"));
  ASSERT_TRUE(logs_.waitFor("Signature can not be verified"));
  EXPECT_EQ(cached("ambrel"), container);
  // The answer's metrics are taken before its body is checked: the copy on
  // disk now counts as fresh for a day, and it is still the good one.
  EXPECT_EQ(fetch(5).version, Value("1.0"));
  EXPECT_EQ(server_.requestCount(), 2u);
}

TEST_F(StorebagServerTest, SynchronousWaitReleasesTheCacheLockForTheCompletion) {
  serve(signedContainer(sampleStorebag()));
  server_.holdAnswers();
  auto done = std::make_shared<std::promise<FetchResult>>();
  auto result = done->get_future();
  std::thread([done] { done->set_value(fetch(5)); }).detach();
  ASSERT_TRUE(server_.waitForRequests(1));
  // The fetch is blocked in its wait; the lock must be free meanwhile.
  const bool lockFree = ZerithdUtil::lock().try_lock();
  if (lockFree) ZerithdUtil::lock().unlock();
  server_.releaseAnswers();
  EXPECT_TRUE(lockFree);
  if (result.wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
    // The completion could not take the lock: the process is wedged.
    ADD_FAILURE() << "the synchronous fetch never returned";
    std::fprintf(stderr, "storebag fetch deadlocked on ZerithdUtil's lock\n");
    std::_Exit(1);
  }
  EXPECT_EQ(result.get().section, releaseSection());
}

// --- A real static server: nginx's Last-Modified, If-Modified-Since, 304 ----

class StorebagNginxTest : public StorebagFetchTest {
 protected:
  void start(const std::string& cacheControl) {
    if (!test::NginxServer::available()) {
      GTEST_SKIP() << "nginx is not installed";
    }
    nginx_ = std::make_unique<test::NginxServer>(test::NginxServer::Options{
        .workDir = root_ / "/nginx",
        .documentRoot = root_ / "/www",
        .serverDirectives = "add_header Cache-Control \"" + cacheControl + "\";"});
    ASSERT_TRUE(nginx_->started()) << nginx_->error();
    setServer(nginx_->url("/bags"));
  }
  fs::path publish(const std::string& name, const Data& container) {
    const fs::path path = root_ / ("/www/bags/" + name);
    fs::create_directories(path.parent_path());
    EXPECT_TRUE(file::writeAtomically(path, container));
    return path;
  }
  std::unique_ptr<test::NginxServer> nginx_;
};

TEST_F(StorebagNginxTest, RefreshOfAnUnchangedFileIsA304AndAChangedFileIsSavedForTheNextFetch) {
  start("max-age=0");
  const fs::path file = publish("ambrel", signedContainer(sampleStorebag("1.0")));
  ASSERT_EQ(fetch(5).version, Value("1.0"));
  const auto savedAt = storebagCacheModificationDate("ambrel");
  const Value lastModified = metric("ambrel", "Last-Modified");

  // Unchanged: a 304 that changes nothing.
  logs_.clear();
  EXPECT_EQ(fetch(5).version, Value("1.0"));
  EXPECT_TRUE(logs_.contains("Disk cache expired and will be refreshed"));
  ASSERT_TRUE(logs_.waitFor("does not need update as its content has not changed"));
  EXPECT_TRUE(nginx_->waitForAccessLog("GET /bags/ambrel?version=8.0 304 ims=\"" + httpDate(file) + "\""))
      << nginx_->accessLog();
  EXPECT_EQ(storebagCacheModificationDate("ambrel"), savedAt);
  EXPECT_EQ(metric("ambrel", "Last-Modified"), lastModified);
  EXPECT_EQ(metric("ambrel", "max-age"), Value(0));

  // Changed: saved by the refresh, served by the next fetch.
  const Data newer = signedContainer(sampleStorebag("2.0"));
  publish("ambrel", newer);
  fs::last_write_time(file, fs::last_write_time(file) + std::chrono::seconds(10));
  logs_.clear();
  EXPECT_EQ(fetch(5).version, Value("1.0"));  // the refresh runs behind this answer
  ASSERT_TRUE(logs_.waitFor("has been saved to disk cache"));
  EXPECT_EQ(cached("ambrel"), newer);
  EXPECT_EQ(metric("ambrel", "Last-Modified"), Value(httpDate(file)));
  logs_.clear();
  EXPECT_EQ(fetch(5).version, Value("2.0"));
  ASSERT_TRUE(logs_.waitFor("does not need update"));  // this call's refresh: 304
}

}  // namespace
}  // namespace zerith
