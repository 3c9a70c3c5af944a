#pragma once

// The sender code of each client type: a short code that names the sending
// component in HTTPS event records ("_sender", "X-ZTH-Sender"), in the
// datagram backend's local log lines and in the per-sender keys of health
// reports. It sits with the client types, below both of its users (the
// backends and the agent).

#include <array>
#include <cstdint>
#include <string_view>

namespace zerith {

inline constexpr std::array<std::string_view, 24> kSenderCodeTable = {
    "ZP",  "ZQ",     "ZRX",      "YB",      "YD",     "YF",       "YH",  "YJ",  //  0 -  7
    "YL",  "YN",     "YR",       "YT",      "XQRA",   "XVLEN",    "YH-QOB", "YH-FENUX",  //  8 - 15
    "XMORDAL", "XPANTO", "XKORBENT", "YV",  "YWQ",    "YX",       "YZ",  "WB",  // 16 - 23
};

// The row of the table; the caller keeps the index below 24.
constexpr std::string_view senderCode(std::uint32_t index) { return kSenderCodeTable[index]; }

// The code health reports use: client types 5 to 23 have their row, every
// other type (0 to 4 included) is "Unknown".
constexpr std::string_view healthSenderCode(std::int64_t clientType) {
  return (clientType >= 5 && clientType <= 23) ? kSenderCodeTable[static_cast<std::size_t>(clientType)]
                                               : std::string_view("Unknown");
}

}  // namespace zerith
