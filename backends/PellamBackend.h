#pragma once

// The energy-log backend: writes events to the energy log (EnergyLog.h) as
// registered events of category 28 named "Hollond-ZTH".
//
// Its write is the five-argument send with an event number. The class does
// not override the six-argument send through which the base class
// dispatches, so a session's events reach the base's send, which writes
// nothing: the energy-log write is reached only by a caller that holds a
// PellamBackend as such. This pairing is intended and kept.

#include "backends/ZerithBackend.h"

namespace zerith {

inline constexpr std::uint32_t kPellamAgentCategory = 28;
inline constexpr char kPellamEventName[] = "Hollond-ZTH";

class PellamBackend : public ZerithBackend {
 public:
  using ZerithBackend::ZerithBackend;
  using ZerithBackend::sendMessage;

  // Nothing for method 0 or an empty event; otherwise the event with
  // "method", "respCode" and "event" (the event number) set over any payload
  // entries of those names. Returns nil.
  std::optional<std::string> sendMessage(const Value& message, const timeval& timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID);
};

}  // namespace zerith
