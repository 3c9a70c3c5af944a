// The HTTP session service under the helper: what goes on the wire, the
// waits of background configurations, the order of delegate callbacks.

#include "transport/URLSession.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <gtest/gtest.h>

#include <filesystem>
#include <set>

#include "transport/tests/TransportTestSupport.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;

// Writes every callback as a line: "response 200", "data 5", "sent 3/3",
// "complete" or "complete 7", "invalid".
class RecordingDelegate : public URLSessionDelegate {
 public:
  explicit RecordingDelegate(std::shared_ptr<EventLog> log) : log_(std::move(log)) {}

  void didBecomeInvalidWithError(URLSession&, const std::optional<Error>& error) override {
    log_->add(error ? "invalid " + std::to_string(error->code) : "invalid");
  }
  void didSendBodyData(URLSession&, URLSessionTask&, std::int64_t, std::int64_t total, std::int64_t expected) override {
    log_->add("sent " + std::to_string(total) + "/" + std::to_string(expected));
  }
  void didReceiveResponse(URLSession&, URLSessionTask&, const HTTPURLResponse& response,
                          const std::function<void(ResponseDisposition)>& handler) override {
    log_->add("response " + std::to_string(response.statusCode));
    handler(disposition);
  }
  void didReceiveData(URLSession&, URLSessionTask&, const Data& data) override {
    std::lock_guard lock(mutex_);
    received_.insert(received_.end(), data.begin(), data.end());
  }
  void didCompleteWithError(URLSession&, URLSessionTask&, const std::optional<Error>& error) override {
    {
      std::lock_guard lock(mutex_);
      lastError_ = error;
    }
    log_->add(error ? "complete " + std::to_string(error->code) : "complete");
  }

  Data received() const {
    std::lock_guard lock(mutex_);
    return received_;
  }
  std::optional<Error> lastError() const {
    std::lock_guard lock(mutex_);
    return lastError_;
  }

  ResponseDisposition disposition = ResponseDisposition::Allow;

 private:
  std::shared_ptr<EventLog> log_;
  mutable std::mutex mutex_;
  Data received_;
  std::optional<Error> lastError_;
};

class URLSessionTest : public TransportTest {
 protected:
  std::shared_ptr<URLSession> makeSession(const URLSessionConfiguration& configuration) {
    delegate = std::make_shared<RecordingDelegate>(events);
    return URLSession::sessionWithConfiguration(configuration, delegate, mainOperationQueue());
  }
  static URLSessionConfiguration waitingConfiguration() {
    auto c = URLSessionConfiguration::defaultSessionConfiguration();
    c.waitsForConnectivity = true;
    c.connectivityRetryInterval = std::chrono::milliseconds(10);
    c.connectivityRetryMaxInterval = std::chrono::milliseconds(20);
    return c;
  }
  void writePowerSupply(const std::string& name, const std::string& type, const std::string& key, const std::string& value) {
    root.write("/sys/class/power_supply/" + name + "/type", type + "\n");
    root.write("/sys/class/power_supply/" + name + "/" + key, value + "\n");
  }

  std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  std::shared_ptr<RecordingDelegate> delegate;
};

TEST_F(URLSessionTest, CallbacksArriveInWireOrderAndInvalidationComesLast) {
  server.on("/echo", Reply{.status = 201, .headers = {{"X-Reply", "yes"}}, .body = "hello"});
  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  auto task = session->dataTaskWithRequest(post(server.url("/echo"), "abc"));
  ASSERT_TRUE(task);
  EXPECT_EQ(task->state(), URLSessionTask::State::Suspended);
  task->resume();
  session->finishTasksAndInvalidate();
  EXPECT_EQ(session->dataTaskWithRequest(get(server.url("/echo"))), nullptr);
  ASSERT_TRUE(events->waitFor("invalid"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"sent 3/3", "response 201", "complete", "invalid"}));
  EXPECT_EQ(text(delegate->received()), "hello");
  EXPECT_EQ(task->state(), URLSessionTask::State::Completed);
  ASSERT_TRUE(task->response());
  EXPECT_EQ(task->response()->valueForHTTPHeaderField("x-reply"), "yes");
  EXPECT_FALSE(session->hasDelegate());  // released once invalid
}

