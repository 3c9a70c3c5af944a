#pragma once

// Scenario helpers shared by the agent's and the session's tests: one agent
// in a temporary root with a storebag cache whose fetch the test controls,
// and sessions made the way the agent makes them, on fake connections.

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "daemon/KeepAliveTransaction.h"
#include "daemon/StorebagCache.h"
#include "daemon/ZerithdAgent.h"
#include "platform/Log.h"
#include "session/ZerithdSession.h"
#include "session/tests/FakeConnection.h"
#include "tests/support/Command.h"
#include "tests/support/TempRoot.h"
#include "zerith/ZerithConstants.h"

namespace zerith {
// Readable values in test failures.
inline void PrintTo(const Value& v, std::ostream* os) { *os << v.description(); }
inline void PrintTo(const Dictionary& d, std::ostream* os) { *os << Value(d).description(); }
}  // namespace zerith

namespace zerith::test {

class AgentFixture : public ::testing::Test {
 protected:
  AgentFixture() {
    // A device identifier for the sessions.
    root.write("/etc/machine-id", "0123456789abcdef0123456789abcdef\n");
    agent = ZerithdAgent::create(
        transaction, std::make_unique<StorebagCache>(
                         [] { return Date::now(); },
                         [this](std::int32_t clientType, std::int32_t& maxAge, Value& version, bool& /*unchanged*/) {
                           fetchedClientTypes.push_back(clientType);
                           maxAge = 3600;
                           version = storebagVersion;
                           return storebag;
                         },
                         [](const std::string&) { return std::optional<Date>(); }));
  }

  static Value sessionInfo(std::uint32_t sessionID, std::int64_t clientType = 7) {
    return Value(Dictionary{{kZerithSessionInfoSessionID, Value(sessionID)},
                            {kZerithSessionInfoClientType, Value(static_cast<long long>(clientType))}});
  }
  static Value hierarchyInfo(std::uint32_t sessionID, const std::string& token, std::int64_t level,
                             std::int64_t clientType = 7) {
    Dictionary info = sessionInfo(sessionID, clientType).dictCopy();
    info.set(kZerithSessionInfoHierarchyToken,
             Value(Dictionary{{kZerithHierarchyTokenTokenID, Value(token)},
                              {kZerithHierarchyTokenLevel, Value(static_cast<long long>(level))}}));
    return Value(std::move(info));
  }

  static Value user(const std::string& client, const std::string& service = "sync") {
    return Value(Dictionary{{kZerithUserInfoClientName, Value(client)}, {kZerithUserInfoServiceName, Value(service)}});
  }

  // What a completion taking one value answered before `call` returned.
  template <typename Call>
  static std::optional<Value> answer(Call call) {
    std::optional<Value> reply;
    call([&](Value v) { reply = std::move(v); });
    return reply;
  }

  static Value event(unsigned category, unsigned type, const Value& payload = Value(), const Value& flag = Value()) {
    Dictionary d{{kZerithMessageParametersCategory, Value(category)}, {kZerithMessageParametersType, Value(type)}};
    if (!payload.isNil()) {
      d.set(kZerithMessageParametersPayload, payload);
    }
    if (!flag.isNil()) {
      d.set(kZerithMessageParametersFlag, flag);
    }
    return Value(std::move(d));
  }

  // Every answer a flush gave before it returned.
  using FlushAnswer = std::pair<Value, std::optional<Error>>;
  static std::vector<FlushAnswer> flush(ZerithdSession& session) {
    std::vector<FlushAnswer> answers;
    session.flushMessagesWithCompletion([&](Value v, std::optional<Error> e) { answers.emplace_back(v, e); });
    return answers;
  }

  struct Client {
    std::shared_ptr<FakeConnection> connection;
    std::shared_ptr<ZerithdSession> session;
  };

  // The reply to one message; a call that does not reply at once fails the test.
  static Value send(const Client& c, const Value& message) {
    const auto reply = answer([&](auto done) { c.session->sendMessageWithDictionary(message, done); });
    EXPECT_TRUE(reply.has_value());
    return reply.value_or(Value());
  }

  // A listed session on its own connection, configured with `info`.
  Client newSession(const Value& info = Value(), bool aggregator = false, const Value& userInfo = Value()) {
    Client c{FakeConnection::entitled(), nullptr};
    c.session = agent->createReportingSessionWithDelegate(agent, c.connection);
    EXPECT_NE(c.session, nullptr);
    if (c.session && !info.isNil()) {
      c.session->setSessionInfo(info, userInfo, Value(), aggregator);
    }
    return c;
  }

  // A configured session on the current storebag.
  Client started(const Value& info, bool aggregator = false, const Value& userInfo = Value()) {
    auto c = newSession(info, aggregator, userInfo);
    c.session->startConfigWithCompletionHandler(nullptr);
    return c;
  }

  // Unlists a session, lets it go and waits for `line`: by default the end
  // of the only session, whose transport, closed last, has released the
  // keep-alive count.
  void endSession(Client& c, const std::string& line = "releaseVeskTransaction: Vesk transaction ended") {
    agent->invalidateReportingSession(c.session);
    c.session.reset();
    ASSERT_TRUE(logs.waitFor(line));
  }

  // Messages the daemon sent to a client's aggregator.
  static std::vector<Dictionary> aggregated(const FakeConnection& connection) {
    std::vector<Dictionary> out;
    for (const auto& s : connection.sent()) {
      if (s.operation == "sendMessageToClient:timestamp:category:type:payload:") {
        out.push_back(s.args);
      }
    }
    return out;
  }

  std::size_t countExact(log::Level level, std::string_view text) const {
    std::size_t n = 0;
    for (const auto& line : logs.lines()) {
      n += (line.level == level && line.text == text) ? 1 : 0;
    }
    return n;
  }

  // Every retired message-log file under the root, one after the other.
  std::string messageLog() const {
    std::string text;
    std::error_code missing;
    for (const auto& entry : std::filesystem::directory_iterator(root / "/var/log/faultkeep/retired", missing)) {
      text += readText(entry.path());
    }
    return text;
  }

  TempRoot root;
  log::LogCapture logs;
  std::shared_ptr<KeepAliveTransaction> transaction = std::make_shared<KeepAliveTransaction>();
  Value storebag;
  Value storebagVersion;
  std::vector<std::int32_t> fetchedClientTypes;
  std::shared_ptr<ZerithdAgent> agent;
};

}  // namespace zerith::test
