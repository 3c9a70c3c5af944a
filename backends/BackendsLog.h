#pragma once

// The backends subsystem's logger, shared by its sources.

#include "platform/Log.h"

namespace zerith {

inline const log::Logger& backendsLogger() {
  static const log::Logger logger("backends");
  return logger;
}

}  // namespace zerith
