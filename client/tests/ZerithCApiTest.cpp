#include "zerith/zerith.h"

#include <gtest/gtest.h>

#include <future>
#include <string>

#include "client/tests/TestDaemon.h"
#include "zerith/Zerith.h"

namespace zerith::test {
namespace {

// What one C callback received.
struct CallbackResult {
  std::optional<std::string> reply;
  std::optional<std::string> error;
};

struct Catcher : ipc::test::Answer<CallbackResult> {
  static void callback(void* context, const char* reply, const char* error) {
    static_cast<Catcher*>(context)->set(CallbackResult{reply ? std::optional<std::string>(reply) : std::nullopt,
                                                       error ? std::optional<std::string>(error) : std::nullopt});
  }
};

struct SessionDeleter {
  void operator()(zerith_session* s) const { zerith_destroy(s); }
};
using SessionPtr = std::unique_ptr<zerith_session, SessionDeleter>;

// A call the library refused with `why` as its last error.
void expectRefused(int rc, const std::string& why) {
  EXPECT_EQ(rc, -1);
  EXPECT_STREQ(zerith_last_error(), why.c_str());
}

struct CApiFixture : DaemonFixture {
  SessionPtr open(zerith_format format = ZERITH_FORMAT_JSON) {
    SessionPtr s(zerith_create(format));
    EXPECT_EQ(zerith_connect(s.get(), nullptr), 0) << zerith_last_error();
    return s;
  }
};

TEST_F(CApiFixture, EveryOperationTakesJsonAndAnswersThroughItsCallbackAndMessagesArriveAsText) {
  auto s = open();
  ipc::test::Answer<std::string> got;
  zerith_set_message_callback(
      s.get(),
      [](void* context, const char* message, double timestamp, uint16_t category, uint16_t type, const char* payload) {
        static_cast<ipc::test::Answer<std::string>*>(context)->set(std::string(message ? message : "NULL") + " " +
                                                      std::to_string(timestamp) + " " + std::to_string(category) + " " +
                                                      std::to_string(type) + " " + (payload ? payload : "NULL"));
      },
      &got);
  ASSERT_EQ(zerith_set_session_info(s.get(), R"({"sessionID": 1, "clientType": 7})", nullptr, R"(["A"])", 1), 0);
  Catcher started, sent, states, url, flush, upload, uploadLog, oneShot;
  ASSERT_EQ(zerith_start_config(s.get(), &Catcher::callback, &started), 0);
  ASSERT_EQ(zerith_send_message(s.get(), R"({"category": 3, "type": 4, "payload": {"k": [1, 2.5, "x"]}})",
                                &Catcher::callback, &sent), 0);
  ASSERT_EQ(zerith_fetch_states(s.get(), R"({"clientName": "mail"})", &Catcher::callback, &states), 0);
  ASSERT_EQ(zerith_fetch_display_url(s.get(), &Catcher::callback, &url), 0);
  ASSERT_EQ(zerith_flush_messages(s.get(), &Catcher::callback, &flush), 0);
  ASSERT_EQ(zerith_upload_file(s.get(), "file:///dev/null", nullptr, &Catcher::callback, &upload), 0);
  ASSERT_EQ(zerith_upload_log_data(s.get(), R"(["l1"])", &Catcher::callback, &uploadLog), 0);
  ASSERT_EQ(zerith_send_message_with_session_info(s.get(), "{}", nullptr, 65535, 0, R"({"p": true})", &Catcher::callback,
                                                  &oneShot), 0);
  ASSERT_EQ(zerith_update_shared_data(s.get(), R"({"s": 1})"), 0);
  ASSERT_EQ(zerith_update_shared_data_for_key(s.get(), "k", nullptr), 0);
  const unsigned char key[] = {0, 1, 255};
  ASSERT_EQ(zerith_set_digest_key(s.get(), key, sizeof(key), 2), 0);
  ASSERT_EQ(zerith_finish_session(s.get()), 0);

  EXPECT_EQ(started.get().reply, R"({"backends":["httpsPost","dashboard"]})");
  EXPECT_EQ(sent.get().reply, R"({"result":"sent"})");
  EXPECT_EQ(states.get().reply, R"({"backends":["httpsPost","dashboard"]})");
  EXPECT_EQ(url.get().reply, R"({"url":"https://display.example/session"})");
  EXPECT_EQ(flush.get().reply, R"({"result":"flushed"})");
  EXPECT_EQ(upload.get().reply, R"({"success":true,"removeFile":false})");
  EXPECT_EQ(uploadLog.get().reply, R"({"success":false,"error":{"domain":"com.velmar.zerith.ErrorDomain","code":-1,)"
                                   R"("description":"no upload backend"}})");
  EXPECT_EQ(oneShot.get().reply, R"({"result":"one-shot"})");

  const auto client = daemon->waitForClient();
  client.toClient->sendMessageToClient(Value(), 1.5, 7, 8, Value(Dictionary{{"x", 1}}));
  EXPECT_EQ(got.get(), R"(NULL 1.500000 7 8 {"x":1})");
  const auto& session = client.session;
  ASSERT_TRUE(session->log.waitFor(13));
  const auto calls = session->log.calls();
  EXPECT_EQ(Value(calls[0].args), Value(Dictionary{{"sessionInfo", Dictionary{{"sessionID", 1}, {"clientType", 7}}},
                                                   {"userInfo", Value()},
                                                   {"frameworksToCheck", Array{Value("A")}},
                                                   {"hasAggregationBlock", true}}));
  EXPECT_EQ(calls[2].args.get("message"),
            Value(Dictionary{{"category", 3}, {"type", 4}, {"payload", Dictionary{{"k", Array{Value(1), Value(2.5), Value("x")}}}}}));
  EXPECT_EQ(calls[8].args.get("category"), Value(65535u));
  EXPECT_EQ(Value(calls[10].args), Value(Dictionary{{"key", "k"}, {"value", Value()}}));
  EXPECT_EQ(calls[11].args.get("digestKey"), Value(Data{0, 1, 255}));
  EXPECT_EQ(calls[12].operation, "finishSession");
}

TEST_F(CApiFixture, XmlPropertyListsInAndOut) {
  auto s = open(ZERITH_FORMAT_PLIST_XML);
  ASSERT_EQ(zerith_set_session_info(s.get(),
                                    "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>sessionID</key>"
                                    "<integer>9</integer></dict></plist>",
                                    nullptr, nullptr, 0),
            0);
  Catcher url;
  ASSERT_EQ(zerith_fetch_display_url(s.get(), &Catcher::callback, &url), 0);
  const auto reply = url.get().reply;
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply, plist::encodeXml(Value(Dictionary{{"url", "https://display.example/session"}})));
  EXPECT_EQ(daemon->waitForClient().session->log.calls()[0].args.get("sessionInfo"), Value(Dictionary{{"sessionID", 9}}));
}

TEST_F(CApiFixture, BadTextIsRefusedLocallyAndNothingIsSent) {
  auto s = open();
  expectRefused(zerith_set_session_info(s.get(), "{not json", nullptr, nullptr, 0), "session info is not valid JSON");
  expectRefused(zerith_send_message(s.get(), "[1, 2]", nullptr, nullptr), "message is not a dictionary");
  expectRefused(zerith_upload_log_data(s.get(), "{}", nullptr, nullptr), "log data is not an array");
  expectRefused(zerith_upload_file(s.get(), nullptr, nullptr, nullptr, nullptr), "a file URL is required");
  auto xml = open(ZERITH_FORMAT_PLIST_XML);
  EXPECT_EQ(zerith_update_shared_data(xml.get(), "<plist><dict><key>a</key>"), -1);
  EXPECT_EQ(std::string(zerith_last_error()).rfind("dictionary is not an XML property list: ", 0), 0u) << zerith_last_error();
  // The daemon saw nothing but the end of the calls below.
  ASSERT_EQ(zerith_finish_session(s.get()), 0);
  auto session = daemon->waitForClient().session;
  ASSERT_TRUE(session->log.waitFor(1));
  EXPECT_EQ(session->log.calls()[0].operation, "finishSession");
}

TEST_F(CApiFixture, FailedCallReportsTheErrorAndInvalidationCallbackRuns) {
  daemon->prepare = [](ipc::test::RecordingSession& s) { s.answer = false; };
  auto s = open();
  std::promise<void> invalidated;
  zerith_set_invalidation_callback(
      s.get(), [](void* context) { static_cast<std::promise<void>*>(context)->set_value(); }, &invalidated);
  Catcher url;
  ASSERT_EQ(zerith_fetch_display_url(s.get(), &Catcher::callback, &url), 0);
  auto client = daemon->waitForClient();
  ASSERT_TRUE(client.session->log.waitFor(1));
  client.connection->invalidate();
  const auto result = url.get();
  EXPECT_FALSE(result.reply);
  EXPECT_EQ(result.error, "The connection was invalidated");
  EXPECT_EQ(invalidated.get_future().wait_for(ipc::test::kWait), std::future_status::ready);
}

TEST(CApi, UnconnectedOrUnreachableSessionsSayWhy) {
  TempRoot root;
  SessionPtr s(zerith_create(ZERITH_FORMAT_JSON));
  expectRefused(zerith_fetch_display_url(s.get(), nullptr, nullptr), "the session is not connected");
  expectRefused(zerith_connect(s.get(), "/nonexistent-zerith/sock"),
                "Cannot connect to /nonexistent-zerith/sock: No such file or directory");
  EXPECT_EQ(zerith_finish_session(nullptr), -1);
  EXPECT_EQ(zerith_create(static_cast<zerith_format>(7)), nullptr);
}

TEST(CApi, FrameworkFactsMatchTheCppApi) {
  TempRoot root;
  char* id = zerith_persistent_identifier_for_dnu(1);
  EXPECT_EQ(std::string(id), Zerith::getPersistentIdentifierForDNU(true));
  zerith_free(id);
  char* version = zerith_framework_version();
  EXPECT_STREQ(version, "8.0");
  zerith_free(version);
  char* key = zerith_public_key_path();
  EXPECT_EQ(std::string(key), (root / "/usr/share/zerith/publicKey.der").string());
  zerith_free(key);
  root.write("/usr/share/zerith/Info.plist",
             "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>BundleVersion</key><string>9.4.1</string></dict></plist>");
  EXPECT_EQ(Zerith::frameworkVersion(), "9.4.1");
}

}  // namespace
}  // namespace zerith::test
