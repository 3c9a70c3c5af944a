#pragma once

// A tool that prints JSON lines (zerith-collector, zerith-dashboard) as a
// child process of a test, its lines read from a pipe: ready once it says
// on standard error where it listens, each line waited for with a deadline,
// and the rest read to the end once it stops.
//
//   test::CollectorProcess collector(ZERITH_COLLECTOR_TOOL, {"--generate-cert", dir, "--status", "503"});
//   auto line = collector.nextLine("record");

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tests/support/Command.h"

namespace zerith::test {

// Whether `line` has every member of the JSON object `expected` with its
// value, members that are objects on both sides compared the same way (it
// may have others).
inline ::testing::AssertionResult hasMembers(const nlohmann::ordered_json& line, std::string_view expected) {
  nlohmann::ordered_json merged = line;
  merged.merge_patch(nlohmann::ordered_json::parse(expected.begin(), expected.end()));
  if (merged == line) {
    return ::testing::AssertionSuccess();
  }
  return ::testing::AssertionFailure() << line.dump() << " differs from " << expected;
}

class CollectorProcess {
 public:
  CollectorProcess(const std::string& tool, std::vector<std::string> args) {
    int out[2];
    int err[2];
    if (::pipe2(out, O_CLOEXEC) != 0 || ::pipe2(err, O_CLOEXEC) != 0) {
      return;
    }
    out_.reset(out[0]);
    err_.reset(err[0]);
    args.insert(args.begin(), tool);
    {
      // Only the child keeps the writing ends: its end is our end of file.
      const file::UniqueFd outWrite(out[1]);
      const file::UniqueFd errWrite(err[1]);
      child_ = std::make_unique<ChildProcess>(args, std::vector<std::pair<int, int>>{{out[1], 1}, {err[1], 2}});
    }
    // Ready once it says where it listens.
    while (said_.find("listening on ") == std::string::npos || said_.back() != '\n') {
      if (!readSome(err_.get(), said_)) {
        break;
      }
    }
    const auto at = said_.rfind(':');
    port_ = at == std::string::npos ? 0 : std::atoi(said_.c_str() + at + 1);
  }
  ~CollectorProcess() {
    if (child_) {
      child_->stop(std::chrono::seconds(5));
    }
  }
  CollectorProcess(const CollectorProcess&) = delete;
  CollectorProcess& operator=(const CollectorProcess&) = delete;

  int port() const { return port_; }
  // What it wrote to standard error so far (for failure messages).
  const std::string& said() const { return said_; }
  std::string url(const std::string& path) const { return "https://127.0.0.1:" + std::to_string(port_) + path; }

  // The next JSON line (of this "kind" when given; others are skipped), or
  // nullopt after `timeout` or at the end of its output.
  std::optional<nlohmann::ordered_json> nextLine(const std::string& kind = {},
                                                 std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    while (true) {
      const auto newline = pending_.find('\n');
      if (newline != std::string::npos) {
        const std::string line = pending_.substr(0, newline);
        pending_.erase(0, newline + 1);
        auto json = nlohmann::ordered_json::parse(line, nullptr, false);
        if (kind.empty() || (json.is_object() && json.value("kind", "") == kind)) {
          return json;
        }
        continue;
      }
      if (!readSome(out_.get(), pending_, timeout)) {
        return std::nullopt;
      }
    }
  }

 private:
  static bool readSome(int fd, std::string& into, std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    pollfd p{fd, POLLIN, 0};
    if (fd < 0 || ::poll(&p, 1, static_cast<int>(timeout.count())) <= 0) {
      return false;
    }
    char buffer[65536];
    const ssize_t n = ::read(fd, buffer, sizeof(buffer));
    if (n <= 0) {
      return false;
    }
    into.append(buffer, static_cast<std::size_t>(n));
    return true;
  }

  std::unique_ptr<ChildProcess> child_;
  file::UniqueFd out_;
  file::UniqueFd err_;
  int port_ = 0;
  std::string said_;
  std::string pending_;
};

}  // namespace zerith::test
