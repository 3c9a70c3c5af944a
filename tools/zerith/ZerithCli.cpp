#include "tools/zerith/ZerithCli.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <charconv>
#include <fstream>
#include <iostream>

#include <CLI/CLI.hpp>

#include <algorithm>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "config/ClientTypes.h"
#include "ipc/EntitlementPolicy.h"
#include "platform/Crypto.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/Spelling.h"
#include "tools/zerith/ZerithSessions.h"
#include "tools/zerith/ZerithSpool.h"
#include "tools/zerith/ZerithStatus.h"
#include "zerith/Zerith.h"

namespace zerith::cli {

namespace {

constexpr const char* kStepsHelp = R"(Steps run in the order given, on one connection (the session lives as long as it):
  set-info               setSessionInfo from the session options; runs first by
                         itself when no step names it and a step needs it
  start                  startConfig                 -> {"step":"start","backends":[...]}
  states[=USERINFO]      fetchStates with USERINFO (JSON) or --user-info
  display-url            fetchDisplayURL             -> {"step":"display-url","url":"..."}
  send[=MESSAGE]         sendMessageWithDictionary; MESSAGE is a JSON dictionary
                         {"category":C,"type":T,"payload":{...}}, default built from
                         --category/--type/--payload (category and type are
                         numbers from 0 to 65535)  -> {"step":"send","result":...}
  flush                  flushMessages               -> {"step":"flush","result":...,"error":...}
  one-shot[=MESSAGE]     sendMessageWithSessionInfo with the session options and
                         MESSAGE's category, type and payload
  upload-file=PATH       uploadFileAtPath: PATH is opened with this process's rights
                         and its descriptor passed; deleted here on the daemon's word
                         -> {"step":"upload-file","success":...,"removeFile":...}
  upload-log=ARRAY       uploadLogData with a JSON array
  shared-data=DICT       updateSharedDataWithDictionary with a JSON dictionary
  shared-key=KEY=VALUE   updateSharedDataForKey; VALUE is JSON, null removes the key
  digest-key=BASE64[:N]  setDigestKey with the key bytes and algorithm N (default 0)
  wait=MS                wait MS milliseconds (the daemon's messages print meanwhile)
  finish                 finishSessionGracefully
Messages the daemon sends print as {"event":"message",...} lines whenever they arrive.
A step that fails prints {"step":...,"failure":...} and ends the script: a start
without a storebag, a flush that answers an error, an upload that answers
success false, a call the daemon does not answer in time.

Example:
  zerith session --client-type 7 --session-id 1 \
      --step set-info --step start --step display-url \
      --category 1 --type 2 --payload '{"k":"v"}' --step send --step flush --step finish)";

struct Step {
  std::string name;
  std::optional<std::string> argument;
};

struct SessionOptions {
  std::uint32_t clientType = 0;
  std::uint32_t sessionID = 0;
  std::optional<std::string> userInfo;
  std::optional<std::string> sessionInfo;
  std::optional<std::string> frameworks;
  bool requireUserInfo = false;
  bool aggregation = false;
  bool batchEvent = false;
  std::optional<std::int64_t> clientVersion;
  std::optional<std::string> hierarchyToken;
  std::uint32_t hierarchyLevel = 0;
  std::uint32_t category = 0;
  std::uint32_t type = 0;
  std::string payload = "{}";
  std::vector<std::string> steps;
};

const std::vector<std::string> kStepNames = {"set-info",   "start",       "states",     "display-url", "send",
                                             "flush",      "one-shot",    "upload-file", "upload-log",  "shared-data",
                                             "shared-key", "digest-key",  "wait",        "finish"};

class Failure : public std::runtime_error {
 public:
  Failure(int code, const std::string& what) : std::runtime_error(what), code(code) {}
  int code;
};

Value parseJson(const std::string& text, const std::string& what) {
  std::string why;
  auto parsed = json::parseValue(text, &why);
  if (!parsed) {
    throw Failure(kExitUsage, what + " " + why + ": " + text);
  }
  return std::move(*parsed);
}

Value parseDictionary(const std::optional<std::string>& text, const std::string& what) {
  if (!text) {
    return Value();
  }
  Value v = parseJson(*text, what);
  if (!v.isDict()) {
    throw Failure(kExitUsage, what + " must be a JSON dictionary");
  }
  return v;
}

class Runner {
 public:
  Runner(std::ostream& out, SessionOptions options, std::chrono::milliseconds timeout)
      : out_(out), o_(std::move(options)), timeout_(timeout) {}

