#include "tools/zerith/ZerithSessions.h"

#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "platform/Json.h"
#include "tools/zerith/ZerithCli.h"
#include "zerith/Zerith.h"
#include "zerith/ZerithConstants.h"

namespace zerith::cli {

namespace {

// A script line that cannot run as written.
struct ScriptError {
  std::string what;
};

class SessionsRunner {
 public:
  SessionsRunner(std::ostream& out, std::filesystem::path socket, std::chrono::milliseconds timeout)
      : out_(out), socket_(std::move(socket)), timeout_(timeout) {}

  ~SessionsRunner() {
    // Connections close before the output they print into goes.
    std::map<std::string, Session> sessions;
    {
      std::lock_guard lock(outMutex_);
      sessions.swap(sessions_);
    }
    sessions.clear();
  }

  // Runs one line; the exit status when the script must end, else nullopt.
  std::optional<int> line(const Value& command) {
    if (!command.isDict()) {
      throw ScriptError{"a line must be a JSON dictionary"};
    }
    const std::string step = text(command, "step");
    if (step == "wait") {
      const Value ms = command["ms"];
      if (!ms.isNumber() || ms.intValue() < 0) {
        throw ScriptError{"wait needs \"ms\", a number of milliseconds"};
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(ms.intValue()));
      print(Value(Dictionary{{"step", "wait"}}));
      return std::nullopt;
    }
    const std::string name = text(command, "session");
    if (step == "open") {
      return open(name, command);
    }
    auto it = sessions_.find(name);
    if (it == sessions_.end()) {
      throw ScriptError{"no open session \"" + name + "\""};
    }
    Session& s = it->second;
    if (step == "close") {
      {
        std::lock_guard lock(outMutex_);
        sessions_.erase(it);
      }
      print(Value(Dictionary{{"session", name}, {"step", "close"}}));
      return std::nullopt;
    }
    return report(name, step, call(s, step, command));
  }

 private:
  struct Session {
    std::unique_ptr<Zerith> client;
    Value sessionInfo;
    Value userInfo;
  };

  static std::string text(const Value& command, const char* key) {
    const Value v = command[key];
    const auto* s = v.string();
    if (!s || s->empty()) {
      throw ScriptError{std::string("\"") + key + "\" must be a non-empty string"};
    }
    return *s;
  }

  static Value dictionaryOrNil(const Value& command, const char* key) {
    const Value v = command[key];
    if (!v.isNil() && !v.isDict()) {
      throw ScriptError{std::string("\"") + key + "\" must be a JSON dictionary"};
    }
    return v;
  }

  static unsigned number16(const Value& command, const char* key) {
    const Value v = command[key];
    if (!v.isNumber() || v.doubleValue() != static_cast<double>(v.intValue()) || v.intValue() < 0 ||
        v.intValue() > 65535) {
      throw ScriptError{std::string("\"") + key + "\" must be a number from 0 to 65535"};
    }
    return static_cast<unsigned>(v.intValue());
  }

  std::optional<int> open(const std::string& name, const Value& command) {
    if (sessions_.count(name) != 0) {
      throw ScriptError{"session \"" + name + "\" is open already"};
    }
    Dictionary info;
    for (const char* key : {"clientType", "sessionID"}) {
      const Value v = command[key];
      if (!v.isNumber() || v.intValue() < 0 || v.intValue() > 0xffffffffll) {
        throw ScriptError{std::string("open needs \"") + key + "\", an unsigned 32-bit number"};
      }
    }
    info.set(kZerithSessionInfoSessionID, Value(static_cast<unsigned long long>(command["sessionID"].intValue())));
    info.set(kZerithSessionInfoClientType, Value(static_cast<unsigned long long>(command["clientType"].intValue())));
    if (command["requireUserInfo"].boolValue()) {
      info.set(kZerithSessionInfoRequireUserInfo, true);
    }
    if (const Value token = command["hierarchyToken"]; !token.isNil()) {
      if (!token.string()) {
        throw ScriptError{"\"hierarchyToken\" must be a string"};
      }
      const Value level = command["hierarchyLevel"];
      if (!level.isNil() && !level.isNumber()) {
        throw ScriptError{"\"hierarchyLevel\" must be a number"};
      }
      info.set(kZerithSessionInfoHierarchyToken,
               Dictionary{{kZerithHierarchyTokenTokenID, token},
                          {kZerithHierarchyTokenLevel, Value(static_cast<long long>(level.intValue()))}});
    }
    if (const Value extra = dictionaryOrNil(command, "sessionInfo"); const auto* entries = extra.dict()) {
      for (const auto& [key, value] : *entries) {
        info.set(key, value);
      }
    }
    Session s;
    s.sessionInfo = Value(std::move(info));
    s.userInfo = dictionaryOrNil(command, "userInfo");
    const bool aggregation = command["aggregation"].boolValue();
    const bool setInfo = command["setInfo"].isNil() || command["setInfo"].boolValue();

    Error error;
    s.client = Zerith::connect(socket_, &error);
    if (!s.client) {
      print(Value(Dictionary{{"session", name}, {"step", "open"}, {"failure", error.description}}));
      return kExitUnreachable;
    }
    s.client->setMessageHandler([this, name](const Value& m, double t, std::uint16_t c, std::uint16_t ty,
                                             const Value& p) {
      print(Value(Dictionary{{"session", name}, {"event", "message"}, {"message", m}, {"timestamp", t},
                             {"category", unsigned{c}}, {"type", unsigned{ty}}, {"payload", p}}));
    });
    Zerith& client = *s.client;
    const Value sessionInfo = s.sessionInfo;
    const Value userInfo = s.userInfo;
    {
      std::lock_guard lock(outMutex_);
      sessions_.emplace(name, std::move(s));
    }
    if (!setInfo) {
      print(Value(Dictionary{{"session", name}, {"step", "open"}}));
      return std::nullopt;
    }
    return report(name, "open", client.setSessionInfo(sessionInfo, userInfo, Value(), aggregation, timeout_));
  }

