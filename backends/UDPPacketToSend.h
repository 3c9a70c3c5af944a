#pragma once

// One datagram kept by the dashboard backend for retransmission: a copy of
// its bytes, its event number and where it stands in the back-off schedule.
// Touched only on the backend's network queue.

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/Value.h"

namespace zerith {

class UDPPacketToSend {
 public:
  // States.
  static constexpr int kNotSentWhole = 0;
  static constexpr int kAwaitingAcknowledgement = 1;

  UDPPacketToSend(std::span<const std::uint8_t> bytes, std::uint16_t eventNum);

  int state() const { return state_; }
  void setState(int v) { state_ = v; }
  int numberOfChecks() const { return numberOfChecks_; }
  void setNumberOfChecks(int v) { numberOfChecks_ = v; }
  int numberOfRetransmits() const { return numberOfRetransmits_; }
  void setNumberOfRetransmits(int v) { numberOfRetransmits_ = v; }
  std::uint16_t eventNumber() const { return eventNumber_; }
  void setEventNumber(std::uint16_t v) { eventNumber_ = v; }
  const Data& data() const { return data_; }
  void setData(Data v) { data_ = std::move(v); }

 private:
  int state_ = kNotSentWhole;
  int numberOfChecks_ = 0;
  int numberOfRetransmits_ = 0;
  std::uint16_t eventNumber_ = 0;
  Data data_;
};

}  // namespace zerith