  int run(const std::filesystem::path& socket) {
    std::vector<Step> steps;
    for (const auto& text : o_.steps) {
      const auto eq = text.find('=');
      Step step{text.substr(0, eq), eq == std::string::npos ? std::nullopt : std::optional(text.substr(eq + 1))};
      if (std::find(kStepNames.begin(), kStepNames.end(), step.name) == kStepNames.end()) {
        throw Failure(kExitUsage, "unknown step \"" + step.name + "\" (see zerith session --help)");
      }
      steps.push_back(std::move(step));
    }
    // Without set-info the daemon's session has no session info, so it runs
    // as client type 0 whatever --client-type says: configure it first.
    const auto named = [&](const char* name) {
      return std::any_of(steps.begin(), steps.end(), [&](const Step& s) { return s.name == name; });
    };
    const bool needsInfo = std::any_of(steps.begin(), steps.end(), [](const Step& s) {
      return s.name != "one-shot" && s.name != "wait" && s.name != "finish";
    });
    if (needsInfo && !named("set-info")) {
      steps.insert(steps.begin(), Step{"set-info", std::nullopt});
    }
    sessionInfo_ = buildSessionInfo();
    checkClientType();
    userInfo_ = parseDictionary(o_.userInfo, "--user-info");
    std::vector<Action> actions;
    for (const auto& step : steps) {
      actions.push_back(compile(step));
    }

    Error error;
    session_ = Zerith::connect(socket, &error);
    if (!session_) {
      throw Failure(kExitUnreachable, "the daemon is unreachable: " + error.description);
    }
    session_->setMessageHandler([this](const Value& m, double t, std::uint16_t c, std::uint16_t ty, const Value& p) {
      print(Value(Dictionary{{"event", "message"}, {"message", m}, {"timestamp", t}, {"category", unsigned{c}},
                             {"type", unsigned{ty}}, {"payload", p}}));
    });
    for (std::size_t i = 0; i < steps.size(); ++i) {
      runStep(steps[i].name, actions[i]);
    }
    session_.reset();
    return 0;
  }

 private:
  Value buildSessionInfo() {
    Dictionary info{{kZerithSessionInfoSessionID, Value(unsigned{o_.sessionID})},
                    {kZerithSessionInfoClientType, Value(unsigned{o_.clientType})}};
    if (o_.requireUserInfo) {
      info.set(kZerithSessionInfoRequireUserInfo, true);
    }
    if (o_.batchEvent) {
      info.set(kZerithSessionInfoBatchEvent, true);
    }
    if (o_.clientVersion) {
      info.set(kZerithSessionInfoClientVersion, Value(static_cast<long long>(*o_.clientVersion)));
    }
    if (o_.hierarchyToken) {
      info.set(kZerithSessionInfoHierarchyToken,
               Dictionary{{kZerithHierarchyTokenTokenID, *o_.hierarchyToken},
                          {kZerithHierarchyTokenLevel, Value(unsigned{o_.hierarchyLevel})}});
    }
    // --session-info entries win over the ones built from options. The
    // parsed value must outlive the loop over its dictionary.
    const Value extra = parseDictionary(o_.sessionInfo, "--session-info");
    if (const auto* entries = extra.dict()) {
      for (const auto& [key, value] : *entries) {
        info.set(key, value);
      }
    }
    return Value(std::move(info));
  }

