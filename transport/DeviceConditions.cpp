#include "transport/DeviceConditions.h"

#include <fstream>
#include <sstream>
#include <string>
#include <system_error>

#include "platform/Paths.h"

namespace zerith {

namespace fs = std::filesystem;

namespace {

std::string readWord(const fs::path& path) {
  std::ifstream in(path);
  std::string line;
  std::getline(in, line);
  while (!line.empty() && (line.back() == '\n' || line.back() == '\r' || line.back() == ' ')) {
    line.pop_back();
  }
  return line;
}

constexpr unsigned long kRouteUp = 0x0001;
constexpr unsigned long kRouteReject = 0x0200;

unsigned long hexFlags(const std::string& text) {
  try {
    return std::stoul(text, nullptr, 16);
  } catch (const std::exception&) {
    return 0;
  }
}

bool ipv4DefaultRoute(std::ifstream& in) {
  std::string line;
  std::getline(in, line);  // column titles
  while (std::getline(in, line)) {
    std::istringstream fields(line);
    std::string iface, destination, gateway, flags;
    if (!(fields >> iface >> destination >> gateway >> flags)) {
      continue;
    }
    const unsigned long f = hexFlags(flags);
    if (destination == "00000000" && (f & kRouteUp) && !(f & kRouteReject)) {
      return true;
    }
  }
  return false;
}

bool ipv6DefaultRoute(std::ifstream& in) {
  std::string line;
  while (std::getline(in, line)) {
    std::istringstream fields(line);
    std::string destination, prefix, source, sourcePrefix, nextHop, metric, refs, use, flags;
    if (!(fields >> destination >> prefix >> source >> sourcePrefix >> nextHop >> metric >> refs >> use >> flags)) {
      continue;
    }
    const unsigned long f = hexFlags(flags);
    if (destination == std::string(32, '0') && prefix == "00" && (f & kRouteUp) && !(f & kRouteReject)) {
      return true;
    }
  }
  return false;
}

}  // namespace

bool onBatteryPower(const fs::path& folder) {
  std::error_code ec;
  bool battery = false;
  bool external = false;
  for (fs::directory_iterator it(folder, ec), end; !ec && it != end; it.increment(ec)) {
    const fs::path supply = it->path();
    const std::string type = readWord(supply / "type");
    if (type == "Battery") {
      if (readWord(supply / "scope") == "Device" || readWord(supply / "present") == "0") {
        continue;  // a mouse's or a removed battery
      }
      const std::string status = readWord(supply / "status");
      if (status == "Charging" || status == "Full" || status == "Not charging") {
        external = true;  // a charger is plugged in even if no mains entry says so
      } else {
        battery = true;
      }
    } else if (!type.empty() && readWord(supply / "online") == "1") {
      external = true;
    }
  }
  return battery && !external;
}

bool onBatteryPower() { return onBatteryPower(paths::resolve("/sys/class/power_supply")); }

bool hasDefaultRoute() {
  std::ifstream v4("/proc/net/route");
  std::ifstream v6("/proc/net/ipv6_route");
  if (!v4 && !v6) {
    return true;  // no routing tables to read: never wait on a guess
  }
  return (v4 && ipv4DefaultRoute(v4)) || (v6 && ipv6DefaultRoute(v6));
}

}  // namespace zerith
