#pragma once

// What the transport asks of the device before and after a transfer: is it
// on battery (discretionary transfers wait), and does it have a route out
// (a failed connection waits for the network instead of failing).

#include <filesystem>

namespace zerith {

// True when a system battery is discharging and no external supply is
// online. No battery at all means external power. Reads the power-supply
// class folder (/sys/class/power_supply, relocated under the paths root);
// peripheral batteries (scope "Device") do not count.
bool onBatteryPower();
bool onBatteryPower(const std::filesystem::path& powerSupplyFolder);

// True when the kernel has a usable IPv4 or IPv6 default route
// (/proc/net/route, /proc/net/ipv6_route; reject routes do not count).
bool hasDefaultRoute();

}  // namespace zerith
