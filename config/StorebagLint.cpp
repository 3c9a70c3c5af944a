#include "config/StorebagLint.h"

#include <algorithm>
#include <array>
#include <string_view>

#include <fmt/format.h>

#include "platform/Spelling.h"
#include "zerith/ZerithConstants.h"

namespace zerith {

namespace {

// How the daemon reads an entry.
enum class Kind { number, string, strings, numbers, any };

struct Key {
  std::string_view name;
  Kind kind;
};

// A client entry of an HTTPS backend's "clients" list.
constexpr std::array kClientKeys = {
    Key{"client", Kind::string},
    Key{"service", Kind::string},
    Key{"expedite", Kind::number},
    Key{"enabledSince", Kind::string},
    Key{"override_dnu", Kind::number},
    Key{"locale_whitelist", Kind::strings},
    Key{"device_whitelist", Kind::strings},
    Key{"device_blacklist", Kind::strings},
    Key{"filters", Kind::any},  // checked element by element
    Key{"sampling_threshold", Kind::number},
    Key{"per_country_sampling_thresholds", Kind::any},
    Key{"override_sampling", Kind::number},
    Key{"event_threshold", Kind::number},
    Key{"extras_on_internal", Kind::number},
    Key{"custom_clientId", Kind::string},
    Key{"post_url", Kind::string},
    Key{"realtime_post_url", Kind::string},
    Key{"event_whitelist", Kind::numbers},
    Key{"event_blacklist", Kind::numbers},
    Key{"use_wifi_only", Kind::number},
};
constexpr std::array kFilterKeys = {Key{"method", Kind::number}, Key{"status", Kind::number},
                                    Key{"action", Kind::string}, Key{"key", Kind::string}};
constexpr std::array kCountryThresholdKeys = {Key{"country", Kind::strings}, Key{"threshold", Kind::number}};
constexpr std::array kHttpsKeys = {Key{"clients", Kind::any}, Key{"display_url", Kind::string}};
constexpr std::array kDashboardKeys = {Key{"ip", Kind::string}, Key{"port", Kind::number},
                                       Key{"reliable", Kind::number}, Key{"display_url", Kind::string},
                                       Key{"post_url", Kind::string}};
constexpr std::array kUploadKeys = {Key{"post_url", Kind::string}, Key{"display_url", Kind::string}};
constexpr std::array<std::string_view, 4> kSections = {"development", "velmar_internal", "seed", "release"};
// The bag's own keys; the sections are here for the hints on misspelt ones.
constexpr std::array kBagKeys = {Key{"version", Kind::string},     Key{"refresh_cycle", Kind::number},
                                 Key{"issue_time", Kind::any},     Key{kSections[0], Kind::any},
                                 Key{kSections[1], Kind::any},     Key{kSections[2], Kind::any},
                                 Key{kSections[3], Kind::any}};

const char* kindText(Kind kind) {
  switch (kind) {
    case Kind::number: return "a number";
    case Kind::string: return "a string";
    case Kind::strings: return "a list of strings";
    case Kind::numbers: return "a list of numbers";
    case Kind::any: break;
  }
  return "anything";
}

// Whether every element of a list is of one kind (a boolean reads as the
// number 0 or 1, as the daemon reads it).
template <typename Is>
bool allElements(const Value& list, Is is) {
  const Array* a = list.array();
  return a && std::all_of(a->begin(), a->end(), is);
}

bool numberLike(const Value& v) { return v.isNumber() || v.isBool(); }

bool isOfKind(const Value& v, Kind kind) {
  switch (kind) {
    case Kind::number: return numberLike(v);
    case Kind::string: return v.isString();
    case Kind::strings: return allElements(v, [](const Value& e) { return e.isString(); });
    case Kind::numbers: return allElements(v, numberLike);
    case Kind::any: return true;
  }
  return true;
}

// " (did you mean \"x\"?)" for the known name nearest to `name`, or nothing.
template <typename Names>
std::string hint(std::string_view name, const Names& known) {
  const auto nearest = nearestSpelling(name, known);
  return nearest ? fmt::format(" (did you mean \"{}\"?)", *nearest) : std::string();
}

class Linter {
 public:
  std::vector<StorebagFinding> findings;

