#pragma once

// The configuration subsystem's logger, shared by its sources.

#include "platform/Log.h"

namespace zerith {

inline const log::Logger& configLogger() {
  static const log::Logger logger("config");
  return logger;
}

}  // namespace zerith
