#pragma once

// The device context of sessions and backends in one include: device facts,
// identifiers and conversions. (The backend set of a session is built one
// layer up, in backends/CreateBackends.h.)

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