  void bag(const Value& bag) {
    if (!bag.isDict()) {
      error("", fmt::format("the bag is {}, not a dictionary: the daemon refuses it", bag.kindName()));
      return;
    }
    bool customerSection = false;
    for (const auto& [key, value] : bag.dict()->entries()) {
      if (std::find(kSections.begin(), kSections.end(), key) == kSections.end()) {
        checkEntry("", kBagKeys, key, value, "the daemon does not read it");
        continue;
      }
      if (!value.isDict()) {
        error(key, fmt::format("the section is {}, not a dictionary: devices of this environment find no section",
                               value.kindName()));
        continue;
      }
      customerSection = customerSection || key == "seed" || key == "release";
      section(key, value);
    }
    if (const Value issued = bag["issue_time"]; !issued.isNil() && !issued.isDate()) {
      error("", "\"issue_time\" is not a date: the daemon refuses the bag (zerith-storebag sign stamps it)");
    }
    if (!customerSection) {
      warning("", "no \"seed\" or \"release\" section: customer builds (seed, falling back to release) get no backend");
    }
  }

 private:
  void section(const std::string& where, const Value& section) {
    for (const auto& [name, profile] : section.dict()->entries()) {
      const std::string at = fmt::format("{}.{}", where, name);
      if (!profile.isDict()) {
        error(at, fmt::format("the profile is {}, not a dictionary: the backend is not made", profile.kindName()));
      } else if (name == kZerithBackendHTTPPost || name == kZerithBackendHTTPPost2 || name == kZerithBackendQRS) {
        https(at, profile);
      } else if (name == kZerithBackendDashboard) {
        keys(at, profile, kDashboardKeys);
        required(at, profile, "ip", "the backend is not made");
        required(at, profile, "port", "the backend is not made");
      } else if (name == kZerithBackendUploadServer) {
        keys(at, profile, kUploadKeys);
        required(at, profile, "post_url", "the backend is not made");
      } else if (name != kZerithBackendKovu && name != kZerithBackendPellamlog) {
        // The adaptor and the energy log read nothing of their profile.
        const std::array<std::string_view, 7> backends = {
            kZerithBackendHTTPPost, kZerithBackendHTTPPost2,  kZerithBackendDashboard,    kZerithBackendQRS,
            kZerithBackendKovu,     kZerithBackendPellamlog, kZerithBackendUploadServer};
        warning(at, fmt::format("no backend has this name{}: the daemon skips it", hint(name, backends)));
      }
    }
  }

  void https(const std::string& at, const Value& profile) {
    keys(at, profile, kHttpsKeys);
    const Value clients = profile["clients"];
    if (clients.isNil()) {
      error(at, "no \"clients\": the backend is not made");
      return;
    }
    if (!clients.isArray() || clients.count() == 0) {
      error(fmt::format("{}.clients", at), "not a list of client entries: the backend never reports");
      return;
    }
    for (std::size_t i = 0; i < clients.count(); ++i) {
      client(fmt::format("{}.clients[{}]", at, i), clients.at(i));
    }
  }