// An invalidation between a task's creation and its start (a session ending
// while its last batch is handed to the transport) waits for that task.
TEST_F(URLSessionTest, ATaskMadeBeforeTheInvalidationCompletesFirst) {
  server.on("/post", Reply{.status = 204});
  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  auto started = session->dataTaskWithRequest(post(server.url("/post"), "late"));
  auto dropped = session->dataTaskWithRequest(post(server.url("/post"), "never"));
  ASSERT_TRUE(started && dropped);
  session->finishTasksAndInvalidate();
  started->resume();
  dropped.reset();  // never started: it holds the invalidation no longer
  ASSERT_TRUE(events->waitFor("invalid"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"sent 4/4", "response 204", "complete", "invalid"}));
  EXPECT_EQ(server.requestCount(), 1u);
}

// Twenty posts at once to one server that holds its answers: at most six
// connections open, so no seventh request arrives while six wait for their
// answers; the other posts wait for a connection and then go out on it
// (without the bound every post opened a connection and paid a TLS
// handshake). The count of connections over the whole test is not the bound:
// the server closes a connection idle for a second, and on a busy machine a
// post may come later than that and open a new one.
TEST_F(URLSessionTest, PostsToOneServerShareAtMostSixKeptConnections) {
  HttpsTestServer keeping(TestCA::shared(), {.keepAlive = true});
  keeping.on("/post", Reply{.status = 204});
  keeping.holdAnswers();
  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  constexpr std::size_t kPosts = 20;
  for (std::size_t i = 0; i < kPosts; ++i) {
    session->dataTaskWithRequest(post(keeping.url("/post"), "body " + std::to_string(i)))->resume();
  }
  // The first six are on the wire, each on its own connection, and no more
  // come while they are held.
  ASSERT_TRUE(keeping.waitForRequests(6));
  EXPECT_FALSE(keeping.waitForRequests(7, std::chrono::milliseconds(500)));
  std::set<int> held;
  for (const auto& request : keeping.requests()) held.insert(request.remotePort);
  EXPECT_EQ(held.size(), 6u);
  keeping.releaseAnswers();
  ASSERT_TRUE(events->waitForCount("complete", kPosts));
  const auto requests = keeping.requests();
  ASSERT_EQ(requests.size(), kPosts);
  // The rest went out on the kept connections, not one each.
  std::set<int> connections;
  for (const auto& request : requests) connections.insert(request.remotePort);
  EXPECT_LT(connections.size(), kPosts - 6);
  session->finishTasksAndInvalidate();
  ASSERT_TRUE(events->waitFor("invalid"));
}

