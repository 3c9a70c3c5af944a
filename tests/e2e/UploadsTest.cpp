// Uploads through the real daemon against upload servers that hold, fail or
// cannot be reached, and with a body file that cannot be written: more
// clients ask than may upload at once, every request ends within the time
// limit, another client is served meanwhile, and the daemon's threads and
// descriptors come back. Also: nothing goes out in clear, and a client-named
// path cannot forge a log line.

#include <filesystem>
#include <fstream>
#include <future>
#include <iostream>

#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

// Threads and descriptors of a process.
struct Load {
  std::size_t threads = 0;
  std::size_t descriptors = 0;
  std::size_t rssKiB = 0;
};

Load loadOf(pid_t pid) {
  const fs::path proc = "/proc/" + std::to_string(pid);
  Load load;
  std::error_code ec;
  for (auto it = fs::directory_iterator(proc / "task", ec); !ec && it != fs::directory_iterator(); it.increment(ec)) {
    ++load.threads;
  }
  for (auto it = fs::directory_iterator(proc / "fd", ec); !ec && it != fs::directory_iterator(); it.increment(ec)) {
    ++load.descriptors;
  }
  std::ifstream status(proc / "status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("VmRSS:")) {
      load.rssKiB = std::stoul(line.substr(6));
    }
  }
  return load;
}

// The load once its descriptors stop falling (closed clients let go), at
// most 5 s later.
Load settledLoad(pid_t pid) {
  Load load = loadOf(pid);
  for (const auto began = Clock::now(); Clock::now() - began < 5s;) {
    std::this_thread::sleep_for(100ms);
    const Load next = loadOf(pid);
    if (next.descriptors >= load.descriptors) {
      return next;
    }
    load = next;
  }
  return load;
}

class UploadsUnderStallTest : public E2eTest {
 protected:
  void SetUp() override {
    grant(Value(true));
    files = root.path() / "client";
    fs::create_directories(files);
    Defaults("com.velmar.zerith").setObject("uploadTimeoutSeconds", Value(3));
  }

  // The upload backend takes "post_url" from its own profile in the
  // section; a client list (as the HTTPS backends have) gives it none.
  void start(const std::string& postURL) {
    const Value section(Dictionary{{"uploadServer", Dictionary{{"post_url", postURL}}}});
    serveSignedStorebag(bags, Value(Dictionary{{"version", "8.1.0"}, {"seed", section}, {"release", section}}));
    DaemonProcess::Options options;
    options.arguments = {"--stop-timeout", "5", "--ca-file", TestCA::shared().caFile().string()};
    startDaemon(std::move(options));
  }

  HttpsTestServer bags;
  HttpsTestServer uploads;
  fs::path files;
};

enum class Server { Holds, Fails, Refuses, NoBodyFile };
struct Row {
  const char* name;
  Server server;
  const char* logged;  // every such upload leaves this line
};

class UploadsAgainstBadServers : public UploadsUnderStallTest, public ::testing::WithParamInterface<Row> {};

