#include "backends/EnergyLog.h"
#include "backends/BackendsLog.h"

#include <fcntl.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <system_error>

#include "platform/FileUtil.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "platform/Paths.h"

namespace zerith::energy {

namespace {

bool writeToJournal(std::uint32_t category, std::string_view eventName, const std::string& payload) {
  const std::string name(eventName);
  const int rc = sd_journal_send("MESSAGE=Energy event %s (category %u)", name.c_str(), category,
                                 "PRIORITY=6",
                                 "ZERITH_ENERGY_CATEGORY=%u", category,
                                 "ZERITH_ENERGY_EVENT=%s", name.c_str(),
                                 "ZERITH_ENERGY_PAYLOAD=%s", payload.c_str(),
                                 nullptr);
  if (rc < 0) {
    backendsLogger().error("EnergyLog: journal refused event {}: {}", name, std::strerror(-rc));
    return false;
  }
  return true;
}

bool appendLine(const std::string& line) {
  const auto path = localLogPath();
  std::error_code ec;
  std::filesystem::create_directories(path.parent_path(), ec);
  file::UniqueFd fd(::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644));
  if (!fd) {
    backendsLogger().error("EnergyLog: cannot open {}: {}", path.string(), std::strerror(errno));
    return false;
  }
  std::string_view rest = line;
  while (!rest.empty()) {
    const ssize_t n = ::write(fd.get(), rest.data(), rest.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      backendsLogger().error("EnergyLog: cannot write to {}: {}", path.string(), std::strerror(errno));
      return false;
    }
    rest.remove_prefix(static_cast<std::size_t>(n));
  }
  return true;
}

}  // namespace

std::filesystem::path localLogPath() { return paths::resolve("/var/log/zerithd/energy.log"); }

bool logRegisteredEvent(std::uint32_t category, std::string_view eventName, const Value& payload) {
  const std::string payloadJson = json::serialize(payload);
  if (std::getenv("JOURNAL_STREAM") != nullptr && writeToJournal(category, eventName, payloadJson)) {
    return true;
  }
  const Value record(Dictionary{{"time", Value(Date::now().secondsSince1970)},
                                {"category", Value(category)},
                                {"event", Value(std::string(eventName))},
                                {"payload", payload}});
  return appendLine(json::serialize(record) + "\n");
}

}  // namespace zerith::energy
