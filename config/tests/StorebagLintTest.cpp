// The operator's lint of a storebag: a bag that sets every key the daemon
// reads, each with its type, draws no finding; each way a bag goes wrong
// draws its one line, an error where the daemon refuses the bag, skips the
// backend or never enables the entry, a warning where it reads as absent.

#include <gtest/gtest.h>

#include "config/StorebagLint.h"

namespace zerith::test {
namespace {

Array strings(std::initializer_list<const char*> items) {
  Array a;
  for (const char* item : items) {
    a.push_back(Value(item));
  }
  return a;
}

// A client entry with every key the HTTPS backends read.
Dictionary fullClient() {
  return Dictionary{
      {"client", "demo"},
      {"service", "cli"},
      {"expedite", 0},
      {"enabledSince", "8.0"},
      {"override_dnu", 1},
      {"locale_whitelist", strings({"GB", "DE"})},
      {"device_whitelist", strings({"Board"})},
      {"device_blacklist", strings({"Board1,1"})},
      {"filters", Array{Value(Dictionary{{"method", 3}, {"status", -1}, {"action", "sha256"}, {"key", "udid"}})}},
      {"sampling_threshold", 0.5},
      {"per_country_sampling_thresholds", Array{Value(Dictionary{{"country", strings({"DE"})}, {"threshold", 1.0}})}},
      {"override_sampling", 0.9},
      {"event_threshold", 10},
      {"extras_on_internal", true},
      {"custom_clientId", "abc"},
      {"post_url", "https://collector.example/post"},
      {"realtime_post_url", "https://collector.example/now"},
      {"event_whitelist", Array{Value(1), Value(2)}},
      {"event_blacklist", Array{Value(9)}},
      {"use_wifi_only", 0},
  };
}

Dictionary fullSection() {
  return Dictionary{
      {"httpsPost", Dictionary{{"clients", Array{Value(fullClient())}}, {"display_url", "https://d.example/"}}},
      {"httpsPost2", Dictionary{{"clients", Array{Value(fullClient())}}}},
      {"qrs", Dictionary{{"clients", Array{Value(fullClient())}}}},
      {"dashboard", Dictionary{{"ip", "127.0.0.1"}, {"port", 9000}, {"reliable", 500}, {"display_url", "x"},
                               {"post_url", "https://d.example/log"}}},
      {"uploadServer", Dictionary{{"post_url", "https://u.example/"}, {"display_url", "y"}}},
      {"kovu", Dictionary{{"active", true}}},
      {"pellamlog", Dictionary{}},
  };
}

Dictionary fullBag() {
  return Dictionary{{"version", "8.1.0"},   {"refresh_cycle", 3600},      {"issue_time", Date{8e8}},
                    {"seed", fullSection()}, {"release", fullSection()}, {"development", fullSection()},
                    {"velmar_internal", Dictionary{}}};
}

std::vector<std::string> described(const Value& bag) {
  std::vector<std::string> lines;
  for (const auto& finding : lintStorebag(bag)) {
    lines.push_back(finding.describe());
  }
  return lines;
}

TEST(StorebagLintTest, ABagThatSetsEveryKeyTheDaemonReadsDrawsNoFinding) {
  EXPECT_EQ(described(Value(fullBag())), std::vector<std::string>{});
}

using Change = std::function<void(Dictionary&)>;

// `change` applied to the full bag, and what the lint says of it.
struct Row {
  const char* name;
  Change change;
  std::vector<std::string> expected;
};

// `edit` made to the release section of a bag.
Change inSection(Change edit) {
  return [edit](Dictionary& bag) {
    Dictionary section = bag.get("release").dictCopy();
    edit(section);
    bag.set("release", std::move(section));
  };
}

// `edit` made to the first client entry of the release section's httpsPost backend.
Change inClient(Change edit) {
  return inSection([edit](Dictionary& section) {
    Dictionary https = section.get("httpsPost").dictCopy();
    Dictionary client = https.get("clients").at(0).dictCopy();
    edit(client);
    https.set("clients", Array{Value(std::move(client))});
    section.set("httpsPost", std::move(https));
  });
}

TEST(StorebagLintTest, EachMistakeIsNamedWhereItIs) {
  const std::string client = "release.httpsPost.clients[0]";
  const Row rows[] = {
      {"misspelt client key",
       inClient([](Dictionary& c) {
         c.erase("sampling_threshold");
         c.set("sampling_treshold", 1.0);
       }),
       {"warning: " + client +
            ": unknown key \"sampling_treshold\" (did you mean \"sampling_threshold\"?): the daemon does not read it "
            "(a misspelt key reads as absent)",
        "error: " + client + ": no \"sampling_threshold\": sessions that require user info are never enabled by "
                             "this entry"}},
      {"empty locale list",
       inClient([](Dictionary& c) { c.set("locale_whitelist", Array{}); }),
       {"error: " + client + ": no \"locale_whitelist\" (or an empty one): sessions that require user info are never "
                             "enabled by this entry"}},
      {"no filters, no post URL",
       inClient([](Dictionary& c) {
         c.erase("filters");
         c.erase("post_url");
       }),
       {"error: " + client + ": no \"filters\": sessions that require user info are never enabled by this entry",
        "warning: " + client + ": no \"post_url\": its events have nowhere to go unless the device's defaults name one"}},
      {"values of another type",
       inClient([](Dictionary& c) {
         c.set("event_threshold", "ten");
         c.set("post_url", 7);
         c.set("device_blacklist", Array{Value(1)});
         c.set("per_country_sampling_thresholds", "DE");
         c.set("event_whitelist", Array{Value(1), Value("2")});
       }),
       {"warning: " + client + ": \"device_blacklist\" holds an integer, the daemon reads a list of strings",
        "warning: " + client + ": \"event_threshold\" is a string, the daemon reads a number",
        "warning: " + client + ": \"post_url\" is an integer, the daemon reads a string",
        "warning: " + client + ": \"event_whitelist\" holds a string, the daemon reads a list of numbers",
        "warning: " + client + ": \"per_country_sampling_thresholds\" is a string, not a list: the daemon ignores it"}},
      {"filters and country thresholds",
       inClient([](Dictionary& c) {
         c.set("filters", Array{Value(Dictionary{{"action", "hash"}}), Value("udid")});
         c.set("per_country_sampling_thresholds", Array{Value(Dictionary{{"country", strings({"FR"})}})});
       }),
       {"warning: " + client + ".filters[0]: \"action\" is neither \"remove\" nor \"sha256\": the filter keeps the value",
        "warning: " + client + ".filters[0]: no \"key\": the filter applies to no entry",
        "warning: " + client + ".filters[1]: is a string, not a dictionary: the daemon ignores it",
        "error: " + client + ".per_country_sampling_thresholds[0]: no \"threshold\": devices of these countries "
                             "report as if the threshold were 0"}},
      {"backends that are not made",
       inSection([](Dictionary& s) {
         s.set("dashboard", Dictionary{{"ip", "10.0.0.1"}});
         s.set("uploadServer", Dictionary{});
         s.set("httpsPost2", Dictionary{{"display_url", "z"}});
         s.set("qrs", Dictionary{{"clients", Array{}}});
         s.set("httpPost", Dictionary{});
         s.set("energy", Dictionary{});
         s.set("pellamlog", "on");
         s.set("httpsPost", Dictionary{{"clients", Array{Value("demo")}}});
       }),
       {"error: release.httpsPost.clients[0]: the client entry is a string, not a dictionary: it matches no client",
        "error: release.httpsPost2: no \"clients\": the backend is not made",
        "error: release.qrs.clients: not a list of client entries: the backend never reports",
        "error: release.dashboard: no \"port\": the backend is not made",
        "error: release.uploadServer: no \"post_url\": the backend is not made",
        "error: release.pellamlog: the profile is a string, not a dictionary: the backend is not made",
        "warning: release.httpPost: no backend has this name (did you mean \"httpsPost\"?): the daemon skips it",
        "warning: release.energy: no backend has this name: the daemon skips it"}},
      {"the bag's own keys",
       [](Dictionary& bag) {
         bag.set("issue_time", "yesterday");
         bag.set("refresh_cycle", Array{});
         bag.set("relase", Dictionary{});
         bag.set("development", Array{});
       },
       {"warning: \"refresh_cycle\" is an array, the daemon reads a number",
        "error: development: the section is an array, not a dictionary: devices of this environment find no section",
        "warning: unknown key \"relase\" (did you mean \"release\"?): the daemon does not read it",
        "error: \"issue_time\" is not a date: the daemon refuses the bag (zerith-storebag sign stamps it)"}},
      {"no section for customer builds",
       [](Dictionary& bag) {
         bag.erase("seed");
         bag.erase("release");
       },
       {"warning: no \"seed\" or \"release\" section: customer builds (seed, falling back to release) get no backend"}},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    Dictionary bag = fullBag();
    row.change(bag);
    EXPECT_EQ(described(Value(std::move(bag))), row.expected);
  }
  EXPECT_EQ(described(Value(strings({"seed"}))),
            std::vector<std::string>{"error: the bag is an array, not a dictionary: the daemon refuses it"});
}

}  // namespace
}  // namespace zerith::test
