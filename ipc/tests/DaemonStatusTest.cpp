// The status reply of `zerith status`: written by the daemon, read back by
// the tool through the checked parser, which refuses every element that
// does not fit before anything uses it.

#include <gtest/gtest.h>

#include <string>

#include "ipc/DaemonStatus.h"
#include "ipc/Frame.h"

namespace zerith::ipc {
namespace {

DaemonStatus sample() {
  DaemonStatus status;
  status.sessions.push_back(SessionStatus{
      12, "c2Vzc2lvbg==", 7,
      {BackendStatus{"httpsPost", 2, {{"sent", 3}, {"droppedFiltered", 1}}}, BackendStatus{"dashboard", 1, {}}}});
  status.sessions.push_back(SessionStatus{UINT32_MAX, "", -1, {}});
  status.ended.push_back(EndedTotals{7, "httpsPost", 4, {{"sent", INT64_MAX}, {"aCountOfLaterDaemons", 2}}});
  return status;
}

// `sample()` as written, with one element replaced by `change`.
Value changed(const std::function<void(Dictionary&)>& change) {
  Dictionary top = sample().toValue().dictCopy();
  change(top);
  return Value(std::move(top));
}

// `sample()` with one entry of its first session set to `value`.
Value sessionWith(const char* key, Value value) {
  return changed([&](Dictionary& top) {
    Array sessions = top.get("sessions").arrayCopy();
    Dictionary session = sessions[0].dictCopy();
    session.set(key, std::move(value));
    sessions[0] = Value(std::move(session));
    top.set("sessions", Value(std::move(sessions)));
  });
}

// `sample()` whose first session has the one backend `backend`.
Value backendWith(Dictionary backend) { return sessionWith("backends", Value(Array{Value(std::move(backend))})); }

// `sample()` with the one ended total `totals`.
Value endedWith(Dictionary totals) {
  return changed([&](Dictionary& top) { top.set("ended", Value(Array{Value(std::move(totals))})); });
}

TEST(DaemonStatusTest, WhatTheDaemonWritesReadsBackThroughAFrameUnchanged) {
  const Value written = sample().toValue();
  const Data frame = encodeReply(3, Dictionary{{kStatusArgument, written}});
  const auto message = decodeMessage(plist::Bytes(frame.data() + kFrameHeaderBytes, frame.size() - kFrameHeaderBytes));
  ASSERT_TRUE(message);
  std::string why;
  const auto read = DaemonStatus::fromValue(message->replyArgs.get(kStatusArgument), &why);
  ASSERT_TRUE(read) << why;
  EXPECT_EQ(read->toValue(), written);
  ASSERT_EQ(read->sessions.size(), 2u);
  EXPECT_EQ(read->sessions[0].backends[0].name, "httpsPost");
  EXPECT_EQ(countOf(read->sessions[0].backends[0].counts, "droppedFiltered"), 1u);
  EXPECT_EQ(countOf(read->sessions[0].backends[0].counts, "batched"), 0u);  // absent reads as 0
  EXPECT_EQ(read->sessions[1].sessionID, UINT32_MAX);
  EXPECT_EQ(read->sessions[1].clientType, -1);
  // Counts this side does not know are kept; the largest count the wire
  // carries survives.
  EXPECT_EQ(countOf(read->ended[0].counts, "aCountOfLaterDaemons"), 2u);
  EXPECT_EQ(countOf(read->ended[0].counts, "sent"), static_cast<std::uint64_t>(INT64_MAX));

  // The daemon never writes more than the wire carries.
  DaemonStatus huge;
  huge.ended.push_back(EndedTotals{1, "b", UINT64_MAX, {{"sent", UINT64_MAX}}});
  const auto clamped = DaemonStatus::fromValue(huge.toValue());
  ASSERT_TRUE(clamped);
  EXPECT_EQ(countOf(clamped->ended[0].counts, "sent"), static_cast<std::uint64_t>(INT64_MAX));

  const auto empty = DaemonStatus::fromValue(DaemonStatus{}.toValue());
  EXPECT_TRUE(empty && empty->sessions.empty() && empty->ended.empty());
}

TEST(DaemonStatusTest, ElementsOfTheWrongShapeAreRefusedWithWhereAndWhy) {
  struct Case {
    const char* what;
    Value status;
    const char* why;
  };
  const std::string longName(kStatusMaxNameBytes + 1, 'x');
  Dictionary manyCounts;
  for (std::size_t i = 0; i <= kStatusMaxCounts; ++i) {
    manyCounts.set("c" + std::to_string(i), Value(1));
  }
  const Case cases[] = {
      {"not a dictionary", Value(Array{}), "status is an array, not a dictionary"},
      {"no sessions", changed([](Dictionary& d) { d.erase("sessions"); }), "status.sessions is missing, not an array"},
      {"ended not a list", changed([](Dictionary& d) { d.set("ended", Value("none")); }),
       "status.ended is a string, not an array"},
      {"session not a dictionary", changed([](Dictionary& d) { d.set("sessions", Value(Array{Value(1)})); }),
       "status.sessions[0] is an integer, not a dictionary"},
      {"session ID beyond 32 bits", sessionWith("sessionID", Value(1ull << 32)),
       "status.sessions[0].sessionID is 4294967296, not an integer from 0 to 4294967295"},
      {"session ID as a real", sessionWith("sessionID", Value(1.5)),
       "status.sessions[0].sessionID is 1.5, not an integer from 0 to 4294967295"},
      {"client type beyond 64 signed bits",
       sessionWith("clientType", Value(static_cast<unsigned long long>(INT64_MAX) + 1)), "not a signed 64-bit integer"},
      {"backend name too long", backendWith(Dictionary{{"name", longName}, {"state", 2}, {"counts", Dictionary{}}}),
       "status.sessions[0].backends[0].name is 257 bytes long, more than 256"},
      {"negative count", backendWith(Dictionary{{"name", "b"}, {"state", 2}, {"counts", Dictionary{{"sent", -1}}}}),
       "status.sessions[0].backends[0].counts.sent is -1, not an integer from 0 to 9223372036854775807"},
      {"count beyond what the wire carries",
       backendWith(Dictionary{{"name", "b"}, {"state", 2}, {"counts", Dictionary{{"sent", Value(1ull << 63)}}}}),
       "counts.sent is 9223372036854775808, not an integer from 0 to 9223372036854775807"},
      {"counts missing", backendWith(Dictionary{{"name", "b"}, {"state", 2}}),
       "status.sessions[0].backends[0].counts is missing"},
      {"too many counts", endedWith({{"clientType", 7}, {"backend", "b"}, {"sessions", 1}, {"counts", manyCounts}}),
       "status.ended[0].counts has 65 entries, more than 64"},
      {"ended sessions as text", endedWith({{"clientType", 7}, {"backend", "b"}, {"sessions", "1"}, {"counts", Dictionary{}}}),
       "status.ended[0].sessions is"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    std::string why;
    EXPECT_FALSE(DaemonStatus::fromValue(c.status, &why));
    EXPECT_NE(why.find(c.why), std::string::npos) << why;
  }
}

}  // namespace
}  // namespace zerith::ipc
