// Uploads through the real daemon and client framework. The framework opens
// the file with the client's own rights and passes the descriptor; the
// daemon reads only through it and deletes nothing itself. Against upload
// servers that hold, fail or cannot be reached, and with a body file that
// cannot be written: more clients ask than may upload at once, every request
// ends within the time limit, another client is served meanwhile, and the
// daemon's threads and descriptors come back. Also: nothing goes out in
// clear, and a client-named path cannot forge a log line.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <iostream>

#include "ipc/ClientSessionWire.h"
#include "tests/e2e/E2eFixture.h"

namespace zerith::test {
namespace {

using log::Level;
namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr uid_t kNobody = 65534;

// Runs `work` on a thread of its own whose user is `uid` (the rest of the
// process keeps its identity: the raw system call changes one thread only).
template <typename F>
auto asUser(uid_t uid, F&& work) {
  return std::async(std::launch::async,
                    [uid, work = std::forward<F>(work)]() mutable {
                      // Saved user stays root so that the thread could go back;
                      // the effective and file-system user is `uid`.
                      EXPECT_EQ(::syscall(SYS_setresgid, uid, uid, 0), 0);
                      EXPECT_EQ(::syscall(SYS_setresuid, uid, uid, 0), 0);
                      return work();
                    })
      .get();
}

// Threads, descriptors and resident size of a process.
struct Load {
  std::size_t threads = 0;
  std::size_t descriptors = 0;
  std::size_t rssKiB = 0;
};

Load loadOf(pid_t pid) { return {procEntries(pid, "task"), procEntries(pid, "fd"), procStatusKiB(pid, "VmRSS")}; }

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

class UploadsTest : public E2eTest {
 protected:
  void SetUp() override {
    fs::create_directories(files);
  }

  // A daemon whose upload backend has `profile` in the storebag's section
  // and which reads its locale from `locale` when given.
  void start(const Dictionary& profile, const char* locale) {
    serveSignedStorebag(bags, storebag(Value(Dictionary{{"uploadServer", profile}})));
    startDaemon(trusting(TestCA::shared().caFile(), locale));
  }
  // The upload backend takes "post_url" from its own profile in the
  // section; a client list (as the HTTPS backends have) gives it none.
  void startWithUploadTimeout(const std::string& postURL) {
    Defaults("com.velmar.zerith").setObject("uploadTimeoutSeconds", Value(3));
    start(Dictionary{{"post_url", postURL}}, nullptr);
  }

