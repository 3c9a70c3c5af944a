#include "backends/PellamBackend.h"

#include "backends/EnergyLog.h"

namespace zerith {

std::optional<std::string> PellamBackend::sendMessage(const Value& message, const timeval&, std::uint16_t method,
                                                      std::uint16_t respCode, std::uint16_t eventID) {
  if (method == 0 || message.count() == 0) {
    counters().add(BackendCount::droppedFiltered);
    return std::nullopt;
  }
  Dictionary event = message.dictCopy();
  event.set("method", Value(static_cast<unsigned>(method)));
  event.set("respCode", Value(static_cast<unsigned>(respCode)));
  event.set("event", Value(static_cast<unsigned>(eventID)));
  energy::logRegisteredEvent(kPellamAgentCategory, kPellamEventName, Value(std::move(event)));
  counters().add(BackendCount::sent);
  return std::nullopt;
}

}  // namespace zerith