  ZerithReply call(Session& s, const std::string& step, const Value& command) {
    Zerith& c = *s.client;
    if (step == "start") {
      return c.startConfig(timeout_);
    }
    if (step == "states") {
      const Value user = command["userInfo"].isNil() ? s.userInfo : dictionaryOrNil(command, "userInfo");
      return c.fetchStates(user, timeout_);
    }
    if (step == "display-url") {
      return c.fetchDisplayURL(timeout_);
    }
    if (step == "send" || step == "one-shot") {
      const unsigned category = number16(command, "category");
      const unsigned type = number16(command, "type");
      const Value payload = dictionaryOrNil(command, "payload");
      if (step == "one-shot") {
        return c.sendMessageWithSessionInfo(s.sessionInfo, s.userInfo, static_cast<std::uint16_t>(category),
                                            static_cast<std::uint16_t>(type), payload, timeout_);
      }
      Dictionary m{{kZerithMessageParametersCategory, Value(category)}, {kZerithMessageParametersType, Value(type)}};
      if (!payload.isNil()) {
        m.set(kZerithMessageParametersPayload, payload);
      }
      return c.sendMessage(Value(std::move(m)), timeout_);
    }
    if (step == "flush") {
      return c.flushMessages(timeout_);
    }
    if (step == "shared-data") {
      const Value d = dictionaryOrNil(command, "dictionary");
      if (d.isNil()) {
        throw ScriptError{"shared-data needs \"dictionary\""};
      }
      return c.updateSharedData(d, timeout_);
    }
    if (step == "shared-key") {
      // A missing or null "value" removes the key.
      return c.updateSharedDataForKey(Value(text(command, "key")), command["value"], timeout_);
    }
    if (step == "finish") {
      return c.finishSession(timeout_);
    }
    throw ScriptError{"unknown step \"" + step + "\""};
  }

  std::optional<int> report(const std::string& name, const std::string& step, const ZerithReply& reply) {
    Dictionary line{{"session", name}, {"step", step}};
    if (reply.error) {
      line.set("failure", reply.error->description);
      print(Value(std::move(line)));
      return kExitStepFailed;
    }
    for (const auto& [key, value] : reply.arguments) {
      line.set(key, value);
    }
    print(Value(std::move(line)));
    // A flush that answers an error ends the script, as in `zerith session`.
    return reply["error"].isNil() ? std::nullopt : std::optional<int>(kExitStepFailed);
  }

  void print(const Value& line) {
    std::lock_guard lock(printMutex_);
    out_ << json::serialize(line) << '\n' << std::flush;
  }

  std::ostream& out_;
  const std::filesystem::path socket_;
  const std::chrono::milliseconds timeout_;
  std::mutex outMutex_;
  std::mutex printMutex_;
  std::map<std::string, Session> sessions_;
};

}  // namespace

int runSessions(std::istream& script, const std::filesystem::path& socket, std::chrono::milliseconds timeout,
                std::ostream& out, std::ostream& err) {
  SessionsRunner runner(out, socket, timeout);
  std::string text;
  for (std::size_t number = 1; std::getline(script, text); ++number) {
    const auto first = text.find_first_not_of(" \t\r");
    if (first == std::string::npos || text[first] == '#') {
      continue;
    }
    std::string why;
    const auto parsed = json::parseValue(text, &why);
    if (!parsed) {
      err << "zerith: line " << number << " " << why << ": " << text << '\n';
      return kExitUsage;
    }
    try {
      if (const auto status = runner.line(*parsed)) {
        err << "zerith: line " << number << " failed\n";
        return *status;
      }
    } catch (const ScriptError& e) {
      err << "zerith: line " << number << ": " << e.what << '\n';
      return kExitUsage;
    }
  }
  return 0;
}

}  // namespace zerith::cli