  HttpsTestServer bags;
  HttpsTestServer uploads;
  fs::path files = root.path() / "client";
};

TEST_F(UploadsTest, ClientRightsDecideWhatCanBeUploaded) {
  if (::geteuid() != 0) {
    GTEST_SKIP() << "changing a thread's user needs root";
  }
  ::chmod(root.path().c_str(), 0755);
  ::chmod(files.c_str(), 0777);
  start(Dictionary{{"post_url", uploads.url("/upload")}}, "en_GB.UTF-8");
  uploads.on("/upload", Reply{.body = "success"});
  std::ofstream(files / "secret.log") << "secret";
  ::chown((files / "secret.log").c_str(), 0, 0);
  ::chmod((files / "secret.log").c_str(), 0600);
  fs::create_directories(files / "closed");
  std::ofstream(files / "closed" / "theirs.log") << "theirs";
  ::chown((files / "closed" / "theirs.log").c_str(), kNobody, kNobody);
  ::chmod((files / "closed").c_str(), 0700);  // root's folder: nobody cannot search it

  auto client = startDemoSession(1);
  ASSERT_TRUE(client);
  // Connected as root, then dropped to nobody: the framework's own open
  // fails, and nothing reaches the daemon.
  for (const fs::path& path : {files / "secret.log", files / "closed" / "theirs.log"}) {
    const ZerithReply upload =
        asUser(kNobody, [&] { return client->uploadFile(Value("file://" + path.string()), Value(), 10s); });
    ASSERT_TRUE(upload.error) << path;
    EXPECT_NE(upload.error->description.find("Permission denied"), std::string::npos) << upload.error->description;
  }

  // A connection made by root and handed to nobody (SCM_RIGHTS of the
  // socket): nobody cannot open the root-only file, and the daemon does not
  // open the named path for the connection's root credentials: a call
  // without a descriptor is refused.
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  file::UniqueFd sender(pair[0]), receiver(pair[1]);
  file::UniqueFd connection = connectToDaemonSocket();
  ASSERT_TRUE(connection);
  ASSERT_TRUE(sendDescriptor(sender.get(), connection.get()));
  const bool refusedToOpen = asUser(kNobody, [&] {
    const file::UniqueFd handed = receiveDescriptor(receiver.get());
    const bool denied = ::open((files / "secret.log").c_str(), O_RDONLY | O_CLOEXEC) < 0 && errno == EACCES;
    // What the new holder can still do: name the path without a descriptor.
    const Data call = ipc::encodeCall(ipc::wire::kUploadFile, 1,
                                      ipc::wire::uploadFileArgs(Value((files / "secret.log").string()), Value()));
    return handed && denied &&
           ::send(handed.get(), call.data(), call.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(call.size());
  });
  EXPECT_TRUE(refusedToOpen);
  const auto answer = RawFrameSocket(std::move(connection)).replyTo(1);
  ASSERT_TRUE(answer);
  EXPECT_EQ((*answer)["args"]["success"], Value(false));
  EXPECT_TRUE(daemon->waitFor("Refusing to upload " + (files / "secret.log").string() +
                              ": no descriptor came with the request"));
  EXPECT_FALSE(uploads.waitForRequestTo("/upload", std::chrono::milliseconds(0)));
  EXPECT_TRUE(fs::exists(files / "secret.log"));

  // The session has an upload backend: what its own user may read goes.
  std::ofstream(files / "mine.log") << "mine";
  EXPECT_EQ(client->uploadFile(Value("file://" + (files / "mine.log").string()), Value(), 10s)["success"], Value(true));
  EXPECT_TRUE(uploads.waitForRequestTo("/upload"));
}

enum class Server { Holds, Fails, Refuses, NoBodyFile };
struct Row {
  const char* name;
  Server server;
  const char* logged;  // every such upload leaves this line
};

class UploadsAgainstBadServers : public UploadsTest, public ::testing::WithParamInterface<Row> {};

// 12 uploads of one user (2 may post at once, 8 may wait, 2 are refused at
// once) while the server misbehaves; another client is served meanwhile.
TEST_P(UploadsAgainstBadServers, EveryUploadEndsInTimeAndAnotherClientIsServed) {
  const Row row = GetParam();
  RefusingPort refusing;
  uploads.on("/upload", Reply{.status = 500, .body = "no room"});
  startWithUploadTimeout(row.server == Server::Refuses ? refusing.url("/upload") : uploads.url("/upload"));
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
    // Posted is a yes, whatever the server answered (500 "no room") or when
    // it could not be reached; a body that was never sent is a no.
    ASSERT_EQ(upload(*first)["success"], Value(row.server != Server::NoBodyFile));
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
            << ", RSS KiB " << idle.rssKiB << "/" << peak.rssKiB << "/" << after.rssKiB
            << " (idle/during/after); back in " << ms(Clock::now() - closed) << " ms\n";
}

INSTANTIATE_TEST_SUITE_P(Servers, UploadsAgainstBadServers,
                         ::testing::Values(Row{"Holds", Server::Holds, "no answer within the time limit of 3000 ms"},
                                           Row{"Fails", Server::Fails, "Json output: no room"},
                                           Row{"Refuses", Server::Refuses, "UploadBackend(uploadFileAtPath): post "},
                                           Row{"NoBodyFile", Server::NoBodyFile, "the body file cannot be written"}),
                         [](const auto& info) { return std::string(info.param.name); });

// An http:// address is posted over TLS (the test server speaks nothing
// else: a request in clear would never be recorded), and a name with a line
// feed is written escaped on one log line.
TEST_F(UploadsTest, PlainHttpIsUpgradedAndALineFeedIsEscaped) {
  uploads.on("/upload", Reply{.body = "upload success"});
  startWithUploadTimeout("http://127.0.0.1:" + std::to_string(uploads.port()) + "/upload");
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
  EXPECT_TRUE(daemon->waitForExact(
      log::Level::Debug, "uploadFileWithURL: File upload successful for " + (files / "a").string() + "\\nforged.log"));
  // No line of the log begins with the name's second half.
  EXPECT_EQ(daemon->output().find("\nforged.log"), std::string::npos) << daemon->output();
}

}  // namespace
}  // namespace zerith::test
