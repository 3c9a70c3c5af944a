// The frame codec held to libplist on the same bytes.
//
// - Bytes both accept decode to the same tree (kinds, order, integers by
//   their 64 bits, reals and dates bit for bit), but for the one known
//   difference: libplist reads the fraction of a date before 2001 with the
//   wrong sign (-3.7 s as -3 s + 0.7 s), the codec reads it as written.
// - Bytes that pass the structural check but that libplist refuses, the frame
//   codec refuses too; where the codec refuses what libplist reads, it is for
//   one of the kinds a frame never carries or for text and data shared so
//   often that the tree would outgrow the size limit.
// - What the codec's writer makes of an accepted tree, libplist reads back to
//   that tree, and so does the codec; dates to the microsecond libplist keeps
//   (the write and the read each cut a date to a whole microsecond, and a
//   date near 2^30 s holds about a tenth of a microsecond: 3 µs apart at
//   most).

#include <algorithm>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "ipc/Frame.h"
#include "platform/BinaryPlist.h"
#include "platform/PropertyList.h"

using namespace zerith;

namespace {

bool sameBits(double a, double b) { return (std::isnan(a) && std::isnan(b)) || std::memcmp(&a, &b, sizeof a) == 0; }

constexpr double kEpochOffset = 978307200.0;

// `theirs` is the date `ours` as libplist reads it, within `slack` seconds.
bool sameDate(double ours, double theirs, double slack) {
  const double rel = ours - kEpochOffset;
  if (rel < 0 && rel != std::trunc(rel)) {
    const double t = std::trunc(rel);
    return std::fabs(t + std::fabs(rel - t) + kEpochOffset - theirs) <= std::max(slack, 2e-6);
  }
  return slack == 0 ? sameBits(ours, theirs) : std::fabs(ours - theirs) <= slack;
}

// `a` as read by the codec, `b` as read by libplist (`libplist`) or by the
// codec too.
bool sameTree(const Value& a, const Value& b, double dateSlack, bool libplist = true) {
  const bool aInt = a.type() == Value::Type::Int || a.type() == Value::Type::UInt;
  const bool bInt = b.type() == Value::Type::Int || b.type() == Value::Type::UInt;
  if (aInt || bInt) {
    return aInt && bInt && a.unsignedValue() == b.unsignedValue();
  }
  if (a.type() != b.type()) {
    return false;
  }
  switch (a.type()) {
    case Value::Type::Real:
      return sameBits(a.doubleValue(), b.doubleValue());
    case Value::Type::Date: {
      const double x = a.date()->secondsSince1970;
      const double y = b.date()->secondsSince1970;
      if (libplist) {
        return sameDate(x, y, dateSlack);
      }
      return dateSlack == 0 ? sameBits(x, y) : std::fabs(x - y) <= dateSlack;
    }
    case Value::Type::Array: {
      const auto& x = *a.array();
      const auto& y = *b.array();
      if (x.size() != y.size()) return false;
      for (std::size_t i = 0; i < x.size(); ++i) {
        if (!sameTree(x[i], y[i], dateSlack, libplist)) return false;
      }
      return true;
    }
    case Value::Type::Dict: {
      const auto& x = a.dict()->entries();
      const auto& y = b.dict()->entries();
      if (x.size() != y.size()) return false;
      for (std::size_t i = 0; i < x.size(); ++i) {
        if (x[i].first != y[i].first || !sameTree(x[i].second, y[i].second, dateSlack, libplist)) return false;
      }
      return true;
    }
    default:
      return a == b;
  }
}

bool allUtf8(const Value& v) {
  if (const auto* s = v.string()) return bplist::validUtf8(*s);
  if (const auto* d = v.dict()) {
    for (const auto& [k, e] : *d) {
      if (!bplist::validUtf8(k) || !allUtf8(e)) return false;
    }
  } else if (const auto* a = v.array()) {
    for (const auto& e : *a) {
      if (!allUtf8(e)) return false;
    }
  }
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const plist::Bytes bytes(data, size);
  const plist::Limits limits = ipc::frameLimits();
  std::string why;
  const auto ours = bplist::decode(bytes, limits, &why);
  if (!ours && why.empty()) {
    std::abort();  // every refusal says why
  }
  // libplist only ever sees what the structural check lets through.
  const auto theirs = plist::decodeBinary(bytes, limits);
  if (ours && !theirs) {
    std::abort();
  }
  const bool frameNeverCarries = why == "frames carry no UIDs" || why == "frames carry no sets" ||
                                 why == "date out of range" || why.starts_with("text and data expand to more than");
  if (!ours && theirs && !frameNeverCarries) {
    std::abort();
  }
  if (!ours) {
    return 0;
  }
  if (!sameTree(*ours, *theirs, 0)) {
    std::abort();
  }
  // The read that refuses text not UTF-8 refuses that and nothing else (it
  // also refuses such text under a key given twice, which the tree no longer
  // shows).
  const bool utf8 = allUtf8(*ours);
  std::string strictWhy;
  const bool strict = bplist::decode(bytes, limits, &strictWhy, bplist::Text::Utf8Only).has_value();
  if ((strict && !utf8) || (!strict && strictWhy != bplist::kNotUtf8)) {
    std::abort();
  }
  if (!utf8) {
    return 0;  // the writer replaces such text; frames refuse it at the door
  }
  // Shared objects are written once per use: the size may outgrow a frame's.
  plist::Limits writtenLimits = limits;
  writtenLimits.maxBytes = SIZE_MAX;
  Data written;
  bplist::encode(*ours, written);
  const auto back = plist::decodeBinary(plist::bytesOf(written), writtenLimits);
  const auto again = bplist::decode(plist::bytesOf(written), writtenLimits);
  if (!back || !again || !sameTree(*again, *ours, 3e-6, false) || !sameTree(*again, *back, 0)) {
    std::abort();
  }
  return 0;
}
