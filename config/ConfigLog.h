#pragma once

// The configuration subsystem's logger, shared by its sources.

#include "platform/Log.h"

namespace zerith {

inline const log::Logger& configLogger() {
  // Never destroyed: pool threads may still log while the process exits.
  static const auto* logger = new log::Logger("config");
  return *logger;
}

}  // namespace zerith