  // The message of a send or one-shot step: the step's JSON dictionary or
  // the one built from --category/--type/--payload. The daemon only checks
  // that category and type are present; a text there would go out as 0.
  // The daemon logs a client type without a storebag as invalid and goes on
  // without backends; say so here, before a session is opened.
  void checkClientType() {
    const Value type = sessionInfo_[kZerithSessionInfoClientType];
    if (type.isNumber() && type.intValue() >= 0 && type.doubleValue() == static_cast<double>(type.intValue()) &&
        type.intValue() <= std::numeric_limits<ZerithClientType>::max() &&
        storebagNameForClientType(static_cast<ZerithClientType>(type.intValue()))) {
      return;
    }
    std::optional<ZerithClientType> first, last;
    for (ZerithClientType t = 0; t < 256; ++t) {
      if (storebagNameForClientType(t)) {
        first = first.value_or(t);
        last = t;
      }
    }
    throw Failure(kExitUsage, "client type " + json::serialize(type) + " has no storebag (client types " +
                                  std::to_string(first.value_or(0)) + " to " + std::to_string(last.value_or(0)) +
                                  " have one)");
  }

  Value message(const Step& step) {
    const Value m = step.argument
                        ? parseDictionary(step.argument, step.name + " message")
                        : Value(Dictionary{{kZerithMessageParametersCategory, Value(unsigned{o_.category})},
                                           {kZerithMessageParametersType, Value(unsigned{o_.type})},
                                           {kZerithMessageParametersPayload, parseDictionary(o_.payload, "--payload")}});
    for (const char* key : {kZerithMessageParametersCategory, kZerithMessageParametersType}) {
      const Value v = m[key];
      if (!v.isNumber() || v.doubleValue() != static_cast<double>(v.intValue()) || v.intValue() < 0 ||
          v.intValue() > 65535) {
        throw Failure(kExitUsage, step.name + " message: \"" + key + "\" must be a number from 0 to 65535, not " +
                                      (v.isNil() ? std::string("missing") : json::serialize(v)));
      }
    }
    const Value payload = m[kZerithMessageParametersPayload];
    if (!payload.isNil() && !payload.isDict()) {
      throw Failure(kExitUsage, step.name + " message: \"" + kZerithMessageParametersPayload +
                                    "\" must be a JSON dictionary");
    }
    return m;
  }

  const std::string& need(const Step& step) {
    if (!step.argument) {
      throw Failure(kExitUsage, "step " + step.name + " needs an argument (" + step.name + "=...)");
    }
    return *step.argument;
  }

  using Action = std::function<ZerithReply()>;