TEST_F(URLSessionTest, RequestHeadersOnTheWireAreExactlyTheCallersPlusTheSessionsOwn) {
  server.on("/h", Reply{});
  auto configuration = URLSessionConfiguration::defaultSessionConfiguration();
  configuration.sourceApplicationBundleIdentifier = "com.velmar.system.diagnostics";
  auto session = makeSession(configuration);

  URLRequest plain = post(server.url("/h"), std::string("\0\x01zz", 4));
  plain.ignoreLocalCache = true;
  plain.setValue("1\r\nInjected: yes", "X-Name");
  URLRequest own = post(server.url("/h"), "{}");
  own.ignoreLocalCache = true;
  own.setValue("application/json", "Content-Type");
  own.setValue("max-age=0", "Cache-Control");
  own.setValue("other.app", "X-ZTH-Source-Application");
  for (const auto& request : {plain, own}) {
    session->dataTaskWithRequest(request)->resume();
  }
  ASSERT_TRUE(server.waitForRequests(2));
  ASSERT_TRUE(events->waitForCount("complete", 2));

  auto requests = server.requests();
  std::sort(requests.begin(), requests.end(), [](const auto& a, const auto& b) { return a.body.size() > b.body.size(); });
  EXPECT_EQ(requests[0].body, std::string("\0\x01zz", 4));
  // The recording server sorts the headers by name. No form type the
  // caller did not ask for, no "Expect", no injected line.
  using Headers = std::vector<std::pair<std::string, std::string>>;
  const std::string host = "127.0.0.1:" + std::to_string(server.port());
  EXPECT_EQ(requests[0].headers, (Headers{{"Accept", "*/*"},
                                          {"Cache-Control", "no-cache"},
                                          {"Content-Length", "4"},
                                          {"Host", host},
                                          {"Pragma", "no-cache"},
                                          {"X-Name", "1  Injected: yes"},
                                          {"X-ZTH-Source-Application", "com.velmar.system.diagnostics"}}));
  EXPECT_EQ(requests[1].headers, (Headers{{"Accept", "*/*"},
                                          {"Cache-Control", "max-age=0"},
                                          {"Content-Length", "2"},
                                          {"Content-Type", "application/json"},
                                          {"Host", host},
                                          {"Pragma", "no-cache"},
                                          {"X-ZTH-Source-Application", "other.app"}}));
}

TEST_F(URLSessionTest, OnlyWebRequestsAreMadeAndBadOnesCompleteWithAnError) {
  root.write("/secret.txt", "do not read");
  URLRequest badMethod = get(server.url("/"));
  badMethod.httpMethod = "GET / HTTP/1.1\r\nX:";
  const std::vector<std::pair<URLRequest, std::int64_t>> cases = {
      {get("file://" + (root / "/secret.txt").string()), 1},  // CURLE_UNSUPPORTED_PROTOCOL
      {get(""), 3},                                            // CURLE_URL_MALFORMAT
      {badMethod, 43},                                         // CURLE_BAD_FUNCTION_ARGUMENT
  };
  for (const auto& [request, code] : cases) {
    events = std::make_shared<EventLog>();
    auto s = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
    s->dataTaskWithRequest(request)->resume();
    s->finishTasksAndInvalidate();
    ASSERT_TRUE(events->waitFor("invalid"));
    EXPECT_EQ(events->events(), (std::vector<std::string>{"complete " + std::to_string(code), "invalid"})) << request.url;
    EXPECT_TRUE(delegate->received().empty());
  }
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(URLSessionTest, RedirectIsFollowedAndTheUploadBodySentAgain) {
  server.on("/old", Reply{.status = 307, .headers = {{"Location", "/new"}}});
  server.on("/new", Reply{.body = "moved"});
  const std::string body = patternBody(70000);
  const fs::path file = root / "/body";
  root.write("/body", body);
  file::UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
  fs::remove(file);

  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  auto task = session->uploadTaskWithRequest(post(server.url("/old"), "ignored"), std::move(fd));
  ASSERT_TRUE(task);
  task->resume();
  ASSERT_TRUE(events->waitFor("complete"));
  ASSERT_EQ(server.requestCount(), 2u);
  EXPECT_EQ(server.requests()[0].body, body);
  EXPECT_EQ(server.requests()[1].path, "/new");
  EXPECT_TRUE(server.requests()[1].body == body) << "the body was not rewound for the redirect";
  ASSERT_TRUE(task->response());
  EXPECT_EQ(std::pair(task->response()->statusCode, task->response()->url), std::pair(200L, server.url("/new")));
  EXPECT_EQ(text(delegate->received()), "moved");

  // Only regular files carry uploads.
  EXPECT_EQ(session->uploadTaskWithRequest(post(server.url("/"), ""), file::UniqueFd()), nullptr);
  EXPECT_EQ(session->uploadTaskWithRequest(post(server.url("/"), ""), file::UniqueFd(::open("/", O_RDONLY | O_CLOEXEC))), nullptr);
}

TEST_F(URLSessionTest, RequestTimeoutEndsASlowAnswerAndCancelEndsATaskOnce) {
  server.on("/slow", Reply{.body = "late", .delay = std::chrono::seconds(5)});
  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  URLRequest request = get(server.url("/slow"));
  request.timeoutSeconds = 0.2;
  session->dataTaskWithRequest(request)->resume();
  ASSERT_TRUE(events->waitFor("complete 28"));  // CURLE_OPERATION_TIMEDOUT
  EXPECT_EQ(events->events(), std::vector<std::string>{"complete 28"});

  server.holdAnswers();
  auto held = session->dataTaskWithRequest(get(server.url("/held")));
  held->resume();
  ASSERT_TRUE(server.waitForRequestTo("/held"));
  held->cancel();
  held->cancel();
  ASSERT_TRUE(events->waitFor("complete " + std::to_string(kURLErrorCancelled)));
  server.releaseAnswers();
  // A suspended task that is cancelled completes the same way.
  auto never = session->dataTaskWithRequest(get(server.url("/never")));
  never->cancel();
  session->finishTasksAndInvalidate();
  ASSERT_TRUE(events->waitFor("invalid"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"complete 28", "complete -999", "complete -999", "invalid"}));
  for (const auto& r : server.requests()) {
    EXPECT_NE(r.path, "/never");
  }
}

