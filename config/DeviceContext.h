#pragma once

// The device context of sessions and backends in one include: device facts,
// identifiers, conversions and the backend set of a session.

#include "config/ClientTypes.h"
#include "config/Conversions.h"
#include "config/CreateBackends.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
