#pragma once

// The backends subsystem's logger, shared by its sources.

#include "platform/Log.h"

namespace zerith {

inline const log::Logger& backendsLogger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* logger = new log::Logger("backends");
  return *logger;
}

}  // namespace zerith
