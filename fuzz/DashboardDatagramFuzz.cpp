// libFuzzer target: bytes that arrive on a dashboard socket, read both as a
// datagram (the receiver's decoding, the local log line) and as an
// acknowledgement. Beyond not crashing: a datagram that decodes encodes back
// to the same bytes outside the identifier field, the log line stays in its
// area, and an acknowledgement is read only from 62 to 1,088 bytes.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>

#include "backends/DashboardDatagram.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace zerith::dashboard;
  const std::span<const std::uint8_t> bytes(data, size);

  const auto ack = acknowledgedEventNumber(bytes, false);
  if (ack.has_value() != (size >= kMinAcknowledgement && size <= kMaxDatagram)) {
    std::abort();
  }
  if (ack && *ack != ((data[60] << 8) | data[61])) {
    std::abort();
  }
  if (acknowledgedEventNumber(bytes, true)) {
    std::abort();
  }

  const auto line = localLogLine(bytes);
  if (line.has_value() != (size >= kHeaderSize) || (line && line->size() >= kLogLineArea)) {
    std::abort();
  }

  const auto d = decode(bytes);
  if (!d) {
    return 0;
  }
  if (d->length != size || d->text.size() + kHeaderSize != size) {
    std::abort();
  }
  Header h;
  h.selfVersionMajor = d->selfVersionMajor;
  h.senderIndex = d->senderIndex;
  h.seconds = d->seconds;
  h.microseconds = d->milliseconds * 1000;
  h.sessionID = d->sessionID;
  h.clientVersion = d->clientVersion;
  h.method = d->method;
  h.respCode = d->respCode;
  h.eventNumber = d->eventNumber;
  h.flags = d->flags;
  const auto again = encode(h, d->text);
  if (again.size() != size) {
    std::abort();
  }
  for (std::size_t i = 0; i < size; ++i) {
    const bool identifier = i >= 20 && i < 60;
    // Byte 2 is the constant 1 the encoder always writes.
    if (!identifier && i != 2 && again[i] != data[i]) {
      std::abort();
    }
  }
  return 0;
}