  // Turns a step into the call it makes; every argument is checked here,
  // before the session is opened.
  Action compile(const Step& step) {
    const auto& n = step.name;
    if (n == "set-info") {
      Value frameworks = o_.frameworks ? parseJson(*o_.frameworks, "--frameworks") : Value();
      if (!frameworks.isNil() && !frameworks.isArray()) {
        throw Failure(kExitUsage, "--frameworks must be a JSON array");
      }
      return [this, frameworks] {
        return session_->setSessionInfo(sessionInfo_, userInfo_, frameworks, o_.aggregation, timeout_);
      };
    }
    if (n == "start") {
      return [this] { return session_->startConfig(timeout_); };
    }
    if (n == "states") {
      const Value user = step.argument ? parseDictionary(step.argument, "states user info") : userInfo_;
      return [this, user] { return session_->fetchStates(user, timeout_); };
    }
    if (n == "display-url") {
      return [this] { return session_->fetchDisplayURL(timeout_); };
    }
    if (n == "send") {
      const Value m = message(step);
      return [this, m] { return session_->sendMessage(m, timeout_); };
    }
    if (n == "flush") {
      return [this] { return session_->flushMessages(timeout_); };
    }
    if (n == "one-shot") {
      const Value m = message(step);
      const auto category = static_cast<std::uint16_t>(m[kZerithMessageParametersCategory].intValue());
      const auto type = static_cast<std::uint16_t>(m[kZerithMessageParametersType].intValue());
      const Value payload = m[kZerithMessageParametersPayload];
      return [this, category, type, payload] {
        return session_->sendMessageWithSessionInfo(sessionInfo_, userInfo_, category, type, payload, timeout_);
      };
    }
    if (n == "upload-file") {
      const Value file(need(step));
      return [this, file] { return session_->uploadFile(file, Value(), timeout_); };
    }
    if (n == "upload-log") {
      const Value data = parseJson(need(step), "upload-log data");
      if (!data.isArray()) {
        throw Failure(kExitUsage, "upload-log data must be a JSON array");
      }
      return [this, data] { return session_->uploadLogData(data, timeout_); };
    }
    if (n == "shared-data") {
      const Value d = parseDictionary(need(step), "shared-data");
      return [this, d] { return session_->updateSharedData(d, timeout_); };
    }
    if (n == "shared-key") {
      const std::string& arg = need(step);
      const auto eq = arg.find('=');
      if (eq == std::string::npos || eq == 0) {
        throw Failure(kExitUsage, "shared-key needs KEY=VALUE");
      }
      const Value key(arg.substr(0, eq));
      const Value value = parseJson(arg.substr(eq + 1), "shared-key value");
      return [this, key, value] { return session_->updateSharedDataForKey(key, value, timeout_); };
    }
    if (n == "digest-key") {
      const std::string& arg = need(step);
      const auto colon = arg.find(':');
      const auto key = crypto::base64Decode(arg.substr(0, colon));
      if (!key) {
        throw Failure(kExitUsage, "digest-key must be base64");
      }
      std::int32_t algorithm = 0;
      try {
        algorithm = colon == std::string::npos ? 0 : std::stoi(arg.substr(colon + 1));
      } catch (const std::exception&) {
        throw Failure(kExitUsage, "digest-key algorithm must be a number");
      }
      const Value k(*key);
      return [this, k, algorithm] { return session_->setDigestKey(k, algorithm, timeout_); };
    }
    if (n == "wait") {
      long ms = 0;
      try {
        ms = std::stol(need(step));
      } catch (const std::exception&) {
        throw Failure(kExitUsage, "wait needs a number of milliseconds");
      }
      return [ms] {
        std::this_thread::sleep_for(std::chrono::milliseconds(ms));
        return ZerithReply{};
      };
    }
    return [this] { return session_->finishSession(timeout_); };  // "finish"
  }

  void runStep(const std::string& n, const Action& action) {
    const ZerithReply reply = action();
    Dictionary line{{"step", n}};
    if (reply.error) {
      line.set("failure", reply.error->description);
      print(Value(std::move(line)));
      // A connection that ended before anything was answered: the daemon
      // turned the client away.
      if (!session_->isValid() && !answered_) {
        throw Failure(kExitRefused, "the daemon closed the session during " + n +
                                        " (is this user granted com.velmar.private.zerithd?)");
      }
      throw Failure(kExitStepFailed, n + ": " + reply.error->description);
    }
    answered_ = true;
    if (n == "start" && reply["backends"].isNil()) {
      // The daemon answers a start without a storebag with nothing.
      const Value type = sessionInfo_[kZerithSessionInfoClientType];
      const auto name = storebagNameForClientType(static_cast<ZerithClientType>(type.intValue()));
      const std::string why = "the daemon has no storebag \"" + name.value_or("") + "\" for client type " +
                              json::serialize(type) +
                              "; its log says why (no storebag server set, server unreachable, signature refused)";
      line.set("failure", why);
      print(Value(std::move(line)));
      throw Failure(kExitStepFailed, "start: " + why);
    }
    for (const auto& [key, value] : reply.arguments) {
      line.set(key, value);
    }
    print(Value(std::move(line)));
    // Flush and upload answer their failures as arguments.
    const Value error = reply["error"];
    if (!error.isNil() || reply["success"] == Value(false)) {
      const Value description = error["description"];
      throw Failure(kExitStepFailed, n + ": " + (description.string() ? *description.string()
                                                 : error.isNil()          ? std::string("the daemon answered success false")
                                                                          : json::serialize(error)));
    }
  }

