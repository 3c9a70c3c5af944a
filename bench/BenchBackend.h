#pragma once

// The HTTPS post backend as the benchmarks make it: the product facts of a
// board, a session, batching and a user info dictionary, consent given.
// `client` is the storebag's client entry (post URL, threshold, filters).

#include <sys/time.h>

#include <memory>
#include <string>

#include "backends/HTTPSPostBackend.h"
#include "config/DeviceInfo.h"
#include "platform/Defaults.h"

namespace zerith::bench {

inline std::shared_ptr<HTTPSPostBackend> makeBenchBackend(const Value& client) {
  Defaults(kConsentDefaultsDomain).setObject(kConsentDefaultsKey, Value(true));
  auto b = HTTPSPostBackend::initWithName("httpsPost", Value(Dictionary{{"clients", Array{client}}}), std::string("Bench"));
  b->setCompType(7);
  b->setSessionID(1234);
  b->setClientVersion(3);
  b->setProductVersion("12.4");
  b->setBuildVersion("Z1234");
  b->setHardwareType("Board9,1");
  b->setSelfVersion("8.1.0");
  b->setBatchEvents(true);
  b->setUserInfoDict(Value(Dictionary{{"clientName", "demo"}, {"serviceName", "cli"}}));
  timeval start{};
  gettimeofday(&start, nullptr);
  b->setStartTimestamp(start);
  return b;
}

}  // namespace zerith::bench