TEST_F(URLSessionTest, CancellingAtTheResponseStopsTheBody) {
  server.on("/big", Reply{.body = patternBody(4 << 20), .chunkSize = 65536, .chunkPause = std::chrono::milliseconds(5)});
  auto session = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  delegate->disposition = ResponseDisposition::Cancel;
  session->dataTaskWithRequest(get(server.url("/big")))->resume();
  ASSERT_TRUE(events->waitFor("complete -999"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"response 200", "complete -999"}));
  EXPECT_LT(delegate->received().size(), std::size_t{4 << 20});
}

TEST_F(URLSessionTest, WithoutARouteTheRequestWaitsUntilItsOwnTimeoutButARefusalEndsItAtOnce) {
  // TCP to a multicast address fails in the kernel with ENETUNREACH: a
  // missing route, without a packet leaving the machine.
  auto session = makeSession(waitingConfiguration());
  URLRequest request = get("https://224.0.0.1:9/");
  request.timeoutSeconds = 0.3;
  auto task = session->dataTaskWithRequest(request);
  task->setTaskDescription("waiting");
  task->resume();
  ASSERT_TRUE(events->waitFor("complete 28"));
  EXPECT_EQ(delegate->lastError()->description, "Timeout was reached while waiting for connectivity");
  EXPECT_GE(logs.count("URLSession: task <waiting> has no route to its server"), 2u);

  // Without waiting, the same request fails at once; so does a refused
  // connection while waiting, since the server is there to refuse.
  auto plain = makeSession(URLSessionConfiguration::defaultSessionConfiguration());
  plain->dataTaskWithRequest(get("https://224.0.0.1:9/"))->resume();
  ASSERT_TRUE(events->waitFor("complete 7"));
  RefusingPort refusing;
  const std::size_t noRoute = logs.count("has no route to its server");
  auto waiting = makeSession(waitingConfiguration());
  waiting->dataTaskWithRequest(get(refusing.url("/")))->resume();
  ASSERT_TRUE(events->waitForCount("complete 7", 2));
  EXPECT_EQ(logs.count("has no route to its server"), noRoute);
}