  void print(const Value& line) {
    std::lock_guard lock(outMutex_);
    out_ << json::serialize(line) << '\n' << std::flush;
  }

  std::ostream& out_;
  SessionOptions o_;
  std::chrono::milliseconds timeout_;
  Value sessionInfo_;
  Value userInfo_;
  bool answered_ = false;
  std::mutex outMutex_;
  // Last, so that it goes first: its message handler prints through out_ and
  // outMutex_, and a message can still arrive while it is torn down (a step
  // that failed leaves it open).
  std::unique_ptr<Zerith> session_;
};

// " (did you mean --option?)" for a misspelt word, or nothing.
std::string suggestion(const std::string& word, const std::vector<std::string>& known) {
  const std::vector<std::string_view> words(known.begin(), known.end());
  const auto best = nearestSpelling(word, words);
  return best ? " (did you mean " + *best + "?)" : "";
}

// What the policy folder grants a process of `user` (a name or a uid; this
// process's user by default), decided as the daemon decides it from a
// connection's credentials: the user, its primary group and its
// supplementary groups. Files the policy refuses are logged on stderr.
int runEntitlements(const std::optional<std::string>& user, std::ostream& out, std::ostream& err) {
  const std::string who = user.value_or(std::to_string(::geteuid()));
  std::vector<char> buffer(1 << 16);
  passwd entry{};
  passwd* found = nullptr;
  uid_t uid = 0;
  const auto [end, ec] = std::from_chars(who.data(), who.data() + who.size(), uid);
  if (ec == std::errc() && end == who.data() + who.size()) {
    ::getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &found);
  } else {
    ::getpwnam_r(who.c_str(), &entry, buffer.data(), buffer.size(), &found);
  }
  if (!found) {
    err << "zerith: no user " << who << " on this system\n";
    return kExitUsage;
  }
  // getgrouplist says how many groups there are when the room was short;
  // only the ones it wrote count (a zero left over would read as root's group).
  std::vector<gid_t> groups(64);
  int count = static_cast<int>(groups.size());
  while (::getgrouplist(entry.pw_name, entry.pw_gid, groups.data(), &count) < 0) {
    if (count <= static_cast<int>(groups.size()) || count > (1 << 16)) {
      err << "zerith: cannot read the groups of " << entry.pw_name << "\n";
      return kExitUsage;
    }
    groups.resize(static_cast<std::size_t>(count));
  }
  groups.resize(static_cast<std::size_t>(count));
  ipc::PeerCredentials peer{0, entry.pw_uid, entry.pw_gid, groups};
  const Dictionary granted = ipc::EntitlementPolicy().entitlementsFor(peer);
  const Value admits = granted.get(ipc::kZerithdEntitlement);
  out << json::serialize(Value(Dictionary{{"user", std::string(entry.pw_name)},
                                          {"uid", static_cast<unsigned long long>(entry.pw_uid)},
                                          {"admitted", admits.isBool() && admits.boolValue()},
                                          {"entitlements", granted}}))
      << '\n';
  return 0;
}

std::vector<std::string> longNames(const CLI::App& app) {
  std::vector<std::string> names;
  for (const auto* option : app.get_options()) {
    for (const auto& name : option->get_lnames()) {
      names.push_back("--" + name);
    }
  }
  return names;
}

// The first word of the command line that no option or command took.
std::optional<std::string> unexpectedArgument(const CLI::App& app, const CLI::App* chosen) {
  const auto explain = [](const std::string& left, const CLI::App& where, const CLI::App* command,
                          std::vector<std::string> known) {
    const std::string word = left.substr(0, left.find('='));
    if (word.starts_with("-")) {
      return "unknown option " + word + (command ? " for " + command->get_name() : "") + suggestion(word, known);
    }
    if (!command) {
      std::vector<std::string> commands;
      for (const auto* sub : where.get_subcommands([](const CLI::App*) { return true; })) {
        commands.push_back(sub->get_name());
      }
      return "unknown command \"" + word + "\"" + suggestion(word, commands);
    }
    return "unexpected argument \"" + word + "\"";
  };
  if (const auto left = app.remaining(); !left.empty()) {
    return explain(left.front(), app, nullptr, longNames(app));
  }
  if (chosen) {
    if (const auto left = chosen->remaining(); !left.empty()) {
      auto known = longNames(*chosen);
      const auto global = longNames(app);
      known.insert(known.end(), global.begin(), global.end());
      return explain(left.front(), app, chosen, known);
    }
  }
  return std::nullopt;
}

}  // namespace