  void client(const std::string& at, const Value& entry) {
    if (!entry.isDict()) {
      error(at, fmt::format("the client entry is {}, not a dictionary: it matches no client", entry.kindName()));
      return;
    }
    keys(at, entry, kClientKeys);
    // A session that requires user info passes the consent, locale, device,
    // filter and sampling checks; without these three it never does.
    const char* const never = "sessions that require user info are never enabled by this entry";
    if (entry["locale_whitelist"].count() == 0) {
      error(at, fmt::format("no \"locale_whitelist\" (or an empty one): {}", never));
    }
    required(at, entry, "filters", never);
    required(at, entry, "sampling_threshold", never);
    if (entry["post_url"].isNil()) {
      warning(at, "no \"post_url\": its events have nowhere to go unless the device's defaults name one");
    }
    list(at, entry, "filters", kFilterKeys, [this](const std::string& where, const Value& filter) {
      const Value action = filter["action"];
      if (const std::string* text = action.string(); text && *text != "remove" && *text != "sha256") {
        warning(where, "\"action\" is neither \"remove\" nor \"sha256\": the filter keeps the value");
      }
      if (filter["key"].isNil()) {
        warning(where, "no \"key\": the filter applies to no entry");
      }
    });
    list(at, entry, "per_country_sampling_thresholds", kCountryThresholdKeys,
         [this](const std::string& where, const Value& element) {
           required(where, element, "threshold", "devices of these countries report as if the threshold were 0");
         });
  }

  // The elements of a list of dictionaries, each checked with `keys` and `more`.
  template <std::size_t N, typename More>
  void list(const std::string& at, const Value& entry, std::string_view name, const std::array<Key, N>& known,
            More more) {
    const Value value = entry[name];
    if (value.isNil()) {
      return;
    }
    if (!value.isArray()) {
      warning(at, fmt::format("\"{}\" is {}, not a list: the daemon ignores it", name, value.kindName()));
      return;
    }
    for (std::size_t i = 0; i < value.count(); ++i) {
      const std::string where = fmt::format("{}.{}[{}]", at, name, i);
      if (!value.at(i).isDict()) {
        warning(where, fmt::format("is {}, not a dictionary: the daemon ignores it", value.at(i).kindName()));
        continue;
      }
      keys(where, value.at(i), known);
      more(where, value.at(i));
    }
  }

  template <std::size_t N>
  void keys(const std::string& at, const Value& dict, const std::array<Key, N>& known) {
    for (const auto& [key, value] : dict.dict()->entries()) {
      checkEntry(at, known, key, value, "the daemon does not read it (a misspelt key reads as absent)");
    }
  }

  template <std::size_t N>
  void checkEntry(const std::string& at, const std::array<Key, N>& known, const std::string& key, const Value& value,
                  const char* unknown) {
    const auto found = std::find_if(known.begin(), known.end(), [&key](const Key& k) { return k.name == key; });
    if (found == known.end()) {
      std::array<std::string_view, N> names;
      std::transform(known.begin(), known.end(), names.begin(), [](const Key& k) { return k.name; });
      warning(at, fmt::format("unknown key \"{}\"{}: {}", key, hint(key, names), unknown));
    } else if (!isOfKind(value, found->kind)) {
      // A list names the first element of another kind.
      const Array* list = found->kind == Kind::strings || found->kind == Kind::numbers ? value.array() : nullptr;
      const auto other = [kind = found->kind](const Value& e) {
        return kind == Kind::strings ? !e.isString() : !numberLike(e);
      };
      warning(at, fmt::format("\"{}\" {} {}, the daemon reads {}", key, list ? "holds" : "is",
                              list ? std::find_if(list->begin(), list->end(), other)->kindName() : value.kindName(),
                              kindText(found->kind)));
    }
  }

  void required(const std::string& at, const Value& dict, std::string_view key, const std::string& otherwise) {
    if (dict[key].isNil()) {
      error(at, fmt::format("no \"{}\": {}", key, otherwise));
    }
  }

  void error(const std::string& where, std::string what) { findings.push_back({true, where, std::move(what)}); }
  void warning(const std::string& where, std::string what) { findings.push_back({false, where, std::move(what)}); }
};

}  // namespace

std::string StorebagFinding::describe() const {
  return fmt::format("{}: {}{}{}", error ? "error" : "warning", where, where.empty() ? "" : ": ", what);
}

std::vector<StorebagFinding> lintStorebag(const Value& bag) {
  Linter linter;
  linter.bag(bag);
  return std::move(linter.findings);
}

}  // namespace zerith