// On battery a discretionary transfer goes after its maximum delay; one that
// requires external power waits (looking at the battery again and again)
// until its own timeout, or until the power comes.
TEST_F(URLSessionTest, TransfersOnBatteryWaitForTheirDelayOrForExternalPower) {
  server.on("/p", Reply{.body = "powered"});
  writePowerSupply("BAT0", "Battery", "status", "Discharging");
  writePowerSupply("AC", "Mains", "online", "0");
  auto configuration = URLSessionConfiguration::backgroundSessionConfigurationWithIdentifier("power");
  configuration.discretionary = true;
  configuration.powerCheckInterval = std::chrono::hours(1);
  configuration.discretionaryMaxDelay = std::chrono::milliseconds(50);
  auto session = makeSession(configuration);
  session->dataTaskWithRequest(get(server.url("/p")))->resume();
  ASSERT_TRUE(events->waitFor("complete"));
  EXPECT_EQ(text(delegate->received()), "powered");
  EXPECT_EQ(logs.count("waits while the device runs on battery"), 1u);

  configuration.requiresPowerPluggedIn = true;
  configuration.powerCheckInterval = std::chrono::milliseconds(10);
  configuration.discretionaryMaxDelay = std::chrono::milliseconds(0);  // not enough without external power
  session = makeSession(configuration);
  URLRequest request = get(server.url("/p"));
  request.timeoutSeconds = 0.1;
  session->dataTaskWithRequest(request)->resume();
  ASSERT_TRUE(events->waitFor("complete 28"));
  EXPECT_EQ(delegate->lastError()->description, "Timeout was reached while waiting for external power");

  auto task = session->dataTaskWithRequest(get(server.url("/p")));
  task->setTaskDescription("power");
  task->resume();
  // Each look at the battery logs again.
  const std::string waiting = "URLSession: task <power> waits while the device runs on battery";
  for (int i = 0; i < 5000 && logs.count(waiting) < 3; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(2));
  ASSERT_GE(logs.count(waiting), 3u);
  EXPECT_EQ(server.requestCount(), 1u);
  writePowerSupply("AC", "Mains", "online", "1");
  ASSERT_TRUE(events->waitForCount("complete", 2));
  EXPECT_EQ(text(delegate->received()), "powered");
  EXPECT_EQ(server.requestCount(), 2u);
}

// The socket of this process connected from `localPort` to `remotePort`.
int clientSocket(int localPort, int remotePort) {
  for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
    const int fd = std::stoi(entry.path().filename().string());
    sockaddr_in local{}, peer{};
    socklen_t n = sizeof(local), m = sizeof(peer);
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&local), &n) == 0 && local.sin_family == AF_INET &&
        ::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &m) == 0 && ntohs(local.sin_port) == localPort &&
        ntohs(peer.sin_port) == remotePort) {
      return fd;
    }
  }
  return -1;
}

TEST_F(URLSessionTest, BackgroundServiceTypeLowersTheSocketPriority) {
  server.holdAnswers();
  auto configuration = URLSessionConfiguration::backgroundSessionConfigurationWithIdentifier("bg");
  configuration.networkServiceType = NetworkServiceType::Background;
  auto background = makeSession(configuration);
  auto ordinary = URLSession::sessionWithConfiguration(URLSessionConfiguration::defaultSessionConfiguration(), delegate,
                                                       mainOperationQueue());
  background->dataTaskWithRequest(get(server.url("/bg")))->resume();
  ASSERT_TRUE(server.waitForRequests(1));
  ordinary->dataTaskWithRequest(get(server.url("/default")))->resume();
  ASSERT_TRUE(server.waitForRequests(2));

  int priorities[2] = {-1, -1};
  for (const auto& r : server.requests()) {
    const int fd = clientSocket(r.remotePort, server.port());
    ASSERT_GE(fd, 0) << r.path;
    socklen_t len = sizeof(int);
    ::getsockopt(fd, SOL_SOCKET, SO_PRIORITY, &priorities[r.path == "/bg" ? 0 : 1], &len);
  }
  EXPECT_EQ(priorities[0], 2);
  EXPECT_EQ(priorities[1], 0);
  server.releaseAnswers();
  ASSERT_TRUE(events->waitForCount("complete", 2));
}

}  // namespace
}  // namespace zerith::test