int run(int argc, const char* const* argv, std::ostream& out, std::ostream& err) {
  CLI::App app{"zerith: talk to the zerithd reporting daemon from the shell.\n"
               "Run `zerith session --help` for scripted sessions."};
  app.name("zerith");
  std::optional<std::string> root;
  std::optional<std::string> socket;
  long timeoutMs = 30000;
  bool debug = false;
  app.add_option("--root", root,
                 "Root folder of the daemon's files (default: ZERITHD_ROOT, / for the superuser, else "
                 "~/.local/share/zerithd/root, as zerithd)");
  app.add_option("--socket", socket, "The daemon's socket (default: <root>/run/zerithd/com.velmar.zerithd)");
  app.add_option("--timeout", timeoutMs, "Milliseconds to wait for each answer (at least 1)")->capture_default_str();
  app.add_flag("--debug", debug, "Log debug lines to standard error");
  // Required options and the subcommand are checked after the parse, so
  // that a misspelt word is reported as such rather than as what is missing.
  app.allow_extras();

  SessionOptions o;
  std::optional<std::uint32_t> clientType;
  std::optional<std::uint32_t> sessionID;
  auto* session = app.add_subcommand("session", "Run one reporting session as a sequence of steps");
  session->allow_extras();
  session->footer(kStepsHelp);
  session->add_option("--client-type", clientType, "Client type (session info clientType; required)");
  session->add_option("--session-id", sessionID, "Session number (session info sessionID; required)");
  session->add_option("--user-info", o.userInfo, "User info, a JSON dictionary");
  session->add_option("--session-info", o.sessionInfo, "Extra session info entries, a JSON dictionary");
  session->add_flag("--require-user-info", o.requireUserInfo, "Session info requireUserInfo = true");
  session->add_flag("--batch-event", o.batchEvent, "Session info batchEvent = true");
  session->add_option("--client-version", o.clientVersion, "Session info clientVersion");
  session->add_option("--hierarchy-token", o.hierarchyToken, "Hierarchy token ID shared by related sessions");
  session->add_option("--hierarchy-level", o.hierarchyLevel, "Level in the hierarchy (0 = root)");
  session->add_option("--frameworks", o.frameworks, "frameworksToCheck, a JSON array");
  session->add_flag("--aggregation", o.aggregation, "Declare an aggregation block");
  session->add_option("--category", o.category, "Category of send/one-shot steps without a MESSAGE")->check(CLI::Range(0, 65535));
  session->add_option("--type", o.type, "Type of send/one-shot steps without a MESSAGE")->check(CLI::Range(0, 65535));
  session->add_option("--payload", o.payload, "Payload of send/one-shot steps without a MESSAGE (JSON dictionary)");
  session->add_option("--step", o.steps, "A step (repeat; see below; at least one)");

  std::optional<std::string> script;
  auto* sessions = app.add_subcommand(
      "sessions", "Run several sessions from JSON lines, one command per line (see tools/zerith/ZerithSessions.h)");
  sessions->allow_extras();
  sessions->add_option("--script", script, "File of JSON lines (default: standard input, run as lines arrive)");

  bool dnu = false;
  auto* identifier = app.add_subcommand("identifier", "Print this device's persistent identifier");
  identifier->allow_extras();
  identifier->add_flag("--dnu", dnu, "The identifier kept for DNU reporting");
  auto* version = app.add_subcommand("version", "Print the framework version and public-key location");
  version->allow_extras();
  bool statusJson = false;
  auto* status = app.add_subcommand(
      "status", "Show what became of the events of live and ended sessions, per backend (needs the entitlement "
                "com.velmar.private.zerithd.status)");
  status->allow_extras();
  status->add_flag("--json", statusJson, "Print the status as one JSON line instead of tables");
  std::optional<std::string> user;
  auto* entitlements = app.add_subcommand(
      "entitlements", "Show what the entitlements policy grants a user's processes and whether the daemon admits them");
  entitlements->allow_extras();
  entitlements->add_option("--user", user, "User name or uid (default: this process's user)");
  bool spoolJson = false;
  auto* spool = app.add_subcommand(
      "spool", "Show the batches waiting in the spool to be posted again, per URL (read from the spool folder)");
  spool->allow_extras();
  spool->add_flag("--json", spoolJson, "Print every batch as one JSON line instead of a table");

  const auto usage = [&](const std::string& what) {
    err << "zerith: " << what << "\nRun with --help for more information.\n";
    return kExitUsage;
  };
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int code = app.exit(e, out, err);
    return code == 0 ? 0 : kExitUsage;
  }
  CLI::App* chosen = nullptr;
  for (auto* sub : {session, sessions, identifier, version, status, entitlements, spool}) {
    if (*sub) {
      chosen = sub;
    }
  }
  if (const auto problem = unexpectedArgument(app, chosen)) {
    return usage(*problem);
  }
  if (!chosen) {
    return usage("a command is required: session, sessions, status, spool, entitlements, identifier or version");
  }
  if (timeoutMs < 1) {
    return usage("--timeout must be at least 1 millisecond, not " + std::to_string(timeoutMs));
  }
  if (chosen == session) {
    for (const auto& [name, given] : {std::pair{"--client-type", clientType.has_value()},
                                      std::pair{"--session-id", sessionID.has_value()},
                                      std::pair{"--step", !o.steps.empty()}}) {
      if (!given) {
        return usage(std::string("session needs ") + name);
      }
    }
    o.clientType = *clientType;
    o.sessionID = *sessionID;
  }

  log::configure(log::Options{debug, std::nullopt});
  paths::setRoot(root ? std::filesystem::path(*root) : paths::defaultRoot());
  try {
    if (chosen == identifier) {
      out << json::serialize(Value(Dictionary{{"identifier", Zerith::getPersistentIdentifierForDNU(dnu)}, {"dnu", dnu}}))
          << '\n';
      return 0;
    }
    if (chosen == version) {
      out << json::serialize(Value(Dictionary{{"version", Zerith::frameworkVersion()},
                                              {"publicKey", Zerith::publicKeyPath().string()}}))
          << '\n';
      return 0;
    }
    if (chosen == entitlements) {
      return runEntitlements(user, out, err);
    }
    if (chosen == spool) {
      return runSpool(spoolJson, out, err);
    }
    if (chosen == status) {
      return runStatus(socket ? std::filesystem::path(*socket) : Zerith::defaultSocketPath(),
                       std::chrono::milliseconds(timeoutMs), statusJson, out, err);
    }
    if (chosen == sessions) {
      const auto path = socket ? std::filesystem::path(*socket) : Zerith::defaultSocketPath();
      if (!script) {
        return runSessions(std::cin, path, std::chrono::milliseconds(timeoutMs), out, err);
      }
      std::ifstream file(*script);
      if (!file) {
        return usage("cannot read the script " + *script);
      }
      return runSessions(file, path, std::chrono::milliseconds(timeoutMs), out, err);
    }
    Runner runner(out, std::move(o), std::chrono::milliseconds(timeoutMs));
    return runner.run(socket ? std::filesystem::path(*socket) : Zerith::defaultSocketPath());
  } catch (const Failure& f) {
    err << "zerith: " << f.what() << '\n';
    return f.code;
  }
}

}  // namespace zerith::cli
