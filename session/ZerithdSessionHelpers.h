#pragma once

// Small helpers the session's source files share: internal to the session,
// not part of its interface.

#include <mutex>
#include <set>
#include <string>

#include "platform/Log.h"
#include "platform/Value.h"

namespace zerith::session_detail {

inline const log::Logger& logger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* l = new log::Logger("session");
  return *l;
}

inline Value textOrUnknown(const Value& v) { return v.string() ? v : Value("Unknown"); }

// Backends keep the device identifier as a pointer they do not own, and a
// backend may outlive its session (a flush completion holds it; a one-shot
// backend may still be posting). Every backend therefore gets a copy that
// lives as long as the process; there is one per distinct identifier, in
// practice one.
inline const char* processLifetimeDeviceID(const char* deviceID) {
  static std::mutex mutex;
  static auto* interned = new std::set<std::string>();
  std::lock_guard lock(mutex);
  return interned->insert(deviceID).first->c_str();
}

}  // namespace zerith::session_detail