// 12 uploads of one user (2 may post at once, 8 may wait, 2 are refused at
// once) while the server misbehaves; another client is served meanwhile.
TEST_P(UploadsAgainstBadServers, EveryUploadEndsInTimeAndAnotherClientIsServed) {
  const Row row = GetParam();
  RefusingPort refusing;
  uploads.on("/upload", Reply{.status = 500, .body = "no room"});
  start(row.server == Server::Refuses ? refusing.url("/upload") : uploads.url("/upload"));
  if (row.server == Server::NoBodyFile) {
    const fs::path storage = root.path() / "tmp/zthstorage";
    fs::remove_all(storage);
    fs::create_directories(storage.parent_path());
    std::ofstream(storage) << "in the way";
  }
  std::ofstream(files / "report.log") << "report";
  const auto upload = [this](Zerith& client) {
    return client.uploadFile(Value((files / "report.log").string()), Value(), 20s);
  };
  // Idle is measured after one session and upload made what stays for the
  // daemon's life (the storebag, the CA bundle, the pools' first threads, a
  // reactor on each socket thread).
  {
    std::vector<file::UniqueFd> sockets(4);
    for (auto& s : sockets) {
      s = connectToDaemonSocket();
    }
    auto first = startDemoSession(9);
    ASSERT_TRUE(first && first->sendMessage(Value(Dictionary{{kZerithMessageParametersCategory, Value(3)}}), 5s));
    ASSERT_TRUE(upload(*first));
  }
  if (row.server == Server::Holds) {
    uploads.holdAnswers();
  }
  const Load idle = settledLoad(daemon->pid());

  constexpr int kUploaders = 12;
  std::vector<std::unique_ptr<Zerith>> clients;
  for (int i = 0; i < kUploaders; ++i) {
    clients.push_back(startDemoSession(static_cast<std::uint32_t>(10 + i)));
    ASSERT_TRUE(clients.back());
  }
  const auto began = Clock::now();
  std::vector<std::future<ZerithReply>> answers;
  for (auto& c : clients) {
    answers.push_back(std::async(std::launch::async, [&] { return upload(*c); }));
  }
  if (row.server == Server::Holds) {
    ASSERT_TRUE(uploads.waitForRequestTo("/upload"));
  }
  const auto asked = Clock::now();
  auto other = startDemoSession(99);
  ASSERT_TRUE(other);
  EXPECT_TRUE(other->sendMessage(Value(Dictionary{{kZerithMessageParametersCategory, Value(3)}}), 5s));
  const auto served = Clock::now() - asked;
  EXPECT_LT(served, 5s);
  const Load peak = loadOf(daemon->pid());

  for (auto& a : answers) {
    const ZerithReply r = a.get();
    ASSERT_TRUE(r) << r.error->description;
    if (row.server != Server::Fails && row.server != Server::Refuses) {
      EXPECT_EQ(r["success"], Value(false));
    }
  }
  // All by the 3 s limit (waiting included), not when the server lets go.
  const auto ended = Clock::now() - began;
  EXPECT_LT(ended, 10s);
  EXPECT_TRUE(daemon->waitFor(row.logged, 2)) << daemon->output();
  if (row.server == Server::Holds) {
    EXPECT_EQ(daemon->count("uploads run and"), 2u);  // the two past 2 posting and 8 waiting
  }
  EXPECT_TRUE(fs::exists(files / "report.log"));
  clients.clear();
  other.reset();
  uploads.releaseAnswers();

  Load after = loadOf(daemon->pid());
  const auto closed = Clock::now();
  while ((after.descriptors > idle.descriptors || after.threads > idle.threads) && Clock::now() - closed < 10s) {
    std::this_thread::sleep_for(50ms);
    after = loadOf(daemon->pid());
  }
  EXPECT_LE(after.descriptors, idle.descriptors);
  EXPECT_LE(after.threads, idle.threads);
  const auto ms = [](auto d) { return std::chrono::duration_cast<std::chrono::milliseconds>(d).count(); };
  std::cout << "[figures] " << row.name << ": other client served in " << ms(served) << " ms; uploads ended after "
            << ms(ended) << " ms; threads " << idle.threads << "/" << peak.threads << "/" << after.threads
            << ", descriptors " << idle.descriptors << "/" << peak.descriptors << "/" << after.descriptors
            << ", RSS KiB " << idle.rssKiB << "/" << peak.rssKiB << "/" << after.rssKiB << " (idle/during/after); back in " << ms(Clock::now() - closed) << " ms\n";
}

INSTANTIATE_TEST_SUITE_P(
    Servers, UploadsAgainstBadServers,
    ::testing::Values(Row{"Holds", Server::Holds, "no answer within the time limit of 3000 ms"},
                      Row{"Fails", Server::Fails, "Json output: no room"},
                      Row{"Refuses", Server::Refuses, "UploadBackend(uploadFileAtPath): post "},
                      Row{"NoBodyFile", Server::NoBodyFile, "the body file cannot be written"}),
    [](const auto& info) { return std::string(info.param.name); });

// An http:// address is posted over TLS (the test server speaks nothing
// else: a request in clear would never be recorded), and a name with a line
// feed is written escaped on one log line.
TEST_F(UploadsUnderStallTest, PlainHttpIsUpgradedAndALineFeedIsEscaped) {
  uploads.on("/upload", Reply{.body = "upload success"});
  start("http://127.0.0.1:" + std::to_string(uploads.port()) + "/upload");
  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  const fs::path file = files / "a\nforged.log";
  std::ofstream(file) << "contents";
  const ZerithReply upload = client->uploadFile(Value(file.string()), Value(), 20s);
  ASSERT_TRUE(upload) << upload.error->description;
  EXPECT_EQ(upload["success"], Value(true));
  const auto requests = uploads.requests();
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].body, "contents");  // the server undid the gzip
  EXPECT_NE(requests[0].target.find("filename=a%0Aforged.log.gz"), std::string::npos) << requests[0].target;
  // The framework deletes the file on the server's "success".
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(daemon->waitForExact(log::Level::Debug, "uploadFileWithURL: File upload successful for " +
                                                          (files / "a").string() + "\\nforged.log"));
  // No line of the log begins with the name's second half.
  EXPECT_EQ(daemon->output().find("\nforged.log"), std::string::npos) << daemon->output();
}

}  // namespace
}  // namespace zerith::test
