#pragma once

// What an operator should hear about a storebag before signing it. The
// daemon reads a bag leniently: a key it does not know, or a value of
// another type, reads as absent, and a client entry without its locale
// list never reports. Nothing of that is an error on the device, so a typo
// goes unnoticed until the events are missed. lintStorebag walks a decoded
// bag as the daemon reads it and says where such things are.
//
// An error is what makes the daemon refuse the bag, skip a backend or
// never enable a client entry; a warning is what it reads as absent or
// ignores.

#include <string>
#include <vector>

#include "platform/Value.h"

namespace zerith {

struct StorebagFinding {
  bool error = false;
  std::string where;  // "release.httpsPost.clients[0].filters[1]", "" for the bag itself
  std::string what;

  // "error: release.dashboard: no \"port\": the backend is not made"
  std::string describe() const;
};

// The findings of a decoded storebag, in the bag's order; empty when the
// daemon reads every entry as written.
std::vector<StorebagFinding> lintStorebag(const Value& bag);

}  // namespace zerith
