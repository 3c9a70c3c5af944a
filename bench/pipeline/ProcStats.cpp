#include "bench/pipeline/ProcStats.h"

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

namespace zerith::bench {

namespace {

// The value of a "Name:   123 kB" line, 0 when absent.
std::uint64_t field(const std::string& text, const std::string& name) {
  const auto at = text.find("\n" + name + ":");
  const auto start = at == std::string::npos ? (text.rfind(name + ":", 0) == 0 ? 0 : std::string::npos) : at + 1;
  if (start == std::string::npos) {
    return 0;
  }
  return std::strtoull(text.c_str() + start + name.size() + 1, nullptr, 10);
}

std::optional<std::string> slurp(const std::filesystem::path& path) {
  std::ifstream in(path);
  if (!in) {
    return std::nullopt;
  }
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

}  // namespace

std::optional<ProcSample> sampleProcess(pid_t pid) {
  const std::filesystem::path dir = "/proc/" + std::to_string(pid);
  const auto stat = slurp(dir / "stat");
  const auto status = slurp(dir / "status");
  const auto smaps = slurp(dir / "smaps_rollup");
  if (!stat || !status || !smaps) {
    return std::nullopt;
  }
  // Fields after the command's closing parenthesis: state is field 3,
  // utime 14 and stime 15.
  const auto close = stat->rfind(')');
  if (close == std::string::npos) {
    return std::nullopt;
  }
  std::istringstream fields(stat->substr(close + 2));
  std::string f;
  unsigned long long utime = 0;
  unsigned long long stime = 0;
  for (int index = 3; index <= 15 && fields >> f; ++index) {
    if (index == 14) {
      utime = std::stoull(f);
    } else if (index == 15) {
      stime = std::stoull(f);
    }
  }
  ProcSample s;
  s.cpuSeconds = static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
  s.peakRssKiB = field(*status, "VmHWM");
  s.rssKiB = field(*status, "VmRSS");
  s.privateRssKiB = field(*smaps, "Private_Clean") + field(*smaps, "Private_Dirty");
  std::error_code ec;
  for (const auto& task : std::filesystem::directory_iterator(dir / "task", ec)) {
    ++s.threads;
    if (const auto t = slurp(task.path() / "status")) {
      s.voluntarySwitches += field(*t, "voluntary_ctxt_switches");
      s.involuntarySwitches += field(*t, "nonvoluntary_ctxt_switches");
    }
  }
  return s;
}

}  // namespace zerith::bench
