// Each manual page lists exactly the options and commands its executable
// accepts: the options on the page's option lines (those starting "*-") and
// its "## command" headings against the executable's --help, and the --help
// of every command it names.

#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <regex>
#include <set>
#include <sstream>
#include <string>

namespace zerith::packaging::test {
namespace {

struct Page {
  const char* name;        // the row's name
  const char* executable;  // in the build tree
  const char* source;      // in man/
};

struct Listed {
  std::set<std::string> options;
  std::set<std::string> commands;
};

std::string helpOf(const std::string& command) {
  std::string out;
  FILE* pipe = ::popen(("timeout 20 " + command + " --help 2>&1").c_str(), "r");
  if (pipe == nullptr) {
    return out;
  }
  char buffer[4096];
  for (std::size_t n; (n = std::fread(buffer, 1, sizeof(buffer), pipe)) > 0;) {
    out.append(buffer, n);
  }
  ::pclose(pipe);
  return out;
}

// Options at the start of --help's option lines ("  -h,--help  ...",
// "  --root TEXT ..."), and the commands under "Subcommands:" with theirs.
Listed fromHelp(const std::string& executable) {
  static const std::regex option(R"(^\s+(?:-\w,)?(--[a-z0-9][a-z0-9-]*))");
  static const std::regex command(R"(^  ([a-z][a-z0-9-]*)\s)");
  Listed listed;
  std::istringstream lines(helpOf(executable));
  bool inCommands = false;
  for (std::string line; std::getline(lines, line);) {
    std::smatch m;
    if (line.rfind("Subcommands:", 0) == 0) {
      inCommands = true;
    } else if (line.empty()) {
      inCommands = false;
    } else if (inCommands && std::regex_search(line, m, command)) {
      listed.commands.insert(m[1]);
    } else if (!inCommands && std::regex_search(line, m, option)) {
      listed.options.insert(m[1]);
    }
  }
  for (const std::string& c : listed.commands) {
    const Listed sub = fromHelp(executable + " " + c);
    listed.options.insert(sub.options.begin(), sub.options.end());
  }
  return listed;
}

Listed fromPage(const std::string& path) {
  static const std::regex option(R"(--[a-z0-9][a-z0-9-]*)");
  Listed listed;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("*-", 0) == 0) {
      for (std::sregex_iterator it(line.begin(), line.end(), option), end; it != end; ++it) {
        listed.options.insert(it->str());
      }
    } else if (line.rfind("## ", 0) == 0) {
      listed.commands.insert(line.substr(3));
    }
  }
  return listed;
}

class ManPage : public ::testing::TestWithParam<Page> {};

TEST_P(ManPage, ListsWhatTheExecutableAccepts) {
  const Page& page = GetParam();
  const Listed help = fromHelp(std::string(ZERITH_TREE_BUILD) + "/" + page.executable);
  const Listed man = fromPage(std::string(ZERITH_TREE_SOURCE) + "/man/" + page.source);
  ASSERT_TRUE(help.options.contains("--help")) << page.executable << " printed no usable --help";
  EXPECT_EQ(man.options, help.options) << "options of man/" << page.source;
  EXPECT_EQ(man.commands, help.commands) << "commands of man/" << page.source;
}

INSTANTIATE_TEST_SUITE_P(
    Executables, ManPage,
    ::testing::Values(Page{"zerithd", "daemon/zerithd", "zerithd.8.scd"},
                      Page{"zerith", "tools/zerith/zerith", "zerith.1.scd"},
                      Page{"zerith_defaults", "tools/zerith-defaults/zerith-defaults", "zerith-defaults.1.scd"},
                      Page{"zerith_storebag", "tools/zerith-storebag/zerith-storebag", "zerith-storebag.1.scd"},
                      Page{"zerith_collector", "tools/zerith-collector/zerith-collector", "zerith-collector.1.scd"},
                      Page{"zerith_dashboard", "tools/zerith-dashboard/zerith-dashboard", "zerith-dashboard.1.scd"}),
    [](const ::testing::TestParamInfo<Page>& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace zerith::packaging::test
